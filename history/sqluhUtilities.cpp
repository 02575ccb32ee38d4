// Utilities: scan records, pieces of backup images, copies, warnings. Stands on open and close.

#include <cstring>

#include "history/sqluhDiagnostics.h"
#include "history/sqluhHandle.h"
#include "history/sqluhRecovery.h"
#include "history/sqluhfun.h"
#include "history/sqluhist.h"

// The nine texts before the command text, in the record's order, with the size of their buffers.
struct textSlot {
    textBuffer zq3HistoryData::*text;
    uint32_t capacity;
};
static constexpr textSlot textSlots[] = {
    {&zq3HistoryData::objectPart, zq3ObjectPartCapacity},
    {&zq3HistoryData::secondTimestamp, zq3SecondTimestampCapacity},
    {&zq3HistoryData::firstText, zq3LogNameCapacity},
    {&zq3HistoryData::lastText, zq3LogNameCapacity},
    {&zq3HistoryData::idText, zq3IdTextCapacity},
    {&zq3HistoryData::qualifierText, zq3QualifierTextCapacity},
    {&zq3HistoryData::nameText, zq3NameTextCapacity},
    {&zq3HistoryData::longText, zq3LongTextCapacity},
    {&zq3HistoryData::noteText, zq3NoteTextCapacity},
};

static constexpr size_t lengthOfTextSlots(void)
{
    size_t length = 0;
    for (const textSlot& slot : textSlots)
        length += slot.capacity;
    return length;
}

// The records come first and every one of them is a multiple of its own alignment, so that the
// array after the sqlca is aligned and the bytes at the end need no gaps.
static_assert(sizeof(sqlca) % alignof(textBuffer) == 0);
static_assert(sizeof(zq3HistoryData) % alignof(sqlca) == 0);

static char* slotAt(textBuffer* text, char* at, uint32_t capacity)
{
    text->data = at;
    text->capacity = capacity;
    return at + capacity;
}

static void layOutHistoryData(zq3HistoryData* data, unsigned int numTablespaces,
                              uint64_t commandCapacity)
{
    char* at = reinterpret_cast<char*>(data + 1);
    data->eventSqlca = reinterpret_cast<sqlca*>(at);
    at += sizeof(sqlca);
    data->maxTablespaces = numTablespaces;
    if (numTablespaces != 0) {
        data->tablespaceBuffers = reinterpret_cast<textBuffer*>(at);
        at += numTablespaces * sizeof(textBuffer);
    }
    for (unsigned int i = 0; i < numTablespaces; i++)
        at = slotAt(&data->tablespaceBuffers[i], at, zq3TablespaceNameCapacity);
    for (const textSlot& slot : textSlots)
        at = slotAt(&(data->*slot.text), at, slot.capacity);
    if (commandCapacity != 0)
        slotAt(&data->commandText, at, static_cast<uint32_t>(commandCapacity));
}

int sqluhAllocateHistoryData(zq3HistoryData** dataOut, SMemPool* pool, unsigned int numTablespaces,
                             bool withCommandText, unsigned int commandTextLength)
{
    pdtEntry();

    void* block = nullptr;
    uint64_t commandCapacity = withCommandText ? uint64_t{commandTextLength} + 1 : 0;
    uint64_t size = sizeof(zq3HistoryData) + sizeof(sqlca) +
                    uint64_t{numTablespaces} * (sizeof(textBuffer) + zq3TablespaceNameCapacity) +
                    lengthOfTextSlots() + commandCapacity;
    // A size or a capacity that wraps would make a block smaller than what is laid out in it.
    bool fits = commandCapacity <= UINT32_MAX && size <= SIZE_MAX / 2;
    int rc = logged(sqlogmblkEx(pool, fits ? static_cast<size_t>(size) : SIZE_MAX, sqloZeroFilled,
                                &block, __FILE__, __LINE__, 0));
    if (rc == 0) {
        zq3HistoryData* data = static_cast<zq3HistoryData*>(block);
        layOutHistoryData(data, numTablespaces, commandCapacity);
        *dataOut = data;
    }

    pdtExit(rc);
    return rc;
}

void sqluhFreeHistoryData(zq3HistoryData** data)
{
    pdtEntry();

    if (*data != nullptr)
        sqlofmblkEx(*data);
    *data = nullptr;

    pdtExit(0);
}

int sqluh_fill_backup_buffer(SQLUH_HANDLE* handle, unsigned int offset, unsigned int bufferSize,
                             unsigned char* buffer, unsigned int* bytesRead)
{
    pdtEntry();

    int rc = sqlochgfileptr(handle->fileHandle, offset, sqloFromStart, nullptr);
    if (rc == 0)
        rc = sqloread(handle->fileHandle, buffer, bufferSize, bytesRead);
    if (rc == END_OF_FILE)
        rc = 0;

    pdtExit(logged(rc));
    return rc;
}

static int closeToReplace(SQLUH_HANDLE* handle)
{
    int rc = sqloclose(handle->fileHandle);
    handle->fileHandle = sqloNoFile;
    return rc;
}

static int openToReplace(SQLUH_HANDLE* handle, unsigned int option)
{
    int rc =
        createdCode(sqloopenp(handle->historyPath, option, sqloPermissions, &handle->fileHandle));
    if (rc != 0)
        handle->fileHandle = sqloNoFile;
    return rc;
}

// Puts an empty file in the place of the history file, which is marked until the image is whole.
static int replaceHistoryFile(SQLUH_HANDLE* handle, const char* operation)
{
    handle->restoreCode = 0;
    int rc = closeToReplace(handle);
    if (rc == 0)
        rc = sqlodelete(handle->historyPath, 0);
    if (rc == 0)
        rc = openToReplace(handle, sqloOpenReplacement);
    if (rc == 0)
        rc = sqluhFollowLock(handle, operation);
    // Between its creation and its lock someone may have written to the new file, or have put one
    // of his own in its place: what stands at the path now is emptied.
    if (rc == 0)
        rc = closeToReplace(handle);
    if (rc == 0)
        rc = openToReplace(handle, sqloOpenNew);
    if (rc == 0)
        rc = sqlomark(handle->fileHandle);
    handle->restoreMarked = rc == 0;
    return rc;
}

int sqluh_write_restore_buffer(SQLUH_HANDLE* handle, unsigned int offset, unsigned char* buffer,
                               unsigned int length)
{
    pdtEntry();

    uint32_t written = 0;
    int rc = 0;
    handle->restoredFromImage = true;
    if (offset == 0)
        rc = replaceHistoryFile(handle, __func__);
    if (rc == 0)
        rc = sqlochgfileptr(handle->fileHandle, offset, sqloFromStart, nullptr);
    if (rc == 0)
        rc = sqlowrite(handle->fileHandle, buffer, length, &written);
    handle->restoreCode = firstOf(handle->restoreCode, rc);

    pdtExit(logged(rc));
    return rc;
}

// Copies the history file into a directory: before, its shadow holds what is committed there;
// afterwards, no shadow stands beside the copy.
static int copyInto(const char* source, char* targetDirectory, const char* operation)
{
    SQLUH_HANDLE* target = nullptr;
    int rc = logged(sqluhHandleAllocAndInit(targetDirectory, &target), operation);
    if (rc == 0)
        rc = sqluhKeepCommitted(target);
    if (rc == 0)
        rc = logged(sqlocopy(source, target->historyPath, 0), operation);
    if (rc == 0 && ossPathExists(target->shadowPath))
        rc = logged(sqlodelete(target->shadowPath, 0), operation);
    sqluhHandleFree(&target);
    return rc;
}

int sqluhCopyHistoryFile(char* sourceDirectory, char* targetDirectory)
{
    pdtEntry();

    SQLUH_HANDLE* handle = nullptr;
    // Told before the source is opened.
    int rc = strlen(targetDirectory) <= maxDirectoryLength ? 0 : sqluhPathTooLong;
    if (rc == 0)
        rc = sqluhCheckDirectory(targetDirectory);
    if (rc == 0)
        rc = sqluhOpen(&handle, sourceDirectory, SQLUH_OPEN_READ);
    if (rc == 0)
        rc = copyInto(handle->historyPath, targetDirectory, __func__);
    // With the warning the source had become an empty history: it is passed on, and the target
    // keeps what it has.
    rc = firstOf(rc, logged(sqluhClose(&handle)));

    pdtExit(rc);
    return rc;
}

int sqluhIsHistoryFileEmpty(char* directory, bool* isEmpty)
{
    pdtEntry();

    SQLUH_HANDLE* handle = nullptr;
    char path[pathCapacity];
    *isEmpty = false;
    int rc = sqluhJoinPath(path, sizeof path, directory, SQLUH_HISTORY_NAME);
    if (rc == 0 && !ossPathExists(path))
        rc = HISTORY_FILE_MISSING;
    if (rc == 0)
        rc = sqluhOpen(&handle, directory, SQLUH_OPEN_READ);
    if (rc == HISTORY_FILE_RECREATED)
        rc = 0;
    logged(rc);
    if (handle != nullptr) {
        *isEmpty = handle->header.entryCount == 0;
        const pdItem count = numberItem("entryCount = ", handle->header.entryCount);
        pdLog(__func__, pdLevelNotice, &count, 1);
        rc = logged(sqluhClose(&handle));
        if (rc != 0)
            *isEmpty = false;
    }

    pdtExit(rc);
    return rc;
}

void sqluh_build_warning(sqlca* ca)
{
    pdtEntry();

    char token[21] = {};
    int length = ossSnprintf(token, sizeof token, "%d", ca->sqlcode);
    ca->sqlerrml = static_cast<int16_t>(length);
    memcpy(ca->sqlerrmc, token, static_cast<size_t>(length));
    ca->sqlcode = HISTORY_WARNING;

    pdtExit(0);
}
