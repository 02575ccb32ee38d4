// zq3hist dump: prints all entries.
#include "admin/zq3hist.h"

#include <cerrno>

#include "admin/stanza.h"

static int writeEntries(historyPlace* place, SQLUH_HANDLE* handle, bool json, FILE* out)
{
    historyRecord* record = newRecord();
    long long offset = 0;
    int rc =
        record == nullptr ? sqloSystemError | ENOMEM : sqluhRewind(handle->fileHandle, &offset);
    while (rc == 0) {
        rc = readRecord(handle->fileHandle, &handle->workArea, record, &offset);
        if (rc == 0 && json)
            writeJson(out, record);
        else if (rc == 0)
            writeStanza(out, record);
    }
    freeRecord(record);
    if (rc == HISTORY_FILE_DAMAGED)
        return fail(place->directory, "the entry at offset %lld is damaged; those before it follow",
                    offset);
    return rc == END_OF_FILE ? 0 : failInPlace(rc, "read the history", place);
}

static int copyOut(FILE* spool)
{
    char buffer[64 * 1024];
    size_t got;
    rewind(spool);
    while ((got = fread(buffer, 1, sizeof buffer, spool)) > 0)
        if (fwrite(buffer, 1, got, stdout) < got)
            return exitFailed; // main tells
    return ferror(spool) ? fail("temporary file", "cannot read what was dumped") : 0;
}

int dumpMain(commandLine* line)
{
    historyPlace* place = &line->place;
    SQLUH_HANDLE* handle = nullptr;
    // Printed only once the lock is free again: whoever reads the output may take as long as it
    // likes.
    FILE* spool = tmpfile();
    if (spool == nullptr)
        return failWithCode(sqloSystemError | errno, "make a temporary file", "dump");
    int rc = openHistory(place, SQLUH_OPEN_READ, &handle);
    if (rc == 0) {
        rc = writeEntries(place, handle, line->json, spool);
        int closed = closeHistory(place, &handle, "close the history");
        if (fflush(spool) != 0 || ferror(spool))
            closed = failWithCode(sqloSystemError | errno, "write a temporary file", "dump");
        int copied = copyOut(spool);
        rc = rc != 0 ? rc : closed != 0 ? closed : copied;
    }
    fclose(spool);
    return rc;
}
