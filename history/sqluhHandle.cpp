// The handle of a history directory, and its lock. Stands on the primitives and the named lock.

#include "history/sqluhHandle.h"

#include <cstring>

#include "history/sqluhDiagnostics.h"
#include "history/sqluhfun.h"

// --- The handle ----------------------------------------------------------------------------------

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

// An empty history file where there is none, to make the key from. Where that fails, the key tells.
static void touchHistoryFile(const SQLUH_HANDLE* handle)
{
    SQLO_FHANDLE fh = sqloNoFile;
    if (createdCode(sqloopenp(handle->historyPath, sqloOpenTouch, sqloPermissions, &fh)) == 0)
        sqloclose(fh);
}

// Makes the key of the history file that stands at the handle's path.
static int makeLockKey(const SQLUH_HANDLE* handle, SQLO_NLCK* lock)
{
    int rc = sqloNLCKInit(handle->historyPath, lock, sqloNLCKUseNodeNumber);
    if (rc != 0) {
        touchHistoryFile(handle);
        rc = sqloNLCKInit(handle->historyPath, lock, sqloNLCKUseNodeNumber);
    }
    return rc;
}

// Releases the lock if the handle holds it, for the operation that it is logged under.
static int releaseLock(SQLUH_HANDLE* handle, const char* operation)
{
    int rc = 0;
    if (handle->isLocked) {
        rc = logged(sqloNLCKUnlock(&handle->namedLock), operation);
        if (rc == 0)
            rc = logged(sqloNLCKTerm(&handle->namedLock), operation);
        if (rc == 0)
            handle->isLocked = false;
    }
    return rc;
}

// Goes on to the lock of the file at the path until the lock that is held is that file's.
static int lockFileAtPath(SQLUH_HANDLE* handle, const char* operation)
{
    SQLO_NLCK lock;
    int rc = makeLockKey(handle, &lock);
    while (rc == 0 && (!handle->isLocked || lock.key != handle->namedLock.key)) {
        rc = sqloNLCKCheckDeadlock(&lock);
        if (rc == 0)
            rc = sqloNLCKLock(&lock, 0, -1);
        if (rc == 0) {
            releaseLock(handle, operation);
            handle->namedLock = lock;
            handle->isLocked = true;
            rc = makeLockKey(handle, &lock);
        }
    }
    if (rc == 0)
        sqloNLCKKeepFile(&handle->namedLock, handle->historyPath);
    return rc;
}

int sqluhFollowLock(SQLUH_HANDLE* handle, const char* operation)
{
    if (!handle->isLocked)
        return 0;
    // Made before the key is asked for: a file that was moved aside is no failure.
    if (!ossPathExists(handle->historyPath))
        touchHistoryFile(handle);
    return lockFileAtPath(handle, operation);
}

int sqluhLock(SQLUH_HANDLE* handle)
{
    pdtEntry();

    int rc = lockFileAtPath(handle, __func__);
    if (rc != 0)
        releaseLock(handle, __func__);

    pdtExit(rc);
    return rc;
}

int sqluhUnlock(SQLUH_HANDLE* handle)
{
    pdtEntry();
    int rc = releaseLock(handle, __func__);
    pdtExit(rc);
    return rc;
}
