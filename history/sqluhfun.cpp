// Checksum, formatting, handle, lock, recovery, open and close, batches, utilities.

#include <bit>
#include <clocale>
#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "history/sqluhist.h"
#include "history/sqluhlog.h"

// --- Checksum and formatting ---------------------------------------------------------------------

static uint32_t littleEndian(uint32_t word)
{
    if constexpr (std::endian::native == std::endian::big)
        return __builtin_bswap32(word);
    return word;
}

// Sixteen bytes, exclusive-ored at once where the machine can.
typedef uint64_t wideWord __attribute__((vector_size(16)));

static inline wideWord wideWordAt(const unsigned char* at)
{
    wideWord word;
    memcpy(&word, at, sizeof word);
    return word;
}

uint32_t sqluhChecksum(void* buffer, unsigned int length)
{
    pdtEntry();

    // Exclusive-or does not care about order: wide words side by side, folded at the end, cost what
    // fetching the bytes costs.
    const unsigned char* at = static_cast<const unsigned char*>(buffer);
    const unsigned char* end = at + length;
    wideWord lanes[4] = {};
    for (; end - at >= 64; at += sizeof lanes) {
        lanes[0] ^= wideWordAt(at);
        lanes[1] ^= wideWordAt(at + 16);
        lanes[2] ^= wideWordAt(at + 32);
        lanes[3] ^= wideWordAt(at + 48);
    }
    lanes[0] ^= lanes[1] ^ lanes[2] ^ lanes[3];
    uint64_t folded = lanes[0][0] ^ lanes[0][1];
    uint32_t sum = static_cast<uint32_t>(folded) ^ static_cast<uint32_t>(folded >> 32);
    uint32_t word;
    for (; end - at >= 4; at += sizeof word) {
        memcpy(&word, at, sizeof word);
        sum ^= word;
    }
    word = 0;
    memcpy(&word, at, static_cast<size_t>(end - at));
    sum = littleEndian(sum ^ word);

    pdtExit(0);
    return sum;
}

int sqluhSprintf(char* buffer, const char* format, ...)
{
    pdtEntry();

    char saved[34] = {};
    const char* current = setlocale(LC_CTYPE, nullptr);
    bool switched = current != nullptr && strcmp(current, "C") != 0;
    if (switched) {
        strncpy(saved, current, sizeof saved - 1);
        setlocale(LC_CTYPE, "C");
    }
    va_list arguments;
    va_start(arguments, format);
    int length = vsprintf(buffer, format, arguments);
    va_end(arguments);
    if (switched)
        setlocale(LC_CTYPE, saved);

    pdtExit(length);
    return length;
}

int sqluhRewind(SQLO_FHANDLE fh, long long* newOffset)
{
    pdtEntry();
    int rc = sqloseek(fh, headerLength, sqloFromStart, newOffset);
    pdtExit(rc);
    return rc;
}

// --- Backup types --------------------------------------------------------------------------------

static bool traceTest(bool result, const char* function = __builtin_FUNCTION())
{
    pdtExit1(result, &result, sizeof result, function);
    return result;
}

bool sqluhIsHistEntryIncr(char operationType)
{
    pdtEntry();
    return traceTest(operationType == 'I' || operationType == 'O');
}

bool sqluhIsHistEntryDelta(char operationType)
{
    pdtEntry();
    return traceTest(operationType == 'D' || operationType == 'E');
}

bool sqluhIsHistEntryIncrOrDelta(char operationType)
{
    pdtEntry();
    return traceTest(sqluhIsHistEntryIncr(operationType) || sqluhIsHistEntryDelta(operationType));
}

// --- The handle ----------------------------------------------------------------------------------

static int joinPath(char* path, size_t capacity, const char* directory, const char* name)
{
    int length = ossSnprintf(path, capacity, "%s%s", directory, name);
    return length < 0 || static_cast<size_t>(length) >= capacity ? sqluhPathTooLong : 0;
}

static void allocateReplayArray(SQLUH_REPLAYAREA* area)
{
    void* block = nullptr;
    if (allocateZeroed(replayGrowth * sizeof(SQLUH_REPLAYENTRY), &block) == 0) {
        area->replayEntries = static_cast<SQLUH_REPLAYENTRY*>(block);
        area->maxReplayEntries = replayGrowth;
    } else {
        // Not worth failing an open for: a batch then copies the whole file.
        area->replayDisabled = 1;
    }
}

int sqluhHandleAllocAndInit(char* directory, SQLUH_HANDLE** handleOut)
{
    pdtEntry();

    void* block = nullptr;
    *handleOut = nullptr;
    int rc = strlen(directory) <= maxDirectoryLength ? 0 : sqluhPathTooLong;
    if (rc == 0)
        rc = allocateZeroed(sizeof(SQLUH_HANDLE), &block);
    logged(rc);
    if (rc == 0) {
        SQLUH_HANDLE* handle = static_cast<SQLUH_HANDLE*>(block);
        handle->fileHandle = sqloNoFile;
        rc = logged(sqluhInitWorkArea(&handle->workArea, defaultWorkAreaSize));
        if (rc == 0) {
            handle->isLocked = false;
            joinPath(handle->directory, sizeof handle->directory, directory, "");
            joinPath(handle->historyPath, sizeof handle->historyPath, directory,
                     SQLUH_HISTORY_NAME);
            joinPath(handle->shadowPath, sizeof handle->shadowPath, directory, SQLUH_SHADOW_NAME);
            allocateReplayArray(&handle->replayArea);
            *handleOut = handle;
        } else {
            sqlofmblkEx(handle);
        }
    }

    pdtExit(rc);
    return rc;
}

void sqluhHandleFree(SQLUH_HANDLE** handle)
{
    pdtEntry();

    if (handle != nullptr && *handle != nullptr) {
        SQLUH_HANDLE* freed = *handle;
        SQLUH_REPLAYAREA* area = &freed->replayArea;
        if (freed->workArea.buffer != nullptr)
            sqlofmblkEx(freed->workArea.buffer);
        freed->workArea = {};
        if (area->replayEntries != nullptr) {
            if (area->replayEntries[0].copy != nullptr)
                sqlofmblkEx(area->replayEntries[0].copy);
            area->replayEntries[0].copy = nullptr;
            sqlofmblkEx(area->replayEntries);
        }
        area->replayEntries = nullptr;
        sqlofmblkEx(freed);
        *handle = nullptr;
    }

    pdtExit(0);
}

// --- The lock of a directory ---------------------------------------------------------------------

// Makes the key of the history file that stands at the handle's path.
static int makeLockKey(SQLUH_HANDLE* handle, SQLO_NLCK* lock)
{
    int rc = sqloNLCKInit(handle->historyPath, lock, sqloNLCKUseNodeNumber);
    if (rc != 0) {
        // No history file yet: the key is made from it, so an empty one is put there. Where that
        // fails, the key tells.
        SQLO_FHANDLE fh = sqloNoFile;
        if (sqloopenp(handle->historyPath, sqloOpenTouch, sqloPermissions, &fh) == 0)
            sqloclose(fh);
        rc = sqloNLCKInit(handle->historyPath, lock, sqloNLCKUseNodeNumber);
    }
    return rc;
}

// Takes the lock of the history file that stands at the path. Without a lock at first, or with that
// of a file that stood there before, which is released only when the new one is held.
//
// The key is the file's, so whoever puts a new file there (fatal recovery, the first piece of a
// restore) changes it: others use the new key from then on, and those who waited for the old one
// wake up with the lock of a file that is gone. Hence the key is looked at again behind every lock.
static int lockFileAtPath(SQLUH_HANDLE* handle)
{
    SQLO_NLCK lock;
    int rc = makeLockKey(handle, &lock);
    while (rc == 0 && (!handle->isLocked || lock.key != handle->namedLock.key)) {
        rc = sqloNLCKLock(&lock, 0, -1);
        if (rc == 0) {
            logged(sqluhUnlock(handle));
            handle->namedLock = lock;
            handle->isLocked = true;
            rc = makeLockKey(handle, &lock);
        }
    }
    return rc;
}

int sqluhLock(SQLUH_HANDLE* handle)
{
    pdtEntry();

    int rc = lockFileAtPath(handle);
    if (rc != 0)
        logged(sqluhUnlock(handle));

    pdtExit(rc);
    return rc;
}

int sqluhUnlock(SQLUH_HANDLE* handle)
{
    pdtEntry();

    int rc = 0;
    if (handle->isLocked) {
        rc = logged(sqloNLCKUnlock(&handle->namedLock));
        if (rc == 0)
            rc = logged(sqloNLCKTerm(&handle->namedLock));
        if (rc == 0)
            handle->isLocked = false;
    }

    pdtExit(rc);
    return rc;
}

// --- Recovery ------------------------------------------------------------------------------------
//
// What the two status letters tell an open, and what it does (the first row that applies):
//
//   history                    shadow               repair
//   not usable                 not usable, not 'P'  both moved aside, an empty pair made
//   blank                      usable               none
//   'C', or blank              any                  shadow made a copy of the history
//   not usable                 usable, or 'P'       history made a copy of the shadow
//
// Afterwards the sizes must agree and both headers must read, or the shadow is copied once more.
//
// Each repair leaves letters behind from which the next open goes on if the process stops in it:
//
//   stopped                                   history              shadow
//   history from shadow, shadow marked        as before            'P'      again from the shadow
//   history from shadow, copying              partial, or 'P'      'P'      again from the shadow
//   history from shadow, done                 blank                'P'      shadow from history
//   shadow from history, copying              blank or 'C'         partial  again from the history
//   shadow from history, copied               'C'                  'C'      again from the history
//   moved aside                               absent               absent   an empty pair is made

// What the examination of one file found.
struct fileState {
    bool usable;
    char status; // zero when the header could not be read
};

int sqluhUpdateHeaderStatus(char* path, char status)
{
    pdtEntry();

    SQLO_FHANDLE fh = sqloNoFile;
    SQLUH_HEADER header;
    int rc = logged(sqloopenp(path, sqloOpenUpdate, sqloPermissions, &fh));
    if (rc == 0) {
        rc = logged(sqluhReadHeader(fh, &header));
        if (rc == 0) {
            header.status = status;
            rc = logged(sqluhWriteHeader(fh, &header));
        }
        rc = firstOf(rc, logged(sqloclose(fh)));
    }

    pdtExit(rc);
    return rc;
}

int sqluhRecoverHistoryFromShadow(SQLUH_HANDLE* handle)
{
    pdtEntry();

    // Marked first: a history file torn by this copy must be rebuilt from this shadow again, not
    // moved aside. The copy makes the mark durable before it touches the history file.
    int rc = logged(sqluhUpdateHeaderStatus(handle->shadowPath, statusPending));
    if (rc == 0)
        rc = logged(sqlocopy(handle->shadowPath, handle->historyPath, 0));
    if (rc == 0)
        rc = logged(sqluhUpdateHeaderStatus(handle->historyPath, statusConsistent));

    pdtExit(rc);
    return rc;
}

int sqluhRecoverShadowFromHistory(SQLUH_HANDLE* handle)
{
    pdtEntry();

    // The blank is written last and to the history file: stopped before it, the next open still
    // sees 'C' there and copies again.
    int rc = logged(sqlocopy(handle->historyPath, handle->shadowPath, 0));
    if (rc == 0)
        rc = logged(sqluhUpdateHeaderStatus(handle->historyPath, statusConsistent));

    pdtExit(rc);
    return rc;
}

int sqluh_history_file_get_size(char* directory, char* fileName, unsigned long long* size)
{
    pdtEntry();

    char path[pathCapacity];
    int rc = joinPath(path, sizeof path, directory, fileName);
    if (rc == 0) {
        ossFileRequest request = {ossFileVersion, path, 0, 0, 1};
        ossFileInfo info = {};
        rc = ossFileGetInfoV9(&request, &info);
        if (rc == 0)
            *size = info.size;
    }

    pdtExit(rc);
    return rc;
}

static bool sizesAgree(SQLUH_HANDLE* handle)
{
    char historyName[] = SQLUH_HISTORY_NAME;
    char shadowName[] = SQLUH_SHADOW_NAME;
    unsigned long long historySize = 0;
    unsigned long long shadowSize = 0;
    int rc = sqluh_history_file_get_size(handle->directory, historyName, &historySize);
    if (rc == 0)
        rc = sqluh_history_file_get_size(handle->directory, shadowName, &shadowSize);
    if (rc == 0 && historySize == shadowSize)
        return true;
    logRecord({textItem(TEXT_FILE_SIZE), codeItem("", rc),
               numberItem("", static_cast<int64_t>(historySize)),
               numberItem("", static_cast<int64_t>(shadowSize))});
    return false;
}

// Opens the file through the handle, reads its header into the handle's and closes it. The reader's
// code; a failed close counts only behind a good read.
static int readHeaderOf(SQLUH_HANDLE* handle, const char* path)
{
    int rc = sqloopenp(path, sqloOpenRead, sqloPermissions, &handle->fileHandle);
    if (rc == 0) {
        rc = sqluhReadHeader(handle->fileHandle, &handle->header);
        rc = firstOf(rc, sqloclose(handle->fileHandle));
    }
    handle->fileHandle = sqloNoFile;
    return rc;
}

bool sqluhVerifyHistFilesAreIndentical(SQLUH_HANDLE* handle)
{
    pdtEntry();

    bool identical = sizesAgree(handle);
    if (identical) {
        int rc = readHeaderOf(handle, handle->historyPath);
        if (rc == 0)
            rc = readHeaderOf(handle, handle->shadowPath);
        identical = rc == 0;
        if (!identical)
            logRecord({textItem(TEXT_FILE_CHECKSUM), codeItem("", rc), numberItem("", 0),
                       numberItem("", 0)});
    }

    pdtExit(identical);
    return identical;
}

static fileState examineFile(SQLUH_HANDLE* handle, const char* path)
{
    fileState state = {};
    if (sqloopenp(path, sqloOpenRead, sqloPermissions, &handle->fileHandle) == 0) {
        if (sqluhReadHeader(handle->fileHandle, &handle->header) == 0) {
            state.status = handle->header.status;
            state.usable = state.status == statusConsistent || state.status == statusCommitted;
        }
        sqloclose(handle->fileHandle);
    }
    handle->fileHandle = sqloNoFile;
    return state;
}

static void traceFailure(int rc)
{
    if (rc != 0)
        sqltError("sqluhRecoverFromFatalError", rc);
}

int sqluhRecoverFromFatalError(SQLUH_HANDLE* handle)
{
    pdtEntry();

    char savedHistory[pathCapacity];
    char savedShadow[pathCapacity];
    // Refused before anything is moved: without a new pair, moving the damaged one helps nobody.
    int rc = strlen(handle->directory) <= maxCreateDirectoryLength ? 0 : logged(sqluhPathTooLong);
    if (rc == 0) {
        joinPath(savedHistory, sizeof savedHistory, handle->directory, SQLUH_SAVED_HISTORY_NAME);
        joinPath(savedShadow, sizeof savedShadow, handle->directory, SQLUH_SAVED_SHADOW_NAME);
        traceFailure(sqlomove(handle->historyPath, savedHistory));
        traceFailure(sqlomove(handle->shadowPath, savedShadow));
        // Locked before there is anything in it. Someone else may have been first, and then has
        // made the pair.
        if (handle->isLocked)
            rc = logged(lockFileAtPath(handle));
        if (rc == 0 && !(handle->isLocked && examineFile(handle, handle->historyPath).usable))
            rc = sqluhCreate(handle->directory);
    }

    pdtExit(rc);
    return rc;
}

static int repair(SQLUH_HANDLE* handle, fileState history, fileState shadow)
{
    int rc = 0;
    if (history.usable && history.status == statusConsistent && shadow.usable)
        rc = 0;
    else if (history.usable)
        rc = logged(sqluhRecoverShadowFromHistory(handle));
    else
        rc = logged(sqluhRecoverHistoryFromShadow(handle));

    if (rc == 0 && !sqluhVerifyHistFilesAreIndentical(handle)) {
        pdLogPrintf(__func__, pdLevelWarning, "%s", TEXT_NOT_IDENTICAL);
        rc = logged(sqluhRecoverShadowFromHistory(handle));
    }
    return rc == 0 ? 0 : HISTORY_FILE_DAMAGED;
}

static int examineAndRepair(SQLUH_HANDLE* handle, bool optToRecover)
{
    fileState history = examineFile(handle, handle->historyPath);
    fileState shadow = examineFile(handle, handle->shadowPath);
    if (!history.usable && !shadow.usable && shadow.status != statusPending) {
        if (!optToRecover)
            return HISTORY_FILE_DAMAGED;
        int rc = sqluhRecoverFromFatalError(handle);
        return rc == 0 ? HISTORY_FILE_RECREATED : rc;
    }
    return optToRecover ? repair(handle, history, shadow) : 0;
}

int sqluhAllocateHandleVerifyHistoryFilesAndOptToRecover(SQLUH_HANDLE** handleOut, char* directory,
                                                         bool optToRecover)
{
    pdtEntry();

    int rc = logged(sqluhHandleAllocAndInit(directory, handleOut));
    if (rc == 0)
        rc = logged(sqluhLock(*handleOut));
    if (rc == 0)
        rc = examineAndRepair(*handleOut, optToRecover);

    pdtExit(rc);
    return rc;
}

bool sqluhCheckIfHistoryFilesAreUseable(char* directory)
{
    pdtEntry();

    SQLUH_HANDLE* handle = nullptr;
    int rc = sqluhAllocateHandleVerifyHistoryFilesAndOptToRecover(&handle, directory, false);
    if (rc != 0)
        pdLogPrintf(__func__, pdLevelNotice, TEXT_NOT_USEABLE, rc);
    if (handle != nullptr) {
        logged(sqluhUnlock(handle));
        sqluhHandleFree(&handle);
    }

    pdtExit(rc == 0);
    return rc == 0;
}

// --- Open and close ------------------------------------------------------------------------------

static int openHistoryFile(SQLUH_HANDLE* handle, unsigned int accessMode)
{
    unsigned int option = accessMode == SQLUH_OPEN_READ ? sqloOpenRead : sqloOpenUpdate;
    int rc = logged(sqloopenp(handle->historyPath, option, sqloPermissions, &handle->fileHandle));
    if (rc != 0)
        handle->fileHandle = sqloNoFile;
    else
        rc = logged(sqluhReadHeader(handle->fileHandle, &handle->header));
    return rc == 0 ? 0 : HISTORY_FILE_DAMAGED;
}

// Closes the handle's file if one is open; the descriptor is gone whatever the close says.
static int closeFile(SQLUH_HANDLE* handle)
{
    int rc = 0;
    if (handle->fileHandle.descriptor != sqloNoFile.descriptor)
        rc = logged(sqloclose(handle->fileHandle));
    handle->fileHandle = sqloNoFile;
    return rc;
}

int sqluhOpen(SQLUH_HANDLE** handleOut, char* directory, unsigned int accessMode)
{
    pdtEntry();

    int rc =
        logged(sqluhAllocateHandleVerifyHistoryFilesAndOptToRecover(handleOut, directory, true));
    if (*handleOut != nullptr) {
        int opened = rc >= 0 ? openHistoryFile(*handleOut, accessMode) : rc;
        if (opened < 0) {
            rc = opened;
            closeFile(*handleOut);
            logged(sqluhUnlock(*handleOut));
            sqluhHandleFree(handleOut);
        }
    }

    pdtExit(rc);
    return rc;
}

int sqluhClose(SQLUH_HANDLE** handle)
{
    pdtEntry();

    int rc = 0;
    if (*handle != nullptr) {
        rc = closeFile(*handle);
        if ((*handle)->restoredFromImage)
            rc = firstOf(rc, logged(sqlocopy((*handle)->historyPath, (*handle)->shadowPath, 0)));
        (*handle)->restoredFromImage = false;
        rc = firstOf(rc, logged(sqluhUnlock(*handle)));
        sqluhHandleFree(handle);
    }

    pdtExit(rc);
    return rc;
}

// --- Batches -------------------------------------------------------------------------------------
//
// The history file's status over a batch, and what an open makes of a stop there. "Durable" marks
// the four places where the next step waits for stable storage; with them the table holds for a
// machine that stops, too.
//
//   step                      history      shadow        a stop behind it
//   begin                     'P' durable  old           batch undone: history from shadow
//   entries written           'P' durable  old           batch undone
//   'C' written               'C' durable  old           batch kept: shadow from history
//   replay or whole copy      'C'          new, durable  batch kept
//   blank written             blank        new           nothing to repair
//
// A header torn while the blank is written makes the history unreadable, and it is restored from
// the shadow, which already holds the batch.

static int writeStatus(SQLUH_HANDLE* handle, char status)
{
    handle->header.status = status;
    return logged(sqluhWriteHeader(handle->fileHandle, &handle->header));
}

int sqluhBeginBatch(SQLUH_HANDLE** handle, char* directory)
{
    pdtEntry();

    int rc = sqluhOpen(handle, directory, SQLUH_OPEN_UPDATE);
    if (rc == HISTORY_FILE_RECREATED)
        rc = 0;
    loggedPlain(rc);
    if (*handle != nullptr) {
        rc = writeStatus(*handle, statusPending);
        // Before the first entry: half a batch behind a blank header would be taken for sound.
        if (rc == 0)
            rc = logged(sqlosync((*handle)->fileHandle));
        if (rc != 0)
            logged(sqluhClose(handle));
    }

    pdtExit(rc);
    return rc;
}

static int commitBatch(SQLUH_HANDLE* handle)
{
    // The entries before the letter that vouches for them, the letter before the shadow changes.
    int rc = logged(sqlosync(handle->fileHandle));
    if (rc == 0)
        rc = writeStatus(handle, statusCommitted);
    if (rc == 0)
        rc = logged(sqlosync(handle->fileHandle));
    if (rc == 0)
        rc = logged(sqluhReplayWorkInShadow(handle));
    if (rc == 0)
        rc = writeStatus(handle, statusConsistent);
    return rc;
}

int sqluhEndBatch(SQLUH_HANDLE** handle, unsigned int flags)
{
    pdtEntry();

    int rc = 0;
    if (handle != nullptr && *handle != nullptr) {
        SQLUH_HANDLE* batch = *handle;
        if (batch->fileHandle.descriptor != sqloNoFile.descriptor && batch->isLocked) {
            if ((flags & sqluhCommit) != 0)
                rc = commitBatch(batch);
            else
                batch->header.status = statusPending;
        }
        rc = firstOf(rc, logged(sqluhClose(handle)));
    }

    pdtExit(rc);
    return rc;
}

// --- Utilities -----------------------------------------------------------------------------------

enum : size_t { tablespaceSlot = 19 };

// The nine texts before the command text, in the record's order, with the size of their buffers.
struct textSlot {
    textBuffer zq3HistoryData::*text;
    uint32_t capacity;
};
static constexpr textSlot textSlots[] = {
    {&zq3HistoryData::objectPart, 18}, {&zq3HistoryData::secondTimestamp, 15},
    {&zq3HistoryData::firstText, 13},  {&zq3HistoryData::lastText, 13},
    {&zq3HistoryData::idText, 25},     {&zq3HistoryData::qualifierText, 31},
    {&zq3HistoryData::nameText, 129},  {&zq3HistoryData::longText, 256},
    {&zq3HistoryData::noteText, 31},
};
enum : size_t { textSlotsLength = 531 };

// The records come first and every one of them is a multiple of its own alignment, so that the
// array behind the sqlca is aligned and the bytes at the end need no gaps.
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
        at = slotAt(&data->tablespaceBuffers[i], at, tablespaceSlot);
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
                    uint64_t{numTablespaces} * (sizeof(textBuffer) + tablespaceSlot) +
                    textSlotsLength + commandCapacity;
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

// What someone who came between the creation of the new file and its lock has put into it goes.
static int emptyFile(SQLUH_HANDLE* handle)
{
    long long size = 0;
    int rc = sqloseek(handle->fileHandle, 0, sqloFromEnd, &size);
    if (rc != 0 || size == 0)
        return rc;
    rc = sqloclose(handle->fileHandle);
    handle->fileHandle = sqloNoFile;
    if (rc == 0)
        rc = sqloopenp(handle->historyPath, sqloOpenNew, sqloPermissions, &handle->fileHandle);
    return rc == sqloFileExisted ? 0 : rc;
}

// Puts an empty file in the place of the history file.
static int replaceHistoryFile(SQLUH_HANDLE* handle)
{
    int rc = sqloclose(handle->fileHandle);
    handle->fileHandle = sqloNoFile;
    if (rc == 0)
        rc = sqlodelete(handle->historyPath, 0);
    if (rc == 0)
        rc = sqloopenp(handle->historyPath, sqloOpenReplacement, sqloPermissions,
                       &handle->fileHandle);
    if (rc == 0 && handle->isLocked)
        rc = lockFileAtPath(handle);
    if (rc == 0)
        rc = emptyFile(handle);
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
        rc = replaceHistoryFile(handle);
    if (rc == 0)
        rc = sqlochgfileptr(handle->fileHandle, offset, sqloFromStart, nullptr);
    if (rc == 0) {
        rc = sqlowrite(handle->fileHandle, buffer, length, &written);
        if (rc == 0 && written != length)
            rc = transferCode(rc);
    }

    pdtExit(logged(rc));
    return rc;
}

int sqluhCopyHistoryFile(char* sourceDirectory, char* targetDirectory)
{
    pdtEntry();

    SQLUH_HANDLE* handle = nullptr;
    char source[pathCapacity] = {};
    char target[pathCapacity] = {};
    int rc = joinPath(target, sizeof target, targetDirectory, SQLUH_HISTORY_NAME);
    if (rc == 0)
        rc = joinPath(source, sizeof source, sourceDirectory, SQLUH_HISTORY_NAME);
    if (rc == 0)
        rc = sqluhOpen(&handle, sourceDirectory, SQLUH_OPEN_READ);
    if (rc == 0)
        rc = logged(sqlocopy(source, target, 0));
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
    int rc = joinPath(path, sizeof path, directory, SQLUH_HISTORY_NAME);
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
