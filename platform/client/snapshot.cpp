// Taking a snapshot, and counting its entries.
//
// A scan needs the number of its entries, and the largest number of names, before the first entry
// is delivered, and the lock must not be held while the caller thinks. Two passes over the live
// file would do without a copy; but a batch undone, a restore or a repair between two gets would
// turn the rest of the scan into another history's entries, or into damage. The copy goes to a
// nameless file among the temporary ones, whose pages can be written out.
#include "platform/client/snapshot.h"

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

static constexpr size_t copyLength = 256 * 1024;

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

// Copies the whole open file to the descriptor, in pieces that stay in the cache.
static int copyBytes(SQLO_FHANDLE from, int descriptor)
{
    char* buffer = static_cast<char*>(malloc(copyLength));
    int rc =
        buffer == nullptr ? sqloSystemError | ENOMEM : sqloseek(from, 0, sqloFromStart, nullptr);
    while (rc == 0) {
        uint32_t got = 0;
        rc = sqloread(from, buffer, copyLength, &got);
        int stored = rc == 0 || rc == END_OF_FILE ? writeAll(descriptor, buffer, got) : 0;
        rc = stored != 0 ? stored : rc;
    }
    free(buffer);
    return rc == END_OF_FILE ? 0 : rc;
}

// Counts the entries of the copy. The first one that cannot be read ends them and is one all the
// same, or the scan would seem complete.
static int countRows(SQLUH_WORKAREA* workArea, historySnapshot* snapshot)
{
    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    SQLUH_ENTRYWALK walk = {snapshot->file, &entry, workArea, 0, false};
    int rc = sqloseek(snapshot->file, headerLength, sqloFromStart, nullptr);
    if (rc != 0)
        return rc;
    while ((rc = sqluhNextEntry(&walk)) == 0) {
        snapshot->numRows++;
        if (data.numTablespaces > snapshot->maxTablespaces)
            snapshot->maxTablespaces = data.numTablespaces;
    }
    if (rc != END_OF_FILE || walk.cutShort)
        snapshot->numRows++;
    return sqloseek(snapshot->file, headerLength, sqloFromStart, nullptr);
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
static int copyInto(bool inMemory, SQLO_FHANDLE from, int* descriptor, SQLO_FHANDLE* file)
{
    int rc = openNameless(inMemory, descriptor, file);
    return rc == 0 ? copyBytes(from, *descriptor) : rc;
}

// A folder for temporary files that is full, or cannot be written, keeps nobody from a plan: the
// copy then goes into memory.
static int copyHistory(SQLO_FHANDLE from, int* descriptor, SQLO_FHANDLE* file)
{
    int rc = copyInto(false, from, descriptor, file);
    if (rc != 0) {
        closeCopy(descriptor, file);
        if (copyInto(true, from, descriptor, file) == 0)
            rc = 0;
    }
    return rc;
}

int takeSnapshot(char* directory, SQLUH_WORKAREA* workArea, historySnapshot* snapshot)
{
    SQLUH_HANDLE* handle = nullptr;
    int descriptor = -1;
    *snapshot = {};
    snapshot->file = sqloNoFile;

    int warning = sqluhOpen(&handle, directory, SQLUH_OPEN_READ);
    if (warning < 0)
        return warning;
    int rc = copyHistory(handle->fileHandle, &descriptor, &snapshot->file);
    int closed = sqluhClose(&handle);
    if (rc == 0)
        rc = closed;
    if (rc == 0)
        rc = countRows(workArea, snapshot);
    if (rc != 0)
        closeCopy(&descriptor, &snapshot->file);
    else
        close(descriptor);
    return rc != 0 ? rc : warning;
}
