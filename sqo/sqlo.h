// The OS-services interface: files and memory. Declarations only; libzq3osse.so.1 provides them.
//
// A call that returns a code returns 0 or a negative one, as the call's comment says; where it says
// no more, sqloSystemError with the errno. A buffer or record stays its caller's, a path is
// terminated, and counts, sizes and offsets are in bytes.
#pragma once

#include <cstddef>
#include <cstdint>

#include "sqo/sqlca.h"

enum : int {
    END_OF_FILE = static_cast<int>(0x870F0009),     // a read met the end of the file
    DISK_FULL = static_cast<int>(0x850F000C),       // a write found no space
    sqloSystemError = static_cast<int>(0x83000000), // or-ed with the errno of the failed call
};
// What a file marked by sqlomark is refused with: ENODATA.
enum : int { sqloFileIncomplete = static_cast<int>(0x8300003D) };
// What an open that creates may return beside 0: done, the file was there before.
enum : int { sqloFileExisted = 0x070F00CB };

// An open file. Passed by value; the caller sets it back to sqloNoFile after every close.
struct SQLO_FHANDLE {
    int32_t descriptor; // -1: no file is open
    uint32_t layer;     // the layer's own; 0 at rest
};
static_assert(sizeof(SQLO_FHANDLE) == 8);
static constexpr SQLO_FHANDLE sqloNoFile = {-1, 0};

// Option words of sqloopenp. Any other word is refused.
enum : unsigned int {
    sqloOpenRead = 0x14,        // read an existing file
    sqloOpenUpdate = 0x4C,      // read and write an existing file
    sqloOpenShadow = 0x0C,      // read and write an existing file
    sqloOpenTouch = 0x19,       // write; create if missing, never truncate
    sqloOpenNew = 0x5A,         // read and write; create, or empty and take off the mark
    sqloOpenReplacement = 0x0F, // read and write; create
};
enum : unsigned int { sqloPermissions = 0640 };
enum : unsigned int { sqloFromStart = 0, sqloFromCurrent = 1, sqloFromEnd = 2 };
enum : unsigned int { sqloZeroFilled = 0x200 };

struct SMemPool; // a memory pool; null is the default pool

// Argument and result of ossFileGetInfoV9.
struct ossFileRequest {
    uint32_t version; // ossFileVersion
    const char* path;
    uint32_t reserved1;
    uint32_t reserved2;
    uint32_t level; // 1
};
enum : uint32_t { ossFileVersion = 0x09010003 };
struct ossFileInfo {
    uint64_t size; // bytes
    uint64_t reserved[15];
};

extern "C" {

// Opens a regular file and fills *fh, which is the caller's to close. options: one of the words
// above; permissions: bits of a file that this call creates. A file created by it is durably in its
// directory when the call returns. A file that this thread could not open or move may be sound:
// until an open of it succeeds, or somebody changes it, the thread neither empties nor moves it nor
// copies over it, and the code of the failure comes back instead. Returns 0 or sqloFileExisted with
// the file open; or, with *fh sqloNoFile, sqloFileIncomplete for a marked file that shall neither
// be made nor emptied, DISK_FULL when a created file's name could not be stored, that code, or
// sqloSystemError.
int sqloopenp(const char* path, unsigned int options, unsigned int permissions, SQLO_FHANDLE* fh);

// Closes a file. Its handle is of no use afterwards, whatever comes back.
int sqloclose(SQLO_FHANDLE fh);

// Reads count bytes at the current position and moves it past them. Returns 0 when all were
// delivered, END_OF_FILE when the file ended first, or sqloSystemError; *bytesRead holds the number
// delivered in every case.
int sqloread(SQLO_FHANDLE fh, void* buffer, uint32_t count, uint32_t* bytesRead);

// Writes count bytes at the current position and moves it past them. Returns 0 only when all were
// written, DISK_FULL when there was no space, or sqloSystemError; *bytesWritten holds the number
// written in every case. What is written first to a new file gets its first 8 bytes last, after the
// others are durable, or none at all.
int sqlowrite(SQLO_FHANDLE fh, const void* buffer, uint32_t count, uint32_t* bytesWritten);

// Move the position to offset from origin (start, current, end), also past the end of the file;
// *newOffset, unless null, receives the new position. On failure the position stays as it was.
int sqloseek(SQLO_FHANDLE fh, long long offset, unsigned int origin, long long* newOffset);
int sqlochgfileptr(SQLO_FHANDLE fh, long long offset, unsigned int origin, long long* newOffset);

// Makes everything that was written to the file durable. A failure is final: what was written may
// be lost, also when a second call returns 0. Returns 0, DISK_FULL or sqloSystemError.
int sqlosync(SQLO_FHANDLE fh);

// sqlomark marks an open, empty file as incomplete, durably. A marked file can be made, emptied,
// moved and replaced by a copy, which all but the move take the mark off, but neither opened for
// what is in it nor copied. sqlounmark takes the mark off a whole file; a stop at any moment leaves
// the file marked, or without its first bytes, or whole, and durable but for those bytes. Return 0,
// DISK_FULL or sqloSystemError.
int sqlomark(SQLO_FHANDLE fh);
int sqlounmark(SQLO_FHANDLE fh);

// Makes sure that target, which is not changed, has room to become a copy of source. Returns 0
// (also for a target that does not exist, and where the file system reserves nothing), DISK_FULL or
// sqloSystemError.
int sqloreserve(const char* source, const char* target);

// Makes target a durable copy of source, keeping target's inode if it exists. The source is made
// durable and the target's room reserved first; the target's first 8 bytes, by which it is
// recognised, are written last, so that nobody takes a copy that stopped part-way for a whole one.
// A copy of a file onto itself, or of a marked file, is refused. options: 0. Returns 0,
// sqloFileIncomplete, DISK_FULL, the code with which target could not be opened before, or
// sqloSystemError; the target then is as it was or empty, or is whole when only its closing failed.
int sqlocopy(const char* source, const char* target, unsigned int options);

// Renames source to target, durably. A target that holds anything is first kept under its own name
// with ".1", ".2", ... appended: whoever moves a damaged file aside loses nothing by doing it
// twice. A file that cannot be opened and read is refused: it may be sound. Returns 0, DISK_FULL or
// sqloSystemError.
int sqlomove(const char* source, const char* target);

// Deletes a file, durably. options: 0. Returns 0, DISK_FULL or sqloSystemError.
int sqlodelete(const char* path, unsigned int options);

// Tells whether anything stands at the path that can be looked at.
bool ossPathExists(const char* path);

// Fills info for the file that the request names.
int ossFileGetInfoV9(const ossFileRequest* request, ossFileInfo* info);

// snprintf: returns the length of the whole text, also when it was cut; negative on failure.
int ossSnprintf(char* buffer, size_t size, const char* format, ...)
    __attribute__((format(printf, 3, 4)));

// Allocates size bytes and stores the block's address through block, which belongs to the caller
// until sqlofmblkEx. options: sqloZeroFilled or 0. file, line: the place of the request. reserved:
// 0. On failure stores null.
int sqlogmblkEx(SMemPool* pool, size_t size, unsigned int options, void** block, const char* file,
                unsigned int line, unsigned int reserved);
void sqlofmblkEx(void* block);

// Resizes a block, keeping its contents; with sqloZeroFilled what is added is zero. On failure the
// block stays as it was.
int sqloMemBlockReallocate(void** block, size_t size, unsigned int options, const char* file,
                           unsigned int line);

// Initialises a communication area: identifier, length, code 0, blank texts.
void sqloinca(sqlca* ca);

// Returns the code to be handed to the engine for a code of a read or write. A code that is no
// failure (0, of a transfer that came out short) maps to an I/O error.
int sqlzGetZRCInfo(int code);

} // extern "C"
