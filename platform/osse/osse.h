// What the sources of the OS-services layer share. Nothing declared here leaves the library.
#pragma once

#include <cerrno>
#include <cstdarg>
#include <cstddef>
#include <cstdint>
#include <sys/stat.h>
#include <sys/types.h>

#include "sqo/sqlo.h"

#define OSSE_EXPORT extern "C" __attribute__((visibility("default")))

// The code for the errno of a failed system call.
inline int systemFailure(int number)
{
    return sqloSystemError | number;
}

// The same for a call that stores data: having no space has a code of its own.
inline int storeFailure(int number)
{
    return number == ENOSPC || number == EDQUOT ? static_cast<int>(DISK_FULL)
                                                : systemFailure(number);
}

// open(2): repeated when interrupted, close-on-exec, without waiting for the other end of a pipe,
// never one of the three standard descriptors, which a program started without them would otherwise
// print into. Returns -1 with errno on failure.
int osseOpen(const char* path, int flags, mode_t permissions);

// Opens a regular file; anything else (directory, pipe, device) is refused without blocking. flags
// with O_CREAT create a missing file. Returns 0 with the file's status, or a code.
int osseOpenRegular(const char* path, int flags, mode_t permissions, int* descriptor,
                    struct stat* status);

// Transfers at an offset until count bytes are done or, reading, the file ends; *done is the number
// of bytes transferred, also on failure. Returns 0 or a code.
int osseReadAt(int descriptor, void* buffer, size_t count, off_t offset, size_t* done);
int osseWriteAt(int descriptor, const void* buffer, size_t count, off_t offset, size_t* done);

// Appends to a log in one write. One that may not grow must not end the process by a signal.
ssize_t osseAppend(int descriptor, const void* bytes, size_t count);

// A file's first bytes are what a reader recognises it by; they are written last. Few, so that what
// a device writes at once holds all of them, whatever the size of its sectors.
static constexpr size_t markLength = 8;

// Writes a few bytes and waits until they are on the disk, in one call: no process can stop between
// the two and leave the bytes to be seen by others and lost with the power. Returns 0 or a code.
int osseWriteDurably(int descriptor, const void* buffer, size_t count, off_t offset);

// Barriers; nothing happens while ZQ3SYNC is "off". osseSyncDirectoryOf takes the path of a file,
// osseSyncMode makes a changed mode durable, too, osseSyncUnlessDurable leaves out a file, of this
// status, that the thread has just made durable, with no write and no open since.
int osseSync(int descriptor);
int osseSyncUnlessDurable(int descriptor, const struct stat* status);
void osseForgetDurable(void);
int osseSyncMode(int descriptor);
int osseSyncDirectoryOf(const char* path);

// The mark of an incomplete file, in its mode: a permission bit that means nothing else on a file.
inline bool osseIsMarked(const struct stat* status)
{
    return (status->st_mode & S_ISVTX) != 0;
}
// Sets it or takes it off. Returns 0 or a code.
int osseSetMark(int descriptor, const struct stat* status, bool marked);

// What this thread could not open may be sound and must not be moved, emptied or copied over by it:
// osseRefuse remembers the code of the failure, until it is called with 0 or the file changes.
// osseRefusal returns it, or 0, also for an empty file, which has nothing to lose.
void osseRefuse(const struct stat* status, int code);
int osseRefusal(const struct stat* status);

// Text of one log or trace record in a buffer of fixed size, so that running out of memory can be
// logged too. What does not fit is cut, and the cut is marked.
struct osseText {
    char* data;
    size_t capacity;
    size_t length;
    bool cut;
};
void osseTextAdd(osseText* text, const char* bytes, size_t count);
void osseTextFormat(osseText* text, const char* format, ...) __attribute__((format(printf, 2, 3)));
// Adds the time and the process that every record begins with.
void osseTextStamp(osseText* text);
// Adds bytes so that they stay one record on one screen: control characters as \xNN, and a line
// feed as newLine says.
void osseTextAddEscaped(osseText* text, const char* bytes, size_t count, const char* newLine);
// Ends the record with a line feed.
void osseTextEnd(osseText* text);

// Writes a trace record about a memory request that failed.
void osseTraceMemory(size_t size, const char* file, unsigned int line);
