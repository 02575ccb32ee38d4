// Open files: a table of what the layer keeps for each, its position and its read-ahead buffer.
//
// The position is the layer's own, so that a seek costs no system call and a read ahead of the
// caller does not move anything the caller can see.
#include "osse.h"

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <pthread.h>
#include <unistd.h>

// A read-ahead starts small, so that reading a header stays cheap, and grows while the file is read
// on from where the buffer ends.
static constexpr size_t firstReadAhead = 4 * 1024;
static constexpr size_t readAheadGrowth = 4;
static constexpr size_t maxReadAhead = 256 * 1024;

struct openFile {
    int descriptor;
    off_t position;
    unsigned char* buffer; // allocated at the first small read
    size_t capacity;
    off_t bufferStart;   // where in the file the buffer begins
    size_t bufferLength; // bytes in it; 0: nothing is buffered
    size_t readAhead;    // bytes asked for by the last refill
    bool isNew;          // opened to be made anew, and nothing is written yet
};

static std::atomic<openFile*> openFiles[4096];
static pthread_mutex_t openFilesMutex = PTHREAD_MUTEX_INITIALIZER; // held to fill or empty a slot

// The slot of a handle; null when the handle is not open.
static std::atomic<openFile*>* findSlot(SQLO_FHANDLE fh)
{
    const size_t index = static_cast<size_t>(fh.layer) - 1;
    if (fh.layer == 0 || index >= sizeof openFiles / sizeof openFiles[0])
        return nullptr;
    const openFile* file = openFiles[index].load(std::memory_order_acquire);
    return file != nullptr && file->descriptor == fh.descriptor ? &openFiles[index] : nullptr;
}

static openFile* findFile(SQLO_FHANDLE fh)
{
    const std::atomic<openFile*>* slot = findSlot(fh);
    return slot == nullptr ? nullptr : slot->load(std::memory_order_relaxed);
}

// The open flags of an option word; -1 for a word that is refused.
static int flagsOfWord(unsigned int options)
{
    switch (options) {
    case sqloOpenRead:
        return O_RDONLY;
    case sqloOpenUpdate:
    case sqloOpenShadow:
        return O_RDWR;
    case sqloOpenTouch:
        return O_WRONLY | O_CREAT;
    case sqloOpenNew:
    case sqloOpenReplacement:
        return O_RDWR | O_CREAT;
    default:
        return -1;
    }
}

// Enters a descriptor into the table, whose property it then is.
static int enterFile(int descriptor, bool isNew, SQLO_FHANDLE* fh)
{
    openFile* file = static_cast<openFile*>(calloc(1, sizeof *file));
    if (file == nullptr)
        return systemFailure(ENOMEM);
    file->descriptor = descriptor;
    file->isNew = isNew;

    int rc = systemFailure(EMFILE);
    pthread_mutex_lock(&openFilesMutex);
    for (uint32_t i = 0; i < sizeof openFiles / sizeof openFiles[0]; i++) {
        if (openFiles[i].load(std::memory_order_relaxed) == nullptr) {
            openFiles[i].store(file, std::memory_order_release);
            *fh = {descriptor, i + 1};
            rc = 0;
            break;
        }
    }
    pthread_mutex_unlock(&openFilesMutex);
    if (rc != 0)
        free(file);
    return rc;
}

// Of a file that an open empties. One that the open made is empty already.
static int emptyFile(int descriptor, const struct stat* status)
{
    int rc = osseRefusal(status);
    if (rc == 0 && ftruncate(descriptor, 0) != 0)
        rc = systemFailure(errno);
    if (rc == 0 && osseIsMarked(status))
        rc = osseSetMark(descriptor, status, false);
    return rc == 0 && osseIsMarked(status) ? osseSyncMode(descriptor) : rc;
}

// Of a file that is opened for what is in it.
static int admitFile(const struct stat* status)
{
    osseRefuse(status, 0);
    return osseIsMarked(status) ? int{sqloFileIncomplete} : 0;
}

// Of a file that could not be opened: the reason may lie outside it (no descriptor, no right).
static void refuseUnopened(const char* path, int code)
{
    struct stat status;
    if (stat(path, &status) == 0)
        osseRefuse(&status, code);
}

OSSE_EXPORT int sqloopenp(const char* path, unsigned int options, unsigned int permissions,
                          SQLO_FHANDLE* fh)
{
    osseForgetDurable();
    *fh = sqloNoFile;
    const int flags = flagsOfWord(options);
    if (flags < 0)
        return systemFailure(EINVAL);

    int descriptor;
    struct stat status;
    int rc = osseOpenRegular(path, flags, permissions, &descriptor, &status);
    if (rc != 0)
        refuseUnopened(path, rc);
    if (rc == 0 && options == sqloOpenNew)
        rc = emptyFile(descriptor, &status);
    else if (rc == 0 && (flags & O_CREAT) == 0)
        rc = admitFile(&status);
    // D, also for a file that was there: whoever made it may have stopped before this.
    if (rc == 0 && (flags & O_CREAT) != 0)
        rc = osseSyncDirectoryOf(path);
    if (rc == 0)
        rc = enterFile(descriptor, options == sqloOpenNew, fh);
    if (rc != 0 && descriptor >= 0)
        close(descriptor);
    return rc;
}

OSSE_EXPORT int sqloclose(SQLO_FHANDLE fh)
{
    pthread_mutex_lock(&openFilesMutex);
    std::atomic<openFile*>* slot = findSlot(fh);
    openFile* file = slot == nullptr ? nullptr : slot->exchange(nullptr);
    pthread_mutex_unlock(&openFilesMutex);
    if (file == nullptr)
        return systemFailure(EBADF);

    // An interrupted close has released the descriptor: repeating it could close another file.
    const int rc = close(file->descriptor) == 0 || errno == EINTR ? 0 : systemFailure(errno);
    free(file->buffer);
    free(file);
    return rc;
}

static off_t bufferEnd(const openFile* file)
{
    return file->bufferStart + static_cast<off_t>(file->bufferLength);
}

// Refills the buffer at the position, for a read that wants some bytes there, fewer than
// maxReadAhead. Nothing in the buffer afterwards: the file ends at the position.
static int refill(openFile* file, size_t wanted)
{
    size_t size = firstReadAhead;
    if (file->bufferLength != 0 && file->position == bufferEnd(file))
        size = file->readAhead * readAheadGrowth;
    while (size < wanted)
        size *= readAheadGrowth;
    if (size > maxReadAhead)
        size = maxReadAhead;

    file->bufferLength = 0;
    if (size > file->capacity) {
        free(file->buffer);
        file->buffer = static_cast<unsigned char*>(malloc(size));
        file->capacity = file->buffer == nullptr ? 0 : size;
        if (file->buffer == nullptr)
            return systemFailure(ENOMEM);
    }
    ssize_t got;
    do
        got = pread(file->descriptor, file->buffer, size, file->position);
    while (got < 0 && errno == EINTR);
    if (got < 0)
        return systemFailure(errno);
    file->bufferStart = file->position;
    file->bufferLength = static_cast<size_t>(got);
    file->readAhead = size;
    return 0;
}

// Takes up to count bytes at the position out of the buffer and returns their number.
static size_t takeBuffered(openFile* file, void* target, size_t count)
{
    if (file->bufferLength == 0 || file->position < file->bufferStart ||
        file->position >= bufferEnd(file))
        return 0;
    const size_t at = static_cast<size_t>(file->position - file->bufferStart);
    const size_t taken = count < file->bufferLength - at ? count : file->bufferLength - at;
    memcpy(target, file->buffer + at, taken);
    file->position += static_cast<off_t>(taken);
    return taken;
}

OSSE_EXPORT int sqloread(SQLO_FHANDLE fh, void* buffer, uint32_t count, uint32_t* bytesRead)
{
    *bytesRead = 0;
    openFile* file = findFile(fh);
    if (file == nullptr)
        return systemFailure(EBADF);

    unsigned char* target = static_cast<unsigned char*>(buffer);
    size_t done = takeBuffered(file, target, count);
    int rc = 0;
    while (rc == 0 && done < count) {
        size_t step = 0;
        if (count - done < maxReadAhead && refill(file, count - done) == 0) {
            step = takeBuffered(file, target + done, count - done);
        } else {
            // Too large for the buffer, no memory for one, or to meet the refill's failure again.
            file->bufferLength = 0;
            rc = osseReadAt(file->descriptor, target + done, count - done, file->position, &step);
            file->position += static_cast<off_t>(step);
        }
        if (rc == 0 && step == 0)
            rc = END_OF_FILE;
        done += step;
    }
    *bytesRead = static_cast<uint32_t>(done);
    return rc;
}

// Writes what a new file begins with as a copy does, the first bytes last: the device may keep the
// sectors of a header in any order, and a part of one must not pass for it.
static int writeNew(int descriptor, const unsigned char* bytes, size_t count, size_t* done)
{
    size_t put;
    int rc = osseWriteAt(descriptor, bytes + markLength, count - markLength, markLength, &put);
    if (rc == 0)
        rc = osseSync(descriptor); // N
    if (rc == 0)
        rc = osseWriteAt(descriptor, bytes, markLength, 0, &put);
    *done = rc == 0 ? count : 0;
    return rc;
}

OSSE_EXPORT int sqlowrite(SQLO_FHANDLE fh, const void* buffer, uint32_t count,
                          uint32_t* bytesWritten)
{
    *bytesWritten = 0;
    openFile* file = findFile(fh);
    if (file == nullptr)
        return systemFailure(EBADF);

    size_t done;
    file->bufferLength = 0;
    const bool begins = file->isNew && file->position == 0 && count > markLength;
    const int rc =
        begins ? writeNew(file->descriptor, static_cast<const unsigned char*>(buffer), count, &done)
               : osseWriteAt(file->descriptor, buffer, count, file->position, &done);
    file->isNew = false;
    file->position += static_cast<off_t>(done);
    *bytesWritten = static_cast<uint32_t>(done);
    return rc;
}

static int seekFile(SQLO_FHANDLE fh, long long offset, unsigned int origin, long long* newOffset)
{
    openFile* file = findFile(fh);
    if (file == nullptr)
        return systemFailure(EBADF);

    off_t base = 0;
    if (origin == sqloFromCurrent) {
        base = file->position;
    } else if (origin == sqloFromEnd) {
        struct stat status;
        if (fstat(file->descriptor, &status) != 0)
            return systemFailure(errno);
        base = status.st_size;
    } else if (origin != sqloFromStart) {
        return systemFailure(EINVAL);
    }
    off_t position;
    if (__builtin_add_overflow(base, offset, &position) || position < 0)
        return systemFailure(EINVAL);

    file->position = position;
    if (position < file->bufferStart || position > bufferEnd(file))
        file->bufferLength = 0;
    if (newOffset != nullptr)
        *newOffset = position;
    return 0;
}

OSSE_EXPORT int sqloseek(SQLO_FHANDLE fh, long long offset, unsigned int origin,
                         long long* newOffset)
{
    return seekFile(fh, offset, origin, newOffset);
}

OSSE_EXPORT int sqlochgfileptr(SQLO_FHANDLE fh, long long offset, unsigned int origin,
                               long long* newOffset)
{
    return seekFile(fh, offset, origin, newOffset);
}

OSSE_EXPORT int sqlosync(SQLO_FHANDLE fh)
{
    const openFile* file = findFile(fh);
    return file == nullptr ? systemFailure(EBADF) : osseSync(file->descriptor);
}

OSSE_EXPORT int sqlomark(SQLO_FHANDLE fh)
{
    const openFile* file = findFile(fh);
    struct stat status;
    if (file == nullptr)
        return systemFailure(EBADF);
    int rc = fstat(file->descriptor, &status) == 0 ? 0 : systemFailure(errno);
    if (rc == 0)
        rc = osseSetMark(file->descriptor, &status, true);
    return rc == 0 ? osseSyncMode(file->descriptor) : rc; // MB
}

// A mode cannot be changed and made durable in one call, contents can: while the mode changes, the
// first bytes are missing, and their return is what counts.
OSSE_EXPORT int sqlounmark(SQLO_FHANDLE fh)
{
    const openFile* file = findFile(fh);
    struct stat status;
    static const unsigned char blank[markLength] = {};
    unsigned char mark[markLength];
    size_t length, put;
    if (file == nullptr)
        return systemFailure(EBADF);
    int rc = fstat(file->descriptor, &status) == 0 ? 0 : systemFailure(errno);
    if (rc == 0)
        rc = osseReadAt(file->descriptor, mark, markLength, 0, &length);
    if (rc == 0)
        rc = osseWriteAt(file->descriptor, blank, length, 0, &put);
    if (rc == 0)
        rc = osseSync(file->descriptor); // MZ
    if (rc == 0)
        rc = osseSetMark(file->descriptor, &status, false);
    if (rc == 0)
        rc = osseSyncMode(file->descriptor); // MM
    return rc == 0 ? osseWriteAt(file->descriptor, mark, length, 0, &put) : rc;
}
