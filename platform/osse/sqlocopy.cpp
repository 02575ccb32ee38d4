// Whole files: copy, move, delete. Each is durable when it returns.
//
// The barriers of a copy, each before what relies on it:
//
//   R0  the source, unless B3 has      before the target is emptied
//   D   the target's name              before there is anything under it
//   CH  the target's body              before the first bytes that vouch for it
//   R4  the first bytes, and so all    in one call with their writing
#include "osse.h"

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

static constexpr size_t copyLength = size_t{256} * 1024;

// Reads the whole source once and keeps nothing: a source that cannot be read to its end must not
// cost the target its contents.
static int checkReadable(int source, unsigned char* buffer)
{
    for (off_t offset = 0;;) {
        size_t got;
        const int rc = osseReadAt(source, buffer, copyLength, offset, &got);
        if (rc != 0 || got == 0)
            return rc;
        offset += static_cast<off_t>(got);
    }
}

// Copies what follows the first bytes; *length is the number of bytes.
static int copyBody(int source, int target, unsigned char* buffer, off_t* length)
{
    *length = 0;
    for (;;) {
        size_t got, put;
        const off_t offset = static_cast<off_t>(markLength) + *length;
        int rc = osseReadAt(source, buffer, copyLength, offset, &got);
        if (rc == 0)
            rc = osseWriteAt(target, buffer, got, offset, &put);
        if (rc != 0 || got == 0)
            return rc;
        *length += static_cast<off_t>(got);
    }
}

// Makes sure that the target will find room for so many bytes, without changing it. A file system
// that reserves nothing is believed to have it.
static int reserveRoom(int target, off_t size)
{
    int result = 0;
    do
        result = size == 0 ? 0 : fallocate(target, FALLOC_FL_KEEP_SIZE, 0, size);
    while (result != 0 && errno == EINTR);
    return result == 0 || errno == EOPNOTSUPP ? 0 : storeFailure(errno);
}

// Replaces what the target holds. The order is what makes a stop harmless: with the target empty
// and its body durable before the first bytes exist, they never stand before another file's body.
static int replaceContents(int source, int target, const struct stat* was, unsigned char* buffer)
{
    unsigned char first[markLength];
    size_t firstRead;
    int rc = osseReadAt(source, first, markLength, 0, &firstRead);
    if (rc != 0)
        return rc;
    if (ftruncate(target, 0) != 0)
        return storeFailure(errno);

    off_t bodyLength;
    rc = copyBody(source, target, buffer, &bodyLength);
    if (rc == 0)
        rc = osseSetMark(target, was, false);
    if (rc == 0 && (bodyLength != 0 || was->st_size != 0))
        rc = osseSyncMode(target); // CH, for a mark that went off before, too
    if (rc == 0)
        rc = osseWriteDurably(target, first, firstRead, 0); // R4

    // A copy that failed must not look like one that was done; it also gives back the space.
    if (rc != 0) {
        [[maybe_unused]] const int ignored = ftruncate(target, 0);
    }
    return rc;
}

// The target keeps its inode: it is opened and emptied, not replaced.
static int copyToTarget(int source, const struct stat* from, const char* targetPath,
                        unsigned char* buffer)
{
    int target;
    struct stat to;
    int rc = osseOpenRegular(targetPath, O_WRONLY | O_CREAT, sqloPermissions, &target, &to);
    if (rc != 0)
        return rc;

    rc = osseRefusal(&to);
    if (from->st_dev == to.st_dev && from->st_ino == to.st_ino)
        rc = systemFailure(EINVAL);
    // D, also for a target that was there: whoever made it may have stopped before this. A target
    // with its first bytes then never loses its name.
    if (rc == 0)
        rc = osseSyncDirectoryOf(targetPath);
    if (rc == 0)
        rc = reserveRoom(target, from->st_size);
    if (rc == 0)
        rc = replaceContents(source, target, &to, buffer);
    if (close(target) != 0 && errno != EINTR && rc == 0)
        rc = storeFailure(errno);
    return rc;
}

OSSE_EXPORT int sqlocopy(const char* sourcePath, const char* targetPath, unsigned int options)
{
    if (options != 0)
        return systemFailure(EINVAL);
    int source;
    struct stat from;
    int rc = osseOpenRegular(sourcePath, O_RDONLY, 0, &source, &from);
    if (rc != 0)
        return rc;

    unsigned char* buffer = static_cast<unsigned char*>(malloc(copyLength));
    if (buffer == nullptr)
        rc = systemFailure(ENOMEM);
    if (rc == 0)
        rc = osseIsMarked(&from) ? int{sqloFileIncomplete}
                                 : osseSyncUnlessDurable(source, &from); // R0
    if (rc == 0)
        rc = checkReadable(source, buffer);
    if (rc == 0)
        rc = copyToTarget(source, &from, targetPath, buffer);
    free(buffer);
    close(source);
    return rc;
}

OSSE_EXPORT int sqloreserve(const char* sourcePath, const char* targetPath)
{
    int target;
    struct stat from, to;
    if (stat(sourcePath, &from) != 0)
        return systemFailure(errno);
    int rc = osseOpenRegular(targetPath, O_WRONLY, 0, &target, &to);
    if (rc != 0)
        return rc == systemFailure(ENOENT) ? 0 : rc;
    rc = reserveRoom(target, from.st_size);
    close(target);
    return rc;
}

// Whether something stands at the path that a move must not lose.
static bool isOccupied(const char* path)
{
    struct stat status;
    return lstat(path, &status) == 0 && !(S_ISREG(status.st_mode) && status.st_size == 0);
}

// A path that the system takes, and a number.
static constexpr size_t keptCapacity = PATH_MAX + sizeof ".4294967295";

// Finds the first name path.1, path.2, ... that nothing has.
static int nameToKeep(const char* path, char (&name)[keptCapacity])
{
    struct stat status;
    unsigned int number = 1;
    do
        snprintf(name, sizeof name, "%s.%u", path, number++);
    while (lstat(name, &status) == 0);
    return errno == ENOENT ? 0 : systemFailure(errno);
}

// Renames, first giving what occupies the target a name of its own; takes that back on failure.
static int renameKeepingTarget(const char* source, const char* target)
{
    char kept[keptCapacity];
    const bool occupied = isOccupied(target);
    if (occupied) {
        const int rc = nameToKeep(target, kept);
        if (rc != 0)
            return rc;
        if (rename(target, kept) != 0)
            return systemFailure(errno);
    }
    if (rename(source, target) == 0)
        return 0;
    const int rc = systemFailure(errno);
    if (occupied) {
        [[maybe_unused]] const int ignored = rename(kept, target);
    }
    return rc;
}

static bool areInOneDirectory(const char* a, const char* b)
{
    const char* slashA = strrchr(a, '/');
    const char* slashB = strrchr(b, '/');
    const ptrdiff_t lengthA = slashA == nullptr ? 0 : slashA + 1 - a;
    const ptrdiff_t lengthB = slashB == nullptr ? 0 : slashB + 1 - b;
    return lengthA == lengthB && memcmp(a, b, static_cast<size_t>(lengthA)) == 0;
}

// A file that cannot be read just now, be it for want of memory, may be sound: it stays where it is
// looked for. So does one that could not be opened when it was looked at last.
static int checkMovable(const char* path, const struct stat* status)
{
    int source = -1;
    struct stat opened;
    size_t got;
    if (!S_ISREG(status->st_mode))
        return 0;
    unsigned char* buffer = static_cast<unsigned char*>(malloc(copyLength));
    int rc = buffer == nullptr ? systemFailure(ENOMEM) : osseRefusal(status);
    if (rc == 0)
        rc = osseOpenRegular(path, O_RDONLY, 0, &source, &opened);
    if (rc == 0)
        rc = osseReadAt(source, buffer, copyLength, 0, &got);
    if (source != -1)
        close(source);
    free(buffer);
    return rc;
}

OSSE_EXPORT int sqlomove(const char* source, const char* target)
{
    // Looked at first: a source that is missing, or is the target, must not displace the target.
    struct stat from, to;
    if (lstat(source, &from) != 0)
        return systemFailure(errno);
    if (lstat(target, &to) == 0 && from.st_dev == to.st_dev && from.st_ino == to.st_ino)
        return systemFailure(EINVAL);

    int rc = checkMovable(source, &from);
    if (rc == 0)
        rc = renameKeepingTarget(source, target);
    osseRefuse(&from, rc);
    if (rc == 0)
        rc = osseSyncDirectoryOf(target);
    if (rc == 0 && !areInOneDirectory(source, target))
        rc = osseSyncDirectoryOf(source);
    return rc;
}

OSSE_EXPORT int sqlodelete(const char* path, unsigned int options)
{
    if (options != 0)
        return systemFailure(EINVAL);
    if (unlink(path) != 0)
        return systemFailure(errno);
    return osseSyncDirectoryOf(path);
}
