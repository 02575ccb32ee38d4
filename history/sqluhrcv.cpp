// Recovery: the examination of the two files and the repairs.
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

#include <cstring>

#include "history/sqluhfun.h"
#include "history/sqluhist.h"
#include "history/sqluhlog.h"

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
        sqluhJoinPath(savedHistory, sizeof savedHistory, handle->directory,
                      SQLUH_SAVED_HISTORY_NAME);
        sqluhJoinPath(savedShadow, sizeof savedShadow, handle->directory, SQLUH_SAVED_SHADOW_NAME);
        traceFailure(sqlomove(handle->historyPath, savedHistory));
        traceFailure(sqlomove(handle->shadowPath, savedShadow));
        // Locked before there is anything in it. Someone else may have been first, and then has
        // made the pair.
        if (handle->isLocked)
            rc = logged(sqluhLockFileAtPath(handle));
        if (rc == 0 && !(handle->isLocked && examineFile(handle, handle->historyPath).usable))
            rc = sqluhCreate(handle->directory);
    }

    pdtExit(rc);
    return rc;
}

static int repair(SQLUH_HANDLE* handle, fileState history, fileState shadow)
{
    int rc = 0;
    if (!history.usable)
        rc = logged(sqluhRecoverHistoryFromShadow(handle));
    else if (history.status != statusConsistent || !shadow.usable)
        rc = logged(sqluhRecoverShadowFromHistory(handle));

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
