// Recovery: the examination of the two files and the repairs. Stands on handle and lock, header and
// creation.
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
// Each repair leaves letters from which the next open goes on if the process stops in it:
//
//   stopped                                   history              shadow
//   history from shadow, shadow marked        as before            'P'      again from the shadow
//   history from shadow, copying              partial, or 'P'      'P'      again from the shadow
//   history from shadow, done                 blank                'P'      shadow from history
//   shadow from history, copying              blank or 'C'         partial  again from the history
//   shadow from history, copied               'C'                  'C'      again from the history
//   moved aside                               absent               absent   an empty pair is made

#include "history/sqluhRecovery.h"

#include <cerrno>
#include <cstring>

#include "history/sqluhDiagnostics.h"
#include "history/sqluhHandle.h"
#include "history/sqluhfun.h"
#include "history/sqluhist.h"

static int updateStatus(const char* path, char status, bool durable, const char* operation)
{
    SQLO_FHANDLE fh = sqloNoFile;
    SQLUH_HEADER header;
    int rc = logged(sqloopenp(path, sqloOpenUpdate, sqloPermissions, &fh), operation);
    if (rc == 0) {
        rc = logged(sqluhReadHeader(fh, &header), operation);
        if (rc == 0) {
            header.status = status;
            rc = logged(sqluhWriteHeader(fh, &header), operation);
        }
        if (rc == 0 && durable)
            rc = logged(sqlosync(fh), operation);
        rc = firstOf(rc, logged(sqloclose(fh), operation));
    }
    return rc;
}

int sqluhUpdateHeaderStatus(char* path, char status)
{
    pdtEntry();
    int rc = updateStatus(path, status, false, __func__);
    pdtExit(rc);
    return rc;
}

int sqluhRecoverHistoryFromShadow(SQLUH_HANDLE* handle)
{
    pdtEntry();

    // Marked first: a history file torn by this copy must be rebuilt from this shadow again, not
    // moved aside. The copy makes its source, and so the mark, durable before it touches the
    // history file (R0), and the history file before it returns (R4).
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
    int rc = sqluhJoinPath(path, sizeof path, directory, fileName);
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

static bool sizesAgree(SQLUH_HANDLE* handle, const char* operation)
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
               numberItem("", static_cast<int64_t>(shadowSize))},
              operation);
    return false;
}

// Opens the file through the handle, reads its header into the handle's and closes it. Returns the
// reader's code; *closed receives the close's.
static int readHeaderOf(SQLUH_HANDLE* handle, const char* path, int* closed)
{
    *closed = 0;
    int rc = sqloopenp(path, sqloOpenRead, sqloPermissions, &handle->fileHandle);
    if (rc == 0) {
        rc = sqluhReadHeader(handle->fileHandle, &handle->header);
        *closed = sqloclose(handle->fileHandle);
    }
    handle->fileHandle = sqloNoFile;
    return rc;
}

bool sqluhVerifyHistFilesAreIndentical(SQLUH_HANDLE* handle)
{
    pdtEntry();

    bool identical = sizesAgree(handle, __func__);
    if (identical) {
        int closed = 0;
        int rc = firstOf(readHeaderOf(handle, handle->historyPath, &closed), closed);
        if (rc == 0)
            rc = firstOf(readHeaderOf(handle, handle->shadowPath, &closed), closed);
        identical = rc == 0;
        if (!identical)
            logRecord({textItem(TEXT_FILE_CHECKSUM), codeItem("", rc), numberItem("", 0),
                       numberItem("", 0)});
    }

    pdtExit(identical);
    return identical;
}

// Whether an open or a header's reading failed for a reason that lies outside the file, which then
// may be sound: no descriptor free, no right, no memory, a device that does not answer.
static bool isUnseen(int rc)
{
    static const int told[] = {0,
                               END_OF_FILE,
                               HISTORY_FILE_DAMAGED,
                               sqloFileIncomplete,
                               sqloSystemError | ENOENT,
                               sqloSystemError | EISDIR,
                               sqloSystemError | EINVAL};
    for (int code : told)
        if (rc == code)
            return false;
    return true;
}

// A file that cannot be opened or read is not usable; what closing it says does not count. *unseen
// receives the code if it says nothing about the file.
static SQLUH_FILESTATE examineFile(SQLUH_HANDLE* handle, const char* path, int* unseen)
{
    int closed = 0;
    int rc = readHeaderOf(handle, path, &closed);
    if (isUnseen(rc))
        *unseen = rc;
    return sqluhStateOfFile(rc, &handle->header);
}

// Looks at both files and decides. Returns 0, or what kept one of them from being looked at.
static int examineFiles(SQLUH_HANDLE* handle, sqluhRepair* due)
{
    int unseen = 0;
    SQLUH_FILESTATE history = examineFile(handle, handle->historyPath, &unseen);
    SQLUH_FILESTATE shadow = examineFile(handle, handle->shadowPath, &unseen);
    *due = sqluhDecideRepair(history, shadow);
    return unseen;
}

SQLUH_FILESTATE sqluhStateOfFile(int rc, const SQLUH_HEADER* header)
{
    SQLUH_FILESTATE state = {false, '\0'};
    if (rc == 0) {
        state.status = header->status;
        state.usable = state.status == statusConsistent || state.status == statusCommitted;
    }
    return state;
}

sqluhRepair sqluhDecideRepair(SQLUH_FILESTATE history, SQLUH_FILESTATE shadow)
{
    if (!history.usable && !shadow.usable && shadow.status != statusPending)
        return sqluhRepairAnew;
    if (!history.usable)
        return sqluhRepairHistory;
    return history.status == statusConsistent && shadow.usable ? sqluhRepairNone
                                                               : sqluhRepairShadow;
}

static void traceFailure(int rc, const char* operation)
{
    if (rc != 0)
        sqltError(operation, rc);
}

int sqluhRecoverFromFatalError(SQLUH_HANDLE* handle)
{
    pdtEntry();

    char savedHistory[pathCapacity];
    char savedShadow[pathCapacity];
    // Refused before anything is moved: without a new pair, moving the damaged one helps nobody.
    int rc = strlen(handle->directory) <= maxCreateDirectoryLength ? 0 : logged(sqluhPathTooLong);
    if (rc == 0) {
        sqluhJoinPath(savedHistory, sizeof savedHistory, handle->directory,
                      SQLUH_SAVED_HISTORY_NAME);
        sqluhJoinPath(savedShadow, sizeof savedShadow, handle->directory, SQLUH_SAVED_SHADOW_NAME);
        int moved = sqlomove(handle->historyPath, savedHistory);
        traceFailure(moved, __func__);
        traceFailure(sqlomove(handle->shadowPath, savedShadow), __func__);
        // Locked before there is anything in it. Someone else may have been first, and then has
        // made the pair; while the old file is in its place its lock keeps everybody out.
        bool made = false;
        int unseen = 0;
        if (moved == 0) {
            rc = logged(sqluhFollowLock(handle, __func__));
            made = rc == 0 && examineFile(handle, handle->historyPath, &unseen).usable;
        }
        // The shadow that was moved may have been his.
        if (rc == 0 && made)
            rc = logged(sqlocopy(handle->historyPath, handle->shadowPath, 0));
        else if (rc == 0)
            rc = sqluhCreate(handle->directory);
    }

    pdtExit(rc);
    return rc;
}

static int repair(SQLUH_HANDLE* handle, sqluhRepair due, const char* operation)
{
    int rc = 0;
    if (due == sqluhRepairHistory)
        rc = logged(sqluhRecoverHistoryFromShadow(handle), operation);
    else if (due == sqluhRepairShadow)
        rc = logged(sqluhRecoverShadowFromHistory(handle), operation);

    if (rc == 0 && !sqluhVerifyHistFilesAreIndentical(handle)) {
        pdLogPrintf(operation, pdLevelWarning, "%s", TEXT_NOT_IDENTICAL);
        rc = logged(sqluhRecoverShadowFromHistory(handle), operation);
    }
    return rc == 0 ? 0 : HISTORY_FILE_DAMAGED;
}

static int examineAndRepair(SQLUH_HANDLE* handle, bool optToRecover, const char* operation)
{
    sqluhRepair due;
    int unseen = examineFiles(handle, &due);
    // What kept a file from being looked at may have passed. Nor is a pair given up for want of
    // sight.
    if (unseen != 0)
        unseen = examineFiles(handle, &due);
    if (!optToRecover)
        return due == sqluhRepairAnew ? HISTORY_FILE_DAMAGED : 0;
    if (due == sqluhRepairAnew && unseen != 0)
        return logged(unseen, operation);
    if (due == sqluhRepairAnew) {
        int rc = sqluhRecoverFromFatalError(handle);
        return rc == 0 ? HISTORY_FILE_RECREATED : rc;
    }
    return repair(handle, due, operation);
}

int sqluhAllocateHandleVerifyHistoryFilesAndOptToRecover(SQLUH_HANDLE** handleOut, char* directory,
                                                         bool optToRecover)
{
    pdtEntry();

    *handleOut = nullptr;
    int rc = logged(sqluhCheckDirectory(directory));
    if (rc == 0)
        rc = logged(sqluhHandleAllocAndInit(directory, handleOut));
    if (rc == 0)
        rc = logged(sqluhLock(*handleOut));
    if (rc == 0)
        rc = examineAndRepair(*handleOut, optToRecover, __func__);

    pdtExit(rc);
    return rc;
}

int sqluhKeepCommitted(SQLUH_HANDLE* handle)
{
    pdtEntry();

    sqluhRepair due;
    int rc = logged(examineFiles(handle, &due));
    if (rc == 0 &&
        (due == sqluhRepairShadow || (due == sqluhRepairNone && !sizesAgree(handle, __func__))))
        rc = logged(sqlocopy(handle->historyPath, handle->shadowPath, 0));
    if (rc == 0 && due != sqluhRepairAnew)
        rc = updateStatus(handle->shadowPath, statusPending, true, __func__); // RP

    pdtExit(rc);
    return rc;
}

int sqluhCommitRestore(SQLUH_HANDLE* handle)
{
    pdtEntry();

    int rc = handle->restoreCode;
    if (rc == 0 && handle->restoreMarked) {
        SQLO_FHANDLE image = handle->fileHandle;
        rc = logged(sqloNLCKCheckHeld(&handle->namedLock));
        if (rc == 0)
            rc = logged(sqloreserve(handle->historyPath, handle->shadowPath));
        if (rc == 0)
            rc = sqluhKeepCommitted(handle);
        handle->fileHandle = image;
        if (rc == 0)
            rc = logged(sqlounmark(image));
    }

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
