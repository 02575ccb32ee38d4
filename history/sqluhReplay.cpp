// Recording a batch's writes and repeating them in the shadow, and the checks of a file's position.
// Stands on the writing of headers and on verification.
//
// The shadow is brought up to date only after the history file durably says 'C'. Stopped at any
// moment of it, the next open finds that letter and copies the whole history file over the shadow,
// so nothing here has to be undone.

#include <cstring>

#include "history/sqluhDiagnostics.h"
#include "history/sqluhist.h"

// --- Recording -----------------------------------------------------------------------------------

static int growReplayArray(SQLUH_REPLAYAREA* area)
{
    void* block = area->replayEntries;
    uint32_t grown = area->maxReplayEntries + replayGrowth;
    int rc = sqloMemBlockReallocate(&block, size_t{grown} * sizeof(SQLUH_REPLAYENTRY),
                                    sqloZeroFilled, __FILE__, __LINE__);
    if (rc == 0) {
        area->replayEntries = static_cast<SQLUH_REPLAYENTRY*>(block);
        area->maxReplayEntries = grown;
    }
    return rc;
}

static int keepCopy(SQLUH_REPLAYENTRY* element, const char* bytes, unsigned int length)
{
    void* block = nullptr;
    int rc = allocateZeroed(length, &block);
    if (rc == 0) {
        memcpy(block, bytes, length);
        element->copy = static_cast<char*>(block);
    }
    return rc;
}

// From half of the file's entries on, copying the whole file is the cheaper way.
static bool replayWorthwhile(const SQLUH_REPLAYAREA* area, unsigned int entryCount)
{
    return area->numReplayEntries < entryCount / 2;
}

int sqluhAddReplayEntry(SQLUH_REPLAYAREA* area, long long offset, unsigned int length,
                        const char* bytes, unsigned int entryCount)
{
    pdtEntry();

    int rc = 0;
    if (area->replayDisabled == 0 && !replayWorthwhile(area, entryCount)) {
        area->replayDisabled = 1;
    } else if (area->replayDisabled == 0) {
        if (area->numReplayEntries == area->maxReplayEntries)
            rc = growReplayArray(area);
        if (rc == 0 && area->numReplayEntries == 0)
            rc = keepCopy(&area->replayEntries[0], bytes, length);
        if (rc == 0) {
            SQLUH_REPLAYENTRY* element = &area->replayEntries[area->numReplayEntries++];
            element->offset = offset;
            element->length = length;
            if (length > area->maxReplayLength)
                area->maxReplayLength = length;
        } else {
            area->replayDisabled = 1;
        }
    }

    pdtExit(rc);
    return rc;
}

// --- Replay --------------------------------------------------------------------------------------

static constexpr char replayWork[] = "sqluhReplayWorkInShadow"; // the operation that the log names

// The file handle is the caller's only way to the history file: closed before the copy, open after
// it.
static int copyWholeFile(SQLUH_HANDLE* handle)
{
    int rc = logged(sqloclose(handle->fileHandle), replayWork);
    handle->fileHandle = sqloNoFile;
    // The copy makes the shadow durable before the history file may say that they agree (B4).
    if (rc == 0)
        rc = logged(sqlocopy(handle->historyPath, handle->shadowPath, 0), replayWork);
    if (rc == 0) {
        rc = logged(
            sqloopenp(handle->historyPath, sqloOpenUpdate, sqloPermissions, &handle->fileHandle),
            replayWork);
        if (rc != 0)
            handle->fileHandle = sqloNoFile;
    }
    return rc;
}

static int writeInShadow(SQLO_FHANDLE shadow, const char* bytes, uint32_t length)
{
    uint32_t written = 0;
    int rc = sqlowrite(shadow, bytes, length, &written);
    if (rc == 0 && written != length)
        rc = transferCode(rc);
    return logged(rc, replayWork);
}

static int replayFromCopy(SQLO_FHANDLE shadow, const SQLUH_REPLAYENTRY* element)
{
    int rc = logged(sqloseek(shadow, element->offset, sqloFromStart, nullptr), replayWork);
    return rc == 0 ? writeInShadow(shadow, element->copy, element->length) : rc;
}

static int replayFromFile(SQLUH_HANDLE* handle, SQLO_FHANDLE shadow, char* buffer,
                          const SQLUH_REPLAYENTRY* element)
{
    uint32_t bytesRead = 0;
    int rc =
        logged(sqloseek(handle->fileHandle, element->offset, sqloFromStart, nullptr), replayWork);
    if (rc == 0)
        rc = logged(sqloseek(shadow, element->offset, sqloFromStart, nullptr), replayWork);
    if (rc == 0)
        rc = logged(sqloread(handle->fileHandle, buffer, element->length, &bytesRead), replayWork);
    return rc == 0 ? writeInShadow(shadow, buffer, bytesRead) : rc;
}

// The first element from its copy, the others from the history file, in the order of the writes.
static int replayElements(SQLUH_HANDLE* handle, SQLO_FHANDLE shadow)
{
    const SQLUH_REPLAYAREA* area = &handle->replayArea;
    void* buffer = nullptr;
    int rc = replayFromCopy(shadow, &area->replayEntries[0]);
    if (rc == 0 && area->numReplayEntries > 1) {
        rc = logged(allocateZeroed(area->maxReplayLength, &buffer), replayWork);
        for (uint32_t i = 1; rc == 0 && i < area->numReplayEntries; i++)
            rc =
                replayFromFile(handle, shadow, static_cast<char*>(buffer), &area->replayEntries[i]);
        if (buffer != nullptr)
            sqlofmblkEx(buffer);
    }
    return rc;
}

static int replayIntoShadow(SQLUH_HANDLE* handle)
{
    SQLO_FHANDLE shadow = sqloNoFile;
    int rc =
        logged(sqloopenp(handle->shadowPath, sqloOpenShadow, sqloPermissions, &shadow), replayWork);
    if (rc != 0)
        return rc;
    rc = logged(sqluhWriteHeader(shadow, &handle->header), replayWork);
    if (rc == 0)
        rc = replayElements(handle, shadow);
    // B4: durable before the history file may say that the shadow agrees with it.
    if (rc == 0)
        rc = logged(sqlosync(shadow), replayWork);
    return firstOf(rc, logged(sqloclose(shadow), replayWork));
}

int sqluhReplayWorkInShadow(SQLUH_HANDLE* handle)
{
    pdtEntry();

    int rc = 0;
    if (!replayWorthwhile(&handle->replayArea, handle->header.entryCount) ||
        handle->replayArea.replayDisabled != 0)
        rc = copyWholeFile(handle);
    else if (handle->replayArea.numReplayEntries != 0)
        rc = replayIntoShadow(handle);

    pdtExit(rc);
    return rc;
}

// --- Checks of a file's position -----------------------------------------------------------------

int sqluhVerifyCurrentEntry(SQLO_FHANDLE fileHandle, SQLUH_WORKAREA* workArea)
{
    pdtEntry();

    long long position = 0;
    int rc = logged(sqloseek(fileHandle, 0, sqloFromCurrent, &position));
    if (rc == 0) {
        rc = sqluhVerifyOneEntry(fileHandle, workArea);
        rc = firstOf(rc, logged(sqloseek(fileHandle, position, sqloFromStart, nullptr)));
    }

    pdtExit(rc);
    return rc;
}

int sqluhVerifySeekOffsetNotPastEOF(SQLO_FHANDLE fileHandle, long long offset)
{
    pdtEntry();

    long long position = 0;
    long long end = -1;
    int rc = logged(sqloseek(fileHandle, 0, sqloFromCurrent, &position));
    if (rc == 0) {
        sqloseek(fileHandle, 0, sqloFromEnd, &end);
        rc = logged(sqloseek(fileHandle, position, sqloFromStart, nullptr));
        // An offset past the end is where a read would find nothing: the reader's own code for it.
        if (rc == 0 && end >= 0 && offset > end)
            rc = END_OF_FILE;
    }

    pdtExit(rc);
    return rc;
}
