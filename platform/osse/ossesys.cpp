// The system calls under the files: repeated when interrupted, finished when they came out short,
// and the barriers.
#include "osse.h"

#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/uio.h>
#include <unistd.h>

int osseOpen(const char* path, int flags, mode_t permissions)
{
    int descriptor;
    do
        descriptor = open(path, flags | O_CLOEXEC | O_NOCTTY | O_NONBLOCK, permissions);
    while (descriptor < 0 && errno == EINTR);

    if (descriptor >= 0 && descriptor <= STDERR_FILENO) {
        const int low = descriptor;
        descriptor = fcntl(low, F_DUPFD_CLOEXEC, STDERR_FILENO + 1);
        const int number = errno;
        close(low);
        errno = number;
    }
    return descriptor;
}

int osseOpenRegular(const char* path, int flags, mode_t permissions, int* descriptor,
                    struct stat* status)
{
    *descriptor = -1;
    const int opened = osseOpen(path, flags, permissions);
    if (opened < 0)
        return systemFailure(errno);

    int rc = 0;
    if (fstat(opened, status) != 0)
        rc = systemFailure(errno);
    else if (!S_ISREG(status->st_mode))
        rc = systemFailure(S_ISDIR(status->st_mode) ? EISDIR : EINVAL);
    if (rc != 0) {
        close(opened);
        return rc;
    }
    *descriptor = opened;
    return 0;
}

// One call moves at most this much: more than the system transfers at once, and a ssize_t anywhere.
static constexpr size_t maxTransfer = size_t{1} << 30;

int osseReadAt(int descriptor, void* buffer, size_t count, off_t offset, size_t* done)
{
    *done = 0;
    while (*done < count) {
        const size_t left = count - *done < maxTransfer ? count - *done : maxTransfer;
        const ssize_t got = pread(descriptor, static_cast<char*>(buffer) + *done, left,
                                  offset + static_cast<off_t>(*done));
        if (got == 0)
            break;
        if (got > 0)
            *done += static_cast<size_t>(got);
        else if (errno != EINTR)
            return systemFailure(errno);
    }
    return 0;
}

// The file that this thread has made durable last, as it was then; it has written and opened
// nothing since.
static thread_local struct stat durable;
static thread_local bool isDurableKnown;

void osseForgetDurable(void)
{
    isDurableKnown = false;
}

int osseWriteAt(int descriptor, const void* buffer, size_t count, off_t offset, size_t* done)
{
    *done = 0;
    osseForgetDurable();
    while (*done < count) {
        const size_t left = count - *done < maxTransfer ? count - *done : maxTransfer;
        const ssize_t put = pwrite(descriptor, static_cast<const char*>(buffer) + *done, left,
                                   offset + static_cast<off_t>(*done));
        if (put == 0)
            return systemFailure(EIO);
        if (put > 0)
            *done += static_cast<size_t>(put);
        else if (errno != EINTR)
            return storeFailure(errno);
    }
    return 0;
}

ssize_t osseAppend(int descriptor, const void* bytes, size_t count)
{
    sigset_t limit, before, pending;
    sigemptyset(&limit);
    sigaddset(&limit, SIGXFSZ);
    sigpending(&pending);
    pthread_sigmask(SIG_BLOCK, &limit, &before);
    const ssize_t written = write(descriptor, bytes, count);
    if (written < 0 && errno == EFBIG && sigismember(&pending, SIGXFSZ) == 0) {
        const timespec none = {};
        sigtimedwait(&limit, nullptr, &none);
    }
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return written;
}

static bool barriersAreOff()
{
    const char* value = getenv("ZQ3SYNC");
    return value != nullptr && strcmp(value, "off") == 0;
}

int osseWriteDurably(int descriptor, const void* buffer, size_t count, off_t offset)
{
    iovec bytes = {const_cast<void*>(buffer), count};
    ssize_t put = -1;
    do
        put = barriersAreOff() ? pwrite(descriptor, buffer, count, offset)
                               : pwritev2(descriptor, &bytes, 1, offset, RWF_DSYNC);
    while (put < 0 && errno == EINTR);
    if (put < 0)
        return storeFailure(errno);
    return static_cast<size_t>(put) == count ? 0 : systemFailure(EIO);
}

// A sync that failed, even an interrupted one, is not repeated: the system reports the loss of
// written data once, and a second sync may succeed without it.
int osseSync(int descriptor)
{
    if (barriersAreOff())
        return 0;
    if (fdatasync(descriptor) != 0)
        return storeFailure(errno);
    isDurableKnown = fstat(descriptor, &durable) == 0;
    return 0;
}

int osseSyncUnlessDurable(int descriptor, const struct stat* status)
{
    const bool isDurable = isDurableKnown && status->st_ino == durable.st_ino &&
                           status->st_dev == durable.st_dev && status->st_size == durable.st_size &&
                           status->st_ctim.tv_sec == durable.st_ctim.tv_sec &&
                           status->st_ctim.tv_nsec == durable.st_ctim.tv_nsec;
    return isDurable ? 0 : osseSync(descriptor);
}

int osseSyncMode(int descriptor)
{
    if (barriersAreOff() || fsync(descriptor) == 0)
        return 0;
    return storeFailure(errno);
}

int osseSyncDirectoryOf(const char* path)
{
    if (barriersAreOff())
        return 0;

    // The system has taken the path, so it fits.
    char directory[PATH_MAX] = ".";
    const char* slash = strrchr(path, '/');
    if (slash != nullptr)
        snprintf(directory, sizeof directory, "%.*s", static_cast<int>(slash - path) + 1, path);
    const int descriptor = osseOpen(directory, O_RDONLY | O_DIRECTORY, 0);
    if (descriptor < 0)
        return systemFailure(errno);
    const int rc = fsync(descriptor) == 0 ? 0 : storeFailure(errno);
    close(descriptor);
    return rc;
}

int osseSetMark(int descriptor, const struct stat* status, bool marked)
{
    const mode_t mode = status->st_mode & ~static_cast<mode_t>(S_ISVTX | S_IFMT);
    if (osseIsMarked(status) == marked)
        return 0;
    return fchmod(descriptor, marked ? mode | S_ISVTX : mode) == 0 ? 0 : systemFailure(errno);
}

// A file is known by when it was changed, too: another one may get its inode, and whoever changes
// it has opened it.
struct refusedFile {
    dev_t device;
    ino_t inode;
    timespec changed;
    int code; // 0: no longer refused
};
// Each thread's own: what one of them could not open is no reason to refuse it to another.
static thread_local refusedFile refusedFiles[16];
static thread_local unsigned int nextRefused;

static refusedFile* findRefused(const struct stat* status)
{
    for (refusedFile& file : refusedFiles)
        if (file.code != 0 && file.device == status->st_dev && file.inode == status->st_ino &&
            memcmp(&file.changed, &status->st_ctim, sizeof file.changed) == 0)
            return &file;
    return nullptr;
}

void osseRefuse(const struct stat* status, int code)
{
    refusedFile* file = findRefused(status);
    if (file == nullptr && code != 0)
        file = &refusedFiles[nextRefused++ % 16];
    if (file != nullptr)
        *file = {status->st_dev, status->st_ino, status->st_ctim, code};
}

int osseRefusal(const struct stat* status)
{
    const refusedFile* file = status->st_size == 0 ? nullptr : findRefused(status);
    return file == nullptr ? 0 : file->code;
}
