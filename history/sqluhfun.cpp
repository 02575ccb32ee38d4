// Checksum, formatting, backup types, handle, lock, open and close, batches.

#include <bit>
#include <clocale>
#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "history/sqluhfun.h"
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

int sqluhJoinPath(char* path, size_t capacity, const char* directory, const char* name)
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
            sqluhJoinPath(handle->directory, sizeof handle->directory, directory, "");
            sqluhJoinPath(handle->historyPath, sizeof handle->historyPath, directory,
                          SQLUH_HISTORY_NAME);
            sqluhJoinPath(handle->shadowPath, sizeof handle->shadowPath, directory,
                          SQLUH_SHADOW_NAME);
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
        if (createdCode(sqloopenp(handle->historyPath, sqloOpenTouch, sqloPermissions, &fh)) == 0)
            sqloclose(fh);
        rc = sqloNLCKInit(handle->historyPath, lock, sqloNLCKUseNodeNumber);
    }
    return rc;
}

int sqluhLockFileAtPath(SQLUH_HANDLE* handle)
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

    int rc = sqluhLockFileAtPath(handle);
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
// the four places where the next step waits for stable storage, the second of them for the entries;
// with them the table holds for a machine that stops, too.
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
