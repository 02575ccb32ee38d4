// The three scan calls.
#include <cstdlib>
#include <cstring>
#include <pthread.h>

#include "history/sqluhist.h"
#include "zq3.h"

#define ZQ3_EXPORT extern "C" __attribute__((visibility("default")))

// SQLCODEs of this library's own.
enum : int {
    scanNoMoreEntries = 100, // a get after the last entry
    scanNoDatabase = HISTORY_FILE_MISSING,
    scanWrongVersion = -2040,  // the version is not zq3Version
    scanWrongArgument = -2041, // a null record, or a member that has no such value
    scanUnknownHandle = -2042, // no scan is open under this handle
    scanTooManyScans = -2043,
    scanNoMemory = -2044,
};
// Result of a call that was wrong in itself.
enum : int { callFailed = -1 };

enum : size_t { maxAliasLength = 8 };

// One open scan.
struct historyScan {
    uint16_t handle;
    SQLUH_COMMITTED* history;
    uint32_t nextRow;
    const zq3HistoryData* lastRecord; // the record of the last get
    uint32_t filledSlots;             // name slots that the last get filled in it
};

// A handle is a slot's number and the number of its use, so that the handle of a closed scan does
// not pass for the scan that took its place.
enum : unsigned int { maxScans = 64 };
static historyScan* scans[maxScans];
static uint16_t lastUse[maxScans];
static pthread_mutex_t scansMutex = PTHREAD_MUTEX_INITIALIZER;

static int failCall(sqlca* ca, int sqlcode)
{
    if (ca != nullptr) {
        sqloinca(ca);
        ca->sqlcode = sqlcode;
    }
    return callFailed;
}

static int outcome(sqlca* ca, int sqlcode)
{
    sqloinca(ca);
    ca->sqlcode = sqlcode;
    return 0;
}

// --- The database --------------------------------------------------------------------------------

static bool isAliasCharacter(char c)
{
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
           (c != '\0' && strchr("_#@$", c) != nullptr);
}

// The alias in upper case; false when it is no plain name and must not become part of a path.
static bool nameOfAlias(const char* alias, char* name)
{
    size_t length = strnlen(alias, maxAliasLength + 1);
    if (length == 0 || length > maxAliasLength)
        return false;
    for (size_t i = 0; i < length; i++) {
        if (!isAliasCharacter(alias[i]))
            return false;
        name[i] =
            alias[i] >= 'a' && alias[i] <= 'z' ? static_cast<char>(alias[i] - 'a' + 'A') : alias[i];
    }
    name[length] = '\0';
    return true;
}

// Forms the directory of a database. directory holds pathCapacity bytes.
static int findDirectory(const char* alias, char* directory)
{
    char name[maxAliasLength + 1];
    if (!nameOfAlias(alias, name))
        return scanNoDatabase;
    const char* folder = getenv("ZQ3DBPATH");
    const char* separator = "/";
    if (folder == nullptr || folder[0] == '\0')
        folder = separator = "";
    int length = ossSnprintf(directory, pathCapacity, "%s%s%s/", folder, separator, name);
    return length < 0 || length > static_cast<int>(maxDirectoryLength) ? sqluhPathTooLong : 0;
}

// --- The table of scans --------------------------------------------------------------------------

static void freeScan(historyScan* scan)
{
    sqluhFreeCommitted(&scan->history);
    free(scan);
}

// Enters a scan under a handle that no scan had of late; false when the table is full.
static bool enterScan(historyScan* scan)
{
    bool entered = false;
    pthread_mutex_lock(&scansMutex);
    for (unsigned int slot = 0; slot < maxScans && !entered; slot++) {
        if (scans[slot] != nullptr)
            continue;
        lastUse[slot] = static_cast<uint16_t>((lastUse[slot] + 1) % (UINT16_MAX / maxScans));
        scan->handle = static_cast<uint16_t>((lastUse[slot] + 1) * maxScans + slot);
        scans[slot] = scan;
        entered = true;
    }
    pthread_mutex_unlock(&scansMutex);
    return entered;
}

// The open scan of a handle, taken out of the table if so asked; null when there is none.
static historyScan* findScan(uint16_t handle, bool take)
{
    pthread_mutex_lock(&scansMutex);
    historyScan* scan = scans[handle % maxScans];
    if (scan != nullptr && scan->handle != handle)
        scan = nullptr;
    if (scan != nullptr && take)
        scans[handle % maxScans] = nullptr;
    pthread_mutex_unlock(&scansMutex);
    return scan;
}

// --- The calls -----------------------------------------------------------------------------------

// Opens the scan of a directory; *scanOut is set unless the result is negative.
static int openScan(const char* directory, historyScan** scanOut)
{
    historyScan* scan = static_cast<historyScan*>(calloc(1, sizeof *scan));
    if (scan == nullptr)
        return scanNoMemory;
    int rc = sqluhReadCommitted(directory, &scan->history);
    if (rc >= 0 && !enterScan(scan))
        rc = scanTooManyScans;
    if (rc < 0)
        freeScan(scan);
    else
        *scanOut = scan;
    return rc;
}

ZQ3_EXPORT int zq3HistoryOpenScan(unsigned int version, void* openStruct, sqlca* ca)
{
    if (version != zq3Version)
        return failCall(ca, scanWrongVersion);
    zq3HistoryOpenStruct* request = static_cast<zq3HistoryOpenStruct*>(openStruct);
    // Nothing selects entries here: whoever asks for some must not be given all of them.
    if (ca == nullptr || request == nullptr || request->databaseAlias == nullptr ||
        request->timestamp != nullptr || request->objectName != nullptr ||
        request->callerAction != 0)
        return failCall(ca, scanWrongArgument);

    char directory[pathCapacity];
    historyScan* scan = nullptr;
    int rc = findDirectory(request->databaseAlias, directory);
    if (rc == 0)
        rc = openScan(directory, &scan);
    if (rc >= 0) {
        // What ended the rows early is a row of its own, which no get delivers, and must be got.
        uint32_t failed = scan->history->failure != 0;
        request->numRows = scan->history->numRows + failed;
        request->maxTablespaces = scan->history->maxTablespaces;
        if (request->maxTablespaces == 0)
            request->maxTablespaces = failed;
        request->handle = scan->handle;
    }
    return outcome(ca, rc);
}

static void clearText(textBuffer* text)
{
    text->length = 0;
    if (text->data != nullptr && text->capacity != 0)
        text->data[0] = '\0';
}

static void clearSlots(zq3HistoryData* record, uint32_t from, uint32_t to)
{
    for (uint32_t i = from; record->tablespaceBuffers != nullptr && i < to; i++)
        clearText(&record->tablespaceBuffers[i]);
}

// Empties the record but for its name slots.
static void clearRecord(zq3HistoryData* record)
{
    static constexpr textBuffer zq3HistoryData::*texts[] = {
        &zq3HistoryData::objectPart, &zq3HistoryData::secondTimestamp,
        &zq3HistoryData::firstText,  &zq3HistoryData::lastText,
        &zq3HistoryData::idText,     &zq3HistoryData::qualifierText,
        &zq3HistoryData::nameText,   &zq3HistoryData::longText,
        &zq3HistoryData::noteText,   &zq3HistoryData::commandText,
    };
    for (textBuffer zq3HistoryData::*text : texts)
        clearText(&(record->*text));
    memset(record->eyecatcher, 0, sizeof record->eyecatcher);
    memset(record->logPosition, 0, sizeof record->logPosition);
    record->entryNode = 0;
    record->entryNumber = 0;
    record->numTablespaces = 0;
    record->operation = record->object = record->operationType = record->status = '\0';
    record->auxCode = '\0';
    if (record->eventSqlca != nullptr)
        sqloinca(record->eventSqlca);
}

// Copies the next entry into the record. Of the name slots only those are emptied that the entry
// before it filled and this one does not: an entry costs its own names, not the largest entry's.
static int getNext(historyScan* scan, zq3HistoryData* record)
{
    SQLUH_ENTRY entry = {};
    uint32_t filled = record == scan->lastRecord && scan->filledSlots <= record->maxTablespaces
                          ? scan->filledSlots
                          : record->maxTablespaces;
    entry.data = record;
    int rc = sqluhGetCommitted(scan->history, scan->nextRow, &entry, false);
    if (rc < 0)
        clearRecord(record);
    else
        scan->nextRow++;
    uint32_t named = record->numTablespaces < record->maxTablespaces ? record->numTablespaces
                                                                     : record->maxTablespaces;
    clearSlots(record, named, filled);
    scan->lastRecord = record;
    scan->filledSlots = named;
    return rc == END_OF_FILE ? static_cast<int>(scanNoMoreEntries) : rc;
}

ZQ3_EXPORT int zq3HistoryGetEntry(unsigned int version, void* fetchStruct, sqlca* ca)
{
    if (version != zq3Version)
        return failCall(ca, scanWrongVersion);
    zq3HistoryFetchStruct* request = static_cast<zq3HistoryFetchStruct*>(fetchStruct);
    if (ca == nullptr || request == nullptr || request->historyRecord == nullptr ||
        request->callerAction != 2)
        return failCall(ca, scanWrongArgument);
    historyScan* scan = findScan(request->handle, false);
    if (scan == nullptr)
        return failCall(ca, scanUnknownHandle);
    return outcome(ca, getNext(scan, request->historyRecord));
}

ZQ3_EXPORT int zq3HistoryCloseScan(unsigned int version, void* handle, sqlca* ca)
{
    if (version != zq3Version)
        return failCall(ca, scanWrongVersion);
    if (ca == nullptr || handle == nullptr)
        return failCall(ca, scanWrongArgument);
    uint16_t number;
    memcpy(&number, handle, sizeof number);
    historyScan* scan = findScan(number, true);
    if (scan == nullptr)
        return failCall(ca, scanUnknownHandle);
    freeScan(scan);
    return outcome(ca, 0);
}
