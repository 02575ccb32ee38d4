// zq3hist copy, backup and restore: whole histories in and out of a directory.
#include "admin/pair.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

// Verifies the file at path, called name, and tells the number of its entries.
static int proveImage(const char* path, const char* name, const char* what, uint32_t* count)
{
    fileFinding finding;
    int rc = findInFile(path, what, &finding);
    *count = finding.entries.count;
    return rc != 0 ? failWithCode(rc, what, name) : failUnsound(&finding, name, what);
}

// Copies the committed history of a directory to the file at target, which is for where, under its
// lock. A history that is not whole is refused: opening it might take the worse of its two files.
static int copyCommitted(historyPlace* place, char* target, const char* what, const char* where)
{
    SQLUH_HANDLE* handle = nullptr;
    const fileFinding* finding = nullptr;
    pairFinding pair;
    int rc = lockPair(place, R_OK, &handle);
    if (rc == 0)
        rc = examinePair(place, false, &pair);
    const char* source = rc == 0 ? sourceOf(place, &pair, &finding) : nullptr;
    if (rc == 0 && (source == nullptr || pair.refused))
        rc = failPair(place, &pair, what);
    int code = rc == 0 ? sqlocopy(source, target, 0) : 0;
    if (rc == 0 && code == 0 && finding->file.header.status != statusConsistent)
        code = sqluhUpdateHeaderStatus(target, statusConsistent);
    if (code != 0)
        rc = failWithCode(code, what, where);
    if (rc == 0 && !pair.same) {
        fprintf(stderr, "zq3hist: warning: only %s is whole\n",
                source == place->historyPath ? SQLUH_HISTORY_NAME : SQLUH_SHADOW_NAME);
        hintAboutPair(place, &pair);
    }
    return unlockPair(place, &handle, rc);
}

// What a dry run of copy and backup tells: the entries that are committed.
static int countCommitted(const historyPlace* place, const char* what, uint32_t* count)
{
    const fileFinding* finding = nullptr;
    pairFinding pair;
    bool atWork;
    int rc = checkLock(place, R_OK);
    if (rc == 0)
        rc = examineQuietPair(place, true, &pair, &atWork);
    if (rc == 0 && sourceOf(place, &pair, &finding) == nullptr)
        rc = failPair(place, &pair, what);
    *count = finding != nullptr ? finding->entries.count : 0;
    return rc;
}

// What a dry run of copy and restore looks at: whether the history there can be replaced.
static int checkTarget(const historyPlace* place)
{
    bool isThere = hasHistoryFile(place) || ossPathExists(place->shadowPath);
    return isThere ? checkLock(place, R_OK | W_OK) : 0;
}

static void tellReplaced(const historyPlace* place, uint32_t count, const char* done, bool dryRun,
                         const keptFiles* kept)
{
    fileReport there;
    lookAtFile(place->historyPath, &there);
    printf("%u %s %s%s\n", count, entryWord(count), dryRun ? "would be " : "", done);
    if (dryRun && there.rc == 0 && there.header.entryCount != 0)
        printf("What is there would be kept: %u %s\n", there.header.entryCount,
               entryWord(there.header.entryCount));
    tellKept(kept);
}

int restoreMain(commandLine* line)
{
    historyPlace* place = &line->place;
    const char* image = line->arguments[0];
    char temporary[pathCapacity];
    SQLUH_HANDLE* handle = nullptr;
    keptFiles kept = {};
    uint32_t count = 0;
    int rc = formTemporary(place->historyPath, temporary);
    if (rc == 0)
        rc = proveImage(image, image, "restore the history", &count);
    if (rc == 0 && line->dryRun)
        rc = checkTarget(place);
    if (rc == 0 && !line->dryRun) {
        // The copy is what was verified, whatever happens to the image meanwhile: so it is verified
        // too.
        holdSignals();
        int copied = sqlocopy(image, temporary, 0);
        rc = copied != 0
                 ? failWithCode(copied, "copy the backup to the directory", place->directory)
                 : proveImage(temporary, image, "restore the history", &count);
        if (rc == 0)
            rc = installHistory(place, temporary, &kept, &handle);
        unlink(temporary);
    }
    if (rc == 0)
        tellReplaced(place, count, "restored", line->dryRun, &kept);
    return unlockPair(place, &handle, rc);
}

int copyMain(commandLine* line)
{
    historyPlace* source = &line->place;
    historyPlace* target = &line->target;
    char temporary[pathCapacity];
    SQLUH_HANDLE* handle = nullptr;
    keptFiles kept = {};
    uint32_t count = 0;
    int rc = formTemporary(target->historyPath, temporary);
    if (rc != 0)
        return rc;
    if (isSamePlace(source->directory, target->directory))
        return fail(target->directory, "source and target are the same directory");
    if (line->dryRun) {
        rc = countCommitted(source, "copy the history", &count);
        if (rc == 0)
            rc = checkTarget(target);
    } else {
        holdSignals();
        // One lock at a time: keys may clash, and the second lock would then wait for the first.
        rc = copyCommitted(source, temporary, "copy the history", target->directory);
        if (rc == 0)
            rc = proveImage(temporary, source->directory, "copy the history", &count);
        if (rc == 0)
            rc = installHistory(target, temporary, &kept, &handle);
        unlink(temporary);
    }
    if (rc == 0)
        tellReplaced(target, count, "copied", line->dryRun, &kept);
    return unlockPair(target, &handle, rc);
}

// --- Backup --------------------------------------------------------------------------------------

// A backup takes the place of an older one of that name only if it is told to, and never that of
// the history, which others may be using, nor of a device or a pipe.
static int checkBackupName(const historyPlace* place, const char* path, bool force)
{
    struct stat there;
    if (isHistoryFile(place, path))
        return fail(path, "the backup would replace the history itself");
    if (lstat(path, &there) != 0)
        return 0;
    if (!S_ISREG(there.st_mode))
        return fail(path, "the backup would replace something that is no regular file");
    return force ? 0 : fail(path, "there is a file of that name; --force replaces it");
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

// Makes an empty file that only this user may touch, for what goes to standard output: the lock
// must not be held until somebody has read it.
static int formPrivate(char* path)
{
    const char* folder = getenv("TMPDIR");
    int length = snprintf(path, pathCapacity, "%s/zq3histXXXXXX",
                          folder != nullptr && *folder ? folder : "/tmp");
    int descriptor = length < static_cast<int>(pathCapacity) ? mkstemp(path) : -1;
    if (descriptor < 0)
        return failWithCode(sqloSystemError | errno, "make a temporary file", path);
    close(descriptor);
    return 0;
}

// Removes the file at path and writes what it held to standard output, whose failures main tells.
static int writeOut(const char* path)
{
    char buffer[64 * 1024];
    size_t got;
    FILE* in = fopen(path, "r");
    if (in == nullptr)
        return sqloSystemError | errno;
    unlink(path);
    releaseSignals(); // nothing is left behind now, and the reader may be slow
    bool done = true;
    while (done && (got = fread(buffer, 1, sizeof buffer, in)) > 0)
        done = fwrite(buffer, 1, got, stdout) == got;
    int rc = ferror(in) == 0 ? 0 : sqloSystemError | errno;
    fclose(in);
    if (done)
        fflush(stdout);
    return rc;
}

int backupMain(commandLine* line)
{
    historyPlace* place = &line->place;
    const char* path = line->arguments[0];
    bool toOutput = strcmp(path, "-") == 0;
    char temporary[pathCapacity] = "";
    uint32_t count = 0;
    int rc = toOutput ? 0 : checkBackupName(place, path, line->force);
    if (rc == 0 && !line->dryRun)
        holdSignals();
    if (rc == 0 && toOutput && !line->dryRun)
        rc = formPrivate(temporary);
    else if (rc == 0)
        rc = formTemporary(path, temporary);
    if (rc != 0)
        return rc;
    if (line->dryRun) {
        rc = countCommitted(place, "back up the history", &count);
    } else {
        rc = copyCommitted(place, temporary, "back up the history", path);
        // A damaged history must not take the place of a good backup.
        if (rc == 0)
            rc = proveImage(temporary, place->directory, "back up the history", &count);
        if (rc == 0)
            rc = failInterrupted(place);
        int code = rc != 0 ? 0 : toOutput ? writeOut(temporary) : nameBackup(temporary, path);
        if (code != 0)
            rc = failWithCode(code, "write the backup", toOutput ? "standard output" : path);
        if (rc != 0)
            unlink(temporary);
    }
    if (rc == 0 && ferror(stdout) != 0)
        rc = exitFailed; // main says why
    if (rc == 0)
        fprintf(toOutput ? stderr : stdout, "%u %s %sbacked up\n", count, entryWord(count),
                line->dryRun ? "would be " : "");
    return rc;
}
