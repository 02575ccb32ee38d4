// Taking a snapshot, and counting its entries on the way.
//
// A scan needs the number of its entries, and the largest number of names, before the first entry
// is delivered, and the lock must not be held while the caller thinks. Two passes over the live
// file would do without a copy; but a batch undone, a restore or a repair between two gets would
// turn the rest of the scan into another history's entries, or into damage. The copy goes to a
// nameless file among the temporary ones, whose pages can be written out. Counted while it is made,
// the entries cost nothing more.
#include "platform/client/snapshot.h"

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include "history/sqluhColumns.h"

static constexpr size_t copyLength = 256 * 1024;

// As much of an entry's first line as tells its size and its number of tablespaces.
static constexpr uint32_t countedLength =
    entryFields[fieldNumTablespaces].at + entryFields[fieldNumTablespaces].width;

// The state of counting while the file goes by.
struct entryCount {
    long long next;          // where the next entry begins
    long long size;          // of the file
    uint32_t rows;           // entries that begin before next
    uint32_t maxTablespaces; // names of one of them
    bool reader;             // the entry at next takes the library's reader
    bool damaged;            // the last row counted cannot be whole: no entry is found after it
};

// Reads an entry's size and number of names by column, when all columns up to there stand as the
// writer writes them; the reader then finds the same numbers in them.
static bool takeCounts(const char* line, uint32_t* size, uint32_t* numTablespaces)
{
    static const unsigned int numbers[] = {fieldNoteLength, fieldLongTextLength,
                                           fieldQualifierLength, fieldNameLength};
    uint32_t ignored;
    bool colons = true;
    for (unsigned int i = fieldChecksum; i < fieldNumTablespaces; i++)
        colons &= line[entryFields[i].at + entryFields[i].width] == ':';
    if (!colons || line[entryFields[fieldStatus].at] == ':' ||
        !hexColumns(line + entryFields[fieldChecksum].at, &ignored) ||
        !hexColumns(line + entryFields[fieldNumber].at, &ignored) ||
        !hexColumns(line + entryFields[fieldSize].at, size) ||
        !decimalColumns(line + entryFields[fieldVersion].at, &ignored) ||
        !hexColumns(line + entryFields[fieldNumTablespaces].at, numTablespaces))
        return false;
    for (unsigned int field : numbers)
        if (!hexColumns(line + entryFields[field].at, &ignored))
            return false;
    return hexDigitsAt(line + entryFields[fieldNode].at, entryFields[fieldNode].width, &ignored);
}

// A count that the entry's own size cannot hold belongs to a damaged entry, which no get will
// deliver: the caller must not make room for it.
static void countRow(entryCount* count, uint32_t size, uint32_t numTablespaces)
{
    count->rows++;
    count->damaged = size < entryMinLength || size > count->size - count->next;
    count->next = count->damaged ? count->size : count->next + size;
    if (!count->damaged && numTablespaces > count->maxTablespaces &&
        numTablespaces <= (size - entryMinLength) / tablespaceLineExtra)
        count->maxTablespaces = numTablespaces;
}

// Counts the entries that begin in the bytes from start to end of the file, which stand at buffer.
static void countPiece(entryCount* count, const char* buffer, long long start, long long end)
{
    while (!count->reader && count->next + countedLength <= end) {
        uint32_t size = 0;
        uint32_t numTablespaces = 0;
        if (takeCounts(buffer + (count->next - start), &size, &numTablespaces))
            countRow(count, size, numTablespaces);
        else
            count->reader = true;
    }
}

static int writeAll(int descriptor, const char* bytes, size_t length)
{
    while (length > 0) {
        ssize_t written = write(descriptor, bytes, length);
        if (written < 0 && errno == EINTR)
            continue;
        if (written < 0)
            return errno == ENOSPC || errno == EDQUOT ? static_cast<int>(DISK_FULL)
                                                      : sqloSystemError | errno;
        bytes += written;
        length -= static_cast<size_t>(written);
    }
    return 0;
}

// Copies the whole open file to the descriptor. The buffer is small enough to stay in the cache
// between reading, counting and writing; the rest of a line that the next piece completes is kept
// in front of that piece.
static int copyAndCount(SQLO_FHANDLE from, int descriptor, char* buffer, entryCount* count)
{
    int rc = sqloseek(from, 0, sqloFromStart, nullptr);
    size_t kept = 0;
    long long done = 0;
    while (rc == 0) {
        uint32_t got = 0;
        rc = sqloread(from, buffer + kept, copyLength, &got);
        if (rc != 0 && rc != END_OF_FILE)
            return rc;
        int stored = writeAll(descriptor, buffer + kept, got);
        if (stored != 0)
            return stored;
        long long start = done - static_cast<long long>(kept);
        done += got;
        countPiece(count, buffer, start, done);
        kept = count->next < done && done - count->next < countedLength
                   ? static_cast<size_t>(done - count->next)
                   : 0;
        memmove(buffer, buffer + (done - start) - kept, kept);
    }
    return done == count->size ? 0 : HISTORY_FILE_DAMAGED;
}

// Counts on from an entry that is not written as the writer writes it. After the first one that
// cannot be read nothing is found any more.
static int countByReader(SQLO_FHANDLE file, SQLUH_WORKAREA* workArea, entryCount* count)
{
    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    SQLUH_ENTRYWALK walk = {file, &entry, workArea, 0, false};
    int rc = sqloseek(file, count->next, sqloFromStart, nullptr);
    while (rc == 0 && count->next < count->size && !count->damaged) {
        bool whole = sqluhNextEntry(&walk) == 0;
        countRow(count, whole ? entry.size : 0, data.numTablespaces);
    }
    return rc;
}

// Opens a file that has no name any more, to be written through the descriptor and read through the
// OS-services layer, which knows files by path only: among the temporary files, or in memory.
static int openNameless(bool inMemory, int* descriptor, SQLO_FHANDLE* file)
{
    char path[PATH_MAX] = "";
    const char* folder = getenv("TMPDIR");
    if (folder == nullptr || folder[0] == '\0')
        folder = "/tmp";
    if (inMemory) {
        *descriptor = memfd_create("zq3 history scan", MFD_CLOEXEC);
        snprintf(path, sizeof path, "/proc/self/fd/%d", *descriptor);
    } else if (snprintf(path, sizeof path, "%s/zq3scan.XXXXXX", folder) < PATH_MAX) {
        *descriptor = mkostemp(path, O_CLOEXEC);
    } else {
        errno = ENAMETOOLONG;
    }
    if (*descriptor < 0)
        return sqloSystemError | errno;
    int rc = sqloopenp(path, sqloOpenRead, sqloPermissions, file);
    if (!inMemory)
        unlink(path);
    return rc;
}

static void closeCopy(int* descriptor, SQLO_FHANDLE* file)
{
    if (*descriptor >= 0)
        close(*descriptor);
    if (file->descriptor != sqloNoFile.descriptor)
        sqloclose(*file);
    *descriptor = -1;
    *file = sqloNoFile;
}

// Copies the history into a nameless file of the one or the other kind.
static int copyInto(bool inMemory, SQLO_FHANDLE from, int* descriptor, SQLO_FHANDLE* file,
                    entryCount* count)
{
    *count = {};
    count->next = headerLength;
    int rc = sqloseek(from, 0, sqloFromEnd, &count->size);
    if (rc != 0)
        return rc;
    char* buffer = static_cast<char*>(malloc(copyLength + countedLength));
    if (buffer == nullptr)
        return sqloSystemError | ENOMEM;
    rc = openNameless(inMemory, descriptor, file);
    if (rc == 0)
        rc = copyAndCount(from, *descriptor, buffer, count);
    free(buffer);
    return rc;
}

// A folder for temporary files that is full, or cannot be written, keeps nobody from a plan: the
// copy then goes into memory.
static int copyHistory(SQLO_FHANDLE from, int* descriptor, SQLO_FHANDLE* file, entryCount* count)
{
    int rc = copyInto(false, from, descriptor, file, count);
    if (rc != 0) {
        closeCopy(descriptor, file);
        if (copyInto(true, from, descriptor, file, count) == 0)
            rc = 0;
    }
    return rc;
}

// Settles what the copying left open, and positions the copy at its first entry.
static int settleSnapshot(SQLUH_WORKAREA* workArea, entryCount* count, historySnapshot* snapshot)
{
    int rc = 0;
    if (count->reader)
        rc = countByReader(snapshot->file, workArea, count);
    // What is left of an entry's first line: an entry all the same, or the scan would seem
    // complete.
    if (rc == 0 && count->next < count->size)
        countRow(count, 0, 0);
    if (rc == 0)
        rc = sqloseek(snapshot->file, headerLength, sqloFromStart, nullptr);
    snapshot->numRows = count->rows;
    snapshot->maxTablespaces = count->maxTablespaces;
    return rc;
}

int takeSnapshot(char* directory, SQLUH_WORKAREA* workArea, historySnapshot* snapshot)
{
    SQLUH_HANDLE* handle = nullptr;
    entryCount count = {};
    int descriptor = -1;
    *snapshot = {};
    snapshot->file = sqloNoFile;

    int warning = sqluhOpen(&handle, directory, SQLUH_OPEN_READ);
    if (warning < 0)
        return warning;
    int rc = copyHistory(handle->fileHandle, &descriptor, &snapshot->file, &count);
    int closed = sqluhClose(&handle);
    if (rc == 0)
        rc = closed;
    if (rc == 0)
        rc = settleSnapshot(workArea, &count, snapshot);
    if (rc != 0)
        closeCopy(&descriptor, &snapshot->file);
    else
        close(descriptor);
    return rc != 0 ? rc : warning;
}
