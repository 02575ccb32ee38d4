// Puts a whole history in the place of both files.
//
// It comes as a complete, verified file in the same directory. Stopped anywhere, the next open
// finds the old history or the new one:
//
//   the history file can be used                 it cannot
//   shadow := new, 'P'    history: the old one
//   history := new, 'C'   torn: the shadow, new  history := new, 'C'   torn: the shadow, old
//   shadow ' '            history: the new one   shadow := new, 'C'    history: the new one
//   history ' '           both                   history ' '           both
//
// A shadow with 'P' is rebuilt from a history file that can be used, and else is its source.
#include "admin/pair.h"

#include <cerrno>
#include <ctime>
#include <initializer_list>
#include <sys/stat.h>
#include <unistd.h>

int formTemporary(const char* where, char* path)
{
    int length = snprintf(path, pathCapacity, "%s.%d.tmp", where, getpid());
    return length < static_cast<int>(pathCapacity) ? 0 : fail(where, "the name is too long");
}

int lockPair(historyPlace* place, int rights, SQLUH_HANDLE** handle)
{
    int rc = awaitLock(place, rights);
    if (rc != 0)
        return rc;
    int code = sqluhHandleAllocAndInit(place->directory, handle);
    if (code == 0)
        code = sqluhLock(*handle);
    if (code == 0)
        return 0;
    sqluhHandleFree(handle);
    return failInPlace(code, "take the lock", place);
}

int unlockPair(const historyPlace* place, SQLUH_HANDLE** handle, int rc)
{
    if (*handle == nullptr)
        return rc;
    int code = sqluhUnlock(*handle);
    sqluhHandleFree(handle);
    if (rc == 0 && code != 0)
        rc = failInPlace(code, "release the lock", place);
    return rc;
}

// --- Keeping what is replaced --------------------------------------------------------------------

int keepFile(const char* path, char* kept)
{
    struct stat there;
    char stamp[32];
    time_t now = time(nullptr);
    tm local;
    kept[0] = '\0';
    if (stat(path, &there) != 0 || there.st_size <= headerLength)
        return 0; // it holds no entry
    strftime(stamp, sizeof stamp, "%Y%m%d%H%M%S", localtime_r(&now, &local));
    int length = snprintf(kept, pathCapacity, "%s.%s", path, stamp);
    for (int i = 2; length < static_cast<int>(pathCapacity) && ossPathExists(kept); i++)
        length = snprintf(kept, pathCapacity, "%s.%s.%d", path, stamp, i);
    int rc = length < static_cast<int>(pathCapacity) ? sqlocopy(path, kept, 0) : sqluhPathTooLong;
    if (rc == 0)
        return 0;
    unlink(kept);
    kept[0] = '\0';
    if (rc == sqloFileIncomplete)
        return 0; // it never was in force
    return failWithCode(rc, "keep the old file; nothing was changed", path);
}

int keepPair(SQLUH_HANDLE* handle, keptFiles* kept)
{
    *kept = {};
    int rc = keepFile(handle->historyPath, kept->history);
    return rc == 0 ? keepFile(handle->shadowPath, kept->shadow) : rc;
}

void tellKept(const keptFiles* kept)
{
    for (const char* path : {kept->history, kept->shadow})
        if (path[0] != '\0')
            printf("The old file is kept as %s\n", path);
}

void putJsonKept(jsonWriter* json, const keptFiles* kept)
{
    beginJson(json, "keptFiles", '[');
    for (const char* path : {kept->history, kept->shadow})
        if (path[0] != '\0')
            putJsonText(json, nullptr, path);
    endJson(json, ']');
}

// --- Replacing -----------------------------------------------------------------------------------

int replacePair(const historyPlace* place, SQLUH_HANDLE* handle, char* temporary)
{
    fileReport history;
    lookAtFile(handle->historyPath, &history);
    bool shadowFirst = history.state.usable;
    int rc = 0;
    if (shadowFirst) {
        rc = sqluhUpdateHeaderStatus(temporary, statusPending);
        if (rc == 0)
            rc = sqlocopy(temporary, handle->shadowPath, 0);
    }
    if (rc == 0)
        rc = sqluhUpdateHeaderStatus(temporary, statusCommitted);
    if (rc == 0)
        rc = sqlocopy(temporary, handle->historyPath, 0);
    if (rc == 0)
        rc = shadowFirst ? sqluhUpdateHeaderStatus(handle->shadowPath, statusConsistent)
                         : sqlocopy(temporary, handle->shadowPath, 0);
    if (rc == 0)
        rc = sqluhUpdateHeaderStatus(handle->historyPath, statusConsistent);
    if (rc == 0)
        return 0;
    rc = failWithCode(rc, "put the history in place", place->directory);
    hint(place, "zq3hist repair DIR  # finishes it or undoes it");
    return rc;
}

int installHistory(historyPlace* place, char* temporary, keptFiles* kept, SQLUH_HANDLE** handle)
{
    *handle = nullptr;
    int rc = failInterrupted(place);
    if (rc == 0)
        rc = createIfMissing(place);
    if (rc == 0)
        rc = lockPair(place, R_OK | W_OK, handle);
    if (rc == 0)
        rc = keepPair(*handle, kept);
    return rc == 0 ? replacePair(place, *handle, temporary) : rc;
}
