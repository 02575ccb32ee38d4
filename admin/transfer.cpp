// zq3hist copy, backup and restore: whole histories in and out of a directory.
//
// A history that is put in place comes in as a complete, verified file in the target's directory,
// its header saying 'C': the history file is copied from it, header last, and the shadow from the
// history file. Stopped anywhere, the next open finds the old history in the shadow, or the new one
// in the history file with a letter that makes it the source of the shadow.
#include "admin/zq3hist.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

enum : unsigned int { pieceLength = 1024 * 1024 };

static int formTemporary(const char* where, char* path)
{
    int length = snprintf(path, pathCapacity, "%s.%d.tmp", where, getpid());
    return length < static_cast<int>(pathCapacity) ? 0 : fail(where, "the name is too long");
}

// Whether two paths lead to one file or directory.
static bool isSame(const char* a, const char* b)
{
    struct stat first, second;
    return stat(a, &first) == 0 && stat(b, &second) == 0 && first.st_dev == second.st_dev &&
           first.st_ino == second.st_ino;
}

// Puts the verified file at temporary in the place of the target's history.
static int installHistory(historyPlace* place, char* temporary)
{
    SQLUH_HANDLE* handle = nullptr;
    int rc = createIfMissing(place);
    if (rc == 0)
        rc = awaitLock(place, R_OK | W_OK);
    if (rc != 0)
        return rc;
    rc = sqluhUpdateHeaderStatus(temporary, statusCommitted);
    if (rc == 0)
        rc = sqluhOpen(&handle, place->directory, SQLUH_OPEN_READ);
    if (rc == HISTORY_FILE_RECREATED)
        rc = 0; // what is replaced was not usable
    if (rc == 0 && handle != nullptr) {
        rc = sqloclose(handle->fileHandle);
        handle->fileHandle = sqloNoFile;
    }
    if (rc == 0)
        rc = sqlocopy(temporary, handle->historyPath, 0);
    if (rc == 0)
        rc = sqluhRecoverShadowFromHistory(handle);
    int closed = sqluhClose(&handle);
    releaseSignals();
    rc = rc != 0 ? rc : closed;
    return rc == 0 ? 0 : failOpening(rc, "put the history in place", place);
}

int restoreMain(commandLine* line)
{
    historyPlace* place = &line->place;
    const char* image = line->arguments[0];
    char temporary[pathCapacity];
    int rc = formTemporary(place->historyPath, temporary);
    if (rc != 0)
        return rc;
    if (!isSoundImage(image, image, "restore the history"))
        return exitFailed;
    // The copy is what was verified, whatever happens to the image meanwhile: so it is verified
    // too.
    int copied = sqlocopy(image, temporary, 0);
    if (copied != 0)
        rc = failWithCode(copied, "copy the backup to the directory", place->directory);
    if (rc == 0 && !isSoundImage(temporary, image, "restore the history"))
        rc = exitFailed;
    if (rc == 0)
        rc = installHistory(place, temporary);
    unlink(temporary);
    if (rc == 0)
        puts("The history was restored.");
    return rc;
}

int copyMain(commandLine* line)
{
    historyPlace* source = &line->place;
    historyPlace* target = &line->target;
    SQLUH_HANDLE* handle = nullptr;
    char temporary[pathCapacity];
    int rc = formTemporary(target->historyPath, temporary);
    if (rc != 0)
        return rc;
    if (isSame(source->directory, target->directory))
        return fail(target->directory, "source and target are the same directory");

    // One lock at a time: keys may clash, and the second lock would then wait for the first.
    rc = openHistory(source, SQLUH_OPEN_READ, &handle);
    if (rc == 0) {
        int copied = sqlocopy(source->historyPath, temporary, 0);
        if (copied != 0)
            rc = failWithCode(copied, "copy the history", target->directory);
        int closed = closeHistory(source, &handle, "close the history");
        rc = rc != 0 ? rc : closed;
    }
    if (rc == 0 && !isSoundImage(temporary, source->directory, "copy the history"))
        rc = exitFailed;
    if (rc == 0)
        rc = installHistory(target, temporary);
    unlink(temporary);
    if (rc == 0)
        puts("The history was copied.");
    return rc;
}

// A backup takes the place of an older one of that name, but neither of the history, which others
// may be using, nor of a device or a pipe.
static int checkBackupName(const historyPlace* place, const char* path)
{
    struct stat there;
    if (isSame(path, place->historyPath) || isSame(path, place->shadowPath))
        return fail(path, "the backup would replace the history itself");
    if (lstat(path, &there) == 0 && !S_ISREG(there.st_mode))
        return fail(path, "the backup would replace something that is no regular file");
    return 0;
}

// Reads the open history piece by piece into the file at path, which is durable afterwards.
static int writeBackup(SQLUH_HANDLE* handle, const char* path)
{
    SQLO_FHANDLE file = sqloNoFile;
    long long size = 0;
    unsigned int offset = 0;
    unsigned int got = pieceLength;
    uint32_t written = 0;
    int rc = sqloseek(handle->fileHandle, 0, sqloFromEnd, &size);
    if (rc == 0 && size > UINT32_MAX)
        rc = sqloSystemError | EFBIG; // pieces are placed by 32-bit offsets
    unsigned char* buffer = static_cast<unsigned char*>(malloc(pieceLength));
    if (rc == 0 && buffer == nullptr)
        rc = sqloSystemError | ENOMEM;
    if (rc == 0)
        rc = sqloopenp(path, sqloOpenNew, sqloPermissions, &file);
    while (rc == 0 && got == pieceLength) {
        rc = sqluh_fill_backup_buffer(handle, offset, pieceLength, buffer, &got);
        if (rc == 0)
            rc = sqlowrite(file, buffer, got, &written);
        offset += got;
    }
    if (rc == 0)
        rc = sqlosync(file);
    if (file.descriptor != sqloNoFile.descriptor) {
        int closed = sqloclose(file);
        rc = rc != 0 ? rc : closed;
    }
    free(buffer);
    return rc;
}

// Gives the finished backup its name, durably; a backup of that name is replaced as a whole.
static int nameBackup(const char* temporary, const char* path)
{
    char folder[pathCapacity];
    const char* slash = strrchr(path, '/');
    snprintf(folder, sizeof folder, "%.*s",
             slash == nullptr ? 1 : static_cast<int>(slash - path + 1),
             slash == nullptr ? "." : path);
    int descriptor = open(folder, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    int rc = descriptor >= 0 && rename(temporary, path) == 0 && fsync(descriptor) == 0
                 ? 0
                 : sqloSystemError | errno;
    if (descriptor >= 0)
        close(descriptor);
    return rc;
}

int backupMain(commandLine* line)
{
    historyPlace* place = &line->place;
    const char* path = line->arguments[0];
    SQLUH_HANDLE* handle = nullptr;
    char temporary[pathCapacity];
    int rc = checkBackupName(place, path);
    if (rc == 0)
        rc = formTemporary(path, temporary);
    if (rc == 0)
        rc = openHistory(place, SQLUH_OPEN_READ, &handle);
    if (rc != 0)
        return rc;
    int stored = writeBackup(handle, temporary);
    rc = closeHistory(place, &handle, "close the history");
    if (rc == 0 && stored == 0 && !isSoundImage(temporary, place->directory, "back up the history"))
        rc = exitFailed; // a damaged history must not take the place of a good backup
    if (rc == 0 && stored == 0)
        stored = nameBackup(temporary, path);
    if (rc == 0 && stored != 0)
        rc = failWithCode(stored, "write the backup", path);
    if (rc != 0)
        unlink(temporary);
    else
        puts("The history was backed up.");
    return rc;
}
