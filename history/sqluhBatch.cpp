// Open and close, and batches between them. Stands on the handle, the header, the recovery and the
// replay; nothing in the library but the utilities stands on it.

#include "history/sqluhDiagnostics.h"
#include "history/sqluhRecovery.h"
#include "history/sqluhist.h"

// --- Open and close ------------------------------------------------------------------------------

static int openHistoryFile(SQLUH_HANDLE* handle, unsigned int accessMode, const char* operation)
{
    unsigned int option = accessMode == SQLUH_OPEN_READ ? sqloOpenRead : sqloOpenUpdate;
    int rc = logged(sqloopenp(handle->historyPath, option, sqloPermissions, &handle->fileHandle),
                    operation);
    if (rc != 0)
        handle->fileHandle = sqloNoFile;
    else
        rc = logged(sqluhReadHeader(handle->fileHandle, &handle->header), operation);
    return rc == 0 ? 0 : HISTORY_FILE_DAMAGED;
}

// Closes the handle's file if one is open; the descriptor is gone whatever the close says.
static int closeFile(SQLUH_HANDLE* handle, const char* operation)
{
    int rc = 0;
    if (handle->fileHandle.descriptor != sqloNoFile.descriptor)
        rc = logged(sqloclose(handle->fileHandle), operation);
    handle->fileHandle = sqloNoFile;
    return rc;
}

int sqluhOpen(SQLUH_HANDLE** handleOut, char* directory, unsigned int accessMode)
{
    pdtEntry();

    int rc =
        logged(sqluhAllocateHandleVerifyHistoryFilesAndOptToRecover(handleOut, directory, true));
    if (*handleOut != nullptr) {
        int opened = rc >= 0 ? openHistoryFile(*handleOut, accessMode, __func__) : rc;
        if (opened < 0) {
            rc = opened;
            closeFile(*handleOut, __func__);
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
        // An image that could not be put in force, or is another process's file by now, is not
        // copied: the shadow stays what it is.
        rc = sqluhCommitRestore(*handle);
        bool isInForce = rc == 0;
        rc = firstOf(rc, closeFile(*handle, __func__));
        if ((*handle)->restoredFromImage && isInForce)
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
// the four barriers, where the next step waits for stable storage; with them the table holds for a
// machine that stops, too.
//
//   step                      history         shadow            a stop after it
//   begin                     'P' durable B1  old               batch undone: history from shadow
//   entries written           'P' durable B2  old               batch undone
//   'C' written               'C' durable B3  old               batch kept: shadow from history
//   replay or whole copy      'C'             new, durable B4   batch kept
//   blank written             blank           new               nothing to repair
//
// A header torn while the blank is written makes the history unreadable, and it is restored from
// the shadow, which already holds the batch.

static int writeStatus(SQLUH_HANDLE* handle, char status, const char* operation)
{
    handle->header.status = status;
    return logged(sqluhWriteHeader(handle->fileHandle, &handle->header), operation);
}

int sqluhBeginBatch(SQLUH_HANDLE** handle, char* directory)
{
    pdtEntry();

    int rc = sqluhOpen(handle, directory, SQLUH_OPEN_UPDATE);
    if (rc == HISTORY_FILE_RECREATED)
        rc = 0;
    loggedPlain(rc);
    if (*handle != nullptr) {
        rc = writeStatus(*handle, statusPending, __func__);
        // B1, before the first entry: half a batch after a blank header would be taken for sound.
        if (rc == 0)
            rc = logged(sqlosync((*handle)->fileHandle));
        if (rc != 0)
            logged(sqluhClose(handle));
    }

    pdtExit(rc);
    return rc;
}

static int commitBatch(SQLUH_HANDLE* handle, const char* operation)
{
    // B2: the entries before the letter that vouches for them.
    int rc = logged(sqlosync(handle->fileHandle), operation);
    // Where the lock was taken away others have been here: nothing of this batch may stay.
    if (rc == 0)
        rc = logged(sqloNLCKCheckHeld(&handle->namedLock), operation);
    if (rc == 0)
        rc = writeStatus(handle, statusCommitted, operation);
    // B3: the letter before the shadow changes.
    if (rc == 0)
        rc = logged(sqlosync(handle->fileHandle), operation);
    if (rc == 0)
        rc = logged(sqluhReplayWorkInShadow(handle), operation);
    if (rc == 0)
        rc = writeStatus(handle, statusConsistent, operation);
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
                rc = commitBatch(batch, __func__);
            else
                batch->header.status = statusPending;
        }
        rc = firstOf(rc, logged(sqluhClose(handle)));
    }

    pdtExit(rc);
    return rc;
}
