// The calls that the tests stand in front of. Each goes on to the real one unless a test says no.
#include "directory/fixture.h"

#include <cstdarg>
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/uio.h>

static std::string_view service; // the OS-services call that is under way

static int enter(const char* name, int command)
{
    service = name;
    return onCall ? onCall(name, command) : 0;
}

static uint32_t movedOf(uint32_t usual)
{
    return movedByFailure < 0 ? usual : static_cast<uint32_t>(movedByFailure);
}

#define HOOK(name, parameters, arguments, command, failed)                                         \
    extern "C" int name parameters                                                                 \
    {                                                                                              \
        static const auto real = realOf(&name, #name);                                             \
        const int code = enter(#name, command);                                                    \
        return code == 0 ? real arguments : failed;                                                \
    }
HOOK(sqloopenp, (const char* path, unsigned word, unsigned bits, SQLO_FHANDLE* fh),
     (path, word, bits, fh), 0,
     (code > 0 ? real(path, word, bits, fh) : (*fh = sqloNoFile).descriptor, code))
HOOK(sqloclose, (SQLO_FHANDLE fh), (fh), 0, (real(fh), code))
HOOK(sqloread, (SQLO_FHANDLE fh, void* buffer, uint32_t count, uint32_t* done),
     (fh, buffer, count, done), 0,
     (real(fh, buffer, movedOf(0), done), code == onlyShort ? 0 : code))
HOOK(sqlowrite, (SQLO_FHANDLE fh, const void* buffer, uint32_t count, uint32_t* done),
     (fh, buffer, count, done), 0,
     (real(fh, buffer, movedOf(count / 2), done), code == onlyShort ? 0 : code))
HOOK(sqloseek, (SQLO_FHANDLE fh, long long offset, unsigned origin, long long* at),
     (fh, offset, origin, at), 0, code)
HOOK(sqlochgfileptr, (SQLO_FHANDLE fh, long long offset, unsigned origin, long long* at),
     (fh, offset, origin, at), 0, code)
HOOK(sqlosync, (SQLO_FHANDLE fh), (fh), 0, code)
HOOK(sqlomark, (SQLO_FHANDLE fh), (fh), 0, code)
HOOK(sqlounmark, (SQLO_FHANDLE fh), (fh), 0, code)
HOOK(sqloreserve, (const char* from, const char* to), (from, to), 0, code)
HOOK(sqlocopy, (const char* from, const char* to, unsigned word), (from, to, word), 0, code)
HOOK(sqlomove, (const char* from, const char* to), (from, to), 0, code)
HOOK(sqlodelete, (const char* path, unsigned word), (path, word), 0, code)
HOOK(ossFileGetInfoV9, (const ossFileRequest* request, ossFileInfo* info), (request, info), 0, code)
HOOK(sqlogmblkEx,
     (SMemPool * pool, size_t size, unsigned word, void** block, const char* file, unsigned line,
      unsigned zero),
     (pool, size, word, block, file, line, zero), 0, (*block = nullptr, code))
HOOK(sqloMemBlockReallocate, (void** block, size_t n, unsigned word, const char* s, unsigned line),
     (block, n, word, s, line), 0, code)
HOOK(semget, (key_t key, int count, int flags) noexcept, (key, count, flags), flags,
     (errno = code, -1))
HOOK(semop, (int id, sembuf* steps, size_t count) noexcept, (id, steps, count), steps->sem_op,
     (errno = code, -1))

extern "C" int semctl(int id, int number, int command, ...) noexcept
{
    static const auto real = realOf(&semctl, "semctl");
    va_list rest;
    va_start(rest, command);
    void* argument = va_arg(rest, void*);
    va_end(rest);
    const int code = enter("semctl", command);
    return code == 0 ? real(id, number, command, argument) : (errno = code, -1);
}

// --- System calls under the files ----------------------------------------------------------------

// Whether the test wants the system call to fail. Logs are none of its business.
static bool fails(const std::string& call, std::string_view path = "")
{
    const int number = onSystemCall && path != "/dev/null" ? onSystemCall(call) : 0;
    errno = number != 0 ? number : errno;
    return number != 0;
}

// What a call on an open file is to be logged as.
static diskOp opOn(int fd, diskKind kind, size_t at = 0)
{
    struct stat status;
    std::error_code ignored;
    static const auto real = realOf(&fstat, "fstat64");
    const auto path = std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(fd), ignored);
    return {kind, real(fd, &status) == 0 ? status.st_ino : 0, at, "", path.string()};
}

static diskOp writeTo(int fd, const void* bytes, size_t count, off_t offset)
{
    diskOp op = opOn(fd, diskWrite, static_cast<size_t>(offset));
    op.bytes.assign(static_cast<const char*>(bytes), count);
    return op;
}

// Lets a call happen as far as it may, logs it, and stops after it where it shall.
template <typename use>
static auto perform(const std::string& call, diskOp op, use happen) -> decltype(happen(0))
{
    if (fails(call))
        return errno == onlyShort ? 0 : -1;
    const size_t size = op.kind == diskWrite ? op.bytes.size() : 1;
    if (!disk.watching)
        return happen(std::min(size, longestWrite));
    size_t part = disk.stopped ? 0 : size;
    if (!disk.stopped && static_cast<int>(disk.log.size()) == disk.stop.call) {
        disk.stopped = true;
        part = std::min(size, disk.stop.cut);
    }
    const auto result = part == 0 ? -1 : happen(part);
    op.bytes = op.bytes.substr(0, part);
    op.name = std::filesystem::path(op.name).filename();
    op.newName = std::filesystem::path(op.newName).filename();
    if (result >= 0)
        disk.log.push_back(op);
    if (!disk.stopped)
        return result;
    errno = EIO;
    return -1;
}

extern "C" ssize_t pread(int fd, void* buffer, size_t count, off_t offset)
{
    static const auto real = realOf(&pread, "pread64");
    return fails("read") ? -1 : real(fd, buffer, count, offset);
}

extern "C" int fstat(int fd, struct stat* status) noexcept
{
    static const auto real = realOf(&fstat, "fstat64");
    const int rc = fails("status") ? -1 : real(fd, status);
    if (changeTime != 0)
        status->st_ctim = {changeTime, 0};
    return rc;
}

extern "C" int stat(const char* path, struct stat* status) noexcept
{
    static const auto real = realOf(&stat, "stat64");
    const int rc = real(path, status);
    if (changeTime != 0)
        status->st_ctim = {changeTime, 0};
    return rc;
}

extern "C" int close(int fd)
{
    static const auto real = realOf(&close, "close");
    const int rc = real(fd);
    return fails("close") ? -1 : rc;
}

extern "C" int fallocate(int fd, int mode, off_t offset, off_t length)
{
    static const auto real = realOf(&fallocate, "fallocate64");
    return fails("reserve " + std::to_string(length)) ? -1 : real(fd, mode, offset, length);
}

extern "C" ssize_t pwrite(int fd, const void* bytes, size_t count, off_t offset)
{
    static const auto real = realOf(&pwrite, "pwrite64");
    return perform("write " + std::to_string(count) + " at " + std::to_string(offset),
                   writeTo(fd, bytes, count, offset),
                   [&](size_t part) { return real(fd, bytes, part, offset); });
}

extern "C" int ftruncate(int fd, off_t length) noexcept
{
    static const auto real = realOf(&ftruncate, "ftruncate64");
    return perform("truncate", opOn(fd, diskTruncate, static_cast<size_t>(length)),
                   [&](size_t) { return real(fd, length); });
}

// Of all opens only one that creates or empties a file changes anything.
extern "C" int open(const char* path, int flags, ...)
{
    static const auto real = realOf(&open, "open64");
    va_list rest;
    va_start(rest, flags);
    const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0;
    va_end(rest);
    const bool exists = access(path, F_OK) == 0;
    if (fails("open", path))
        return -1;
    if (!disk.watching || (flags & (exists ? O_TRUNC : O_CREAT)) == 0)
        return real(path, flags, mode);
    int fd = -1;
    const int result = perform("create", {exists ? diskTruncate : diskCreate, 0, 0, "", path},
                               [&](size_t) { return fd = real(path, flags, mode); });
    if (fd >= 0)
        disk.log.back().inode = opOn(fd, diskCreate).inode;
    if (fd >= 0 && result < 0)
        close(fd);
    return result;
}

extern "C" int unlink(const char* path) noexcept
{
    static const auto real = realOf(&unlink, "unlink");
    return perform("unlink", {diskUnlink, 0, 0, "", path}, [&](size_t) { return real(path); });
}

extern "C" int rename(const char* path, const char* newPath) noexcept
{
    static const auto real = realOf(&rename, "rename");
    return perform("rename", {diskRename, 0, 0, "", path, newPath},
                   [&](size_t) { return real(path, newPath); });
}

// Of a batch B1 to B4; of a copy that of the source or of the body; those of a mark.
static std::string barrierName(int fd, bool withMode)
{
    const auto ofBatch = [](const diskOp& op) { return op.barrier.starts_with('B'); };
    if (service == "sqlowrite")
        return "N";
    if (service == "sqlosync" && disk.replacing)
        return "RP";
    if (service == "sqlosync")
        return std::string("B") + char('1' + std::ranges::count_if(disk.log, ofBatch));
    if (service == "sqlomark")
        return "MB";
    if (service == "sqlounmark")
        return withMode ? "MM" : "MZ";
    return (fcntl(fd, F_GETFL) & O_ACCMODE) == O_RDONLY ? "R0" : "CH";
}

// Nothing waits for a real disk here: what a sync does is in the log.
static int syncFile(int fd, bool withMode)
{
    diskOp op = opOn(fd, diskSync, withMode);
    op.barrier = barrierName(fd, withMode);
    return perform(withMode ? "sync all" : "sync", op, [](size_t) { return 0; });
}

extern "C" int fdatasync(int fd)
{
    return syncFile(fd, false);
}

extern "C" int fsync(int fd)
{
    if (std::filesystem::is_regular_file(opOn(fd, diskNames).name))
        return syncFile(fd, true);
    return perform("sync directory", {diskNames, 0, 0, "", "", "", "D"}, [](size_t) { return 0; });
}

// The write that waits, too: one call, in which no process can stop.
extern "C" ssize_t pwritev2(int fd, const iovec* bytes, int, off_t offset, int)
{
    if (without == "one call") {
        const ssize_t put = pwrite(fd, bytes->iov_base, bytes->iov_len, offset);
        return put < 0 || syncFile(fd, false) != 0 ? -1 : put;
    }
    static const auto real = realOf(&pwrite, "pwrite64");
    diskOp op = writeTo(fd, bytes->iov_base, bytes->iov_len, offset);
    op.barrier = "R4";
    return perform("write and wait for " + std::to_string(bytes->iov_len), op,
                   [&](size_t part) { return real(fd, bytes->iov_base, part, offset); });
}

extern "C" int fchmod(int fd, mode_t mode) noexcept
{
    static const auto real = realOf(&fchmod, "fchmod");
    return without == "mark" ? 0
                             : perform("mark", opOn(fd, diskMode, (mode & S_ISVTX) != 0),
                                       [&](size_t) { return real(fd, mode); });
}
