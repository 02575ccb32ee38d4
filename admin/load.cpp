// zq3hist load: appends entries in one batch.
#include "admin/zq3hist.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <unistd.h>

#include "admin/stanza.h"
#include "sqo/sqlzkrcb.h"

// Reads a whole stream; the text is the caller's to free.
static int readAll(FILE* in, char** text, size_t* length)
{
    size_t capacity = 64 * 1024;
    *length = 0;
    *text = static_cast<char*>(malloc(capacity));
    while (*text != nullptr) {
        *length += fread(*text + *length, 1, capacity - *length, in);
        if (ferror(in))
            return sqloSystemError | errno;
        if (*length < capacity)
            return 0;
        capacity *= 2;
        char* grown = static_cast<char*>(realloc(*text, capacity));
        if (grown == nullptr)
            break;
        *text = grown;
    }
    return sqloSystemError | ENOMEM;
}

static bool isStandardInput(const char* path)
{
    return path == nullptr || strcmp(path, "-") == 0;
}

static int readInput(const char* path, char** text, size_t* length)
{
    FILE* in = isStandardInput(path) ? stdin : fopen(path, "r");
    if (in == nullptr)
        return sqloSystemError | errno;
    int rc = readAll(in, text, length);
    if (in != stdin)
        fclose(in);
    return rc;
}

// Tells what is wrong where, the bytes that were found escaped.
static int failMistake(const char* name, const stanzaMistake* mistake)
{
    fputs("zq3hist: found \"", stderr);
    putEscaped(stderr, mistake->found, mistake->foundLength);
    fputs(mistake->foundLength == sizeof mistake->found ? "...\"" : "\"", stderr);
    fprintf(stderr, " but expected %s, ", mistake->expected);
    putEscaped(stderr, name, strlen(name));
    fprintf(stderr, " line %u\n", mistake->line);
    return exitFailed;
}

static int parseInput(const char* path, historyList* list)
{
    const char* name = isStandardInput(path) ? "standard input" : path;
    char* text = nullptr;
    size_t length = 0;
    stanzaMistake mistake = {};
    int rc = readInput(path, &text, &length);
    if (rc == 0)
        rc = readStanzas(text, length, static_cast<uint16_t>(sqlz_krcbp->nodeNumber), list,
                         &mistake);
    free(text);
    if (rc == stanzaMistaken)
        return failMistake(name, &mistake);
    return rc == 0 ? 0 : failWithCode(rc, "read the entries", name);
}

// Writes the records after the entries that are there, and brings the header up to date. What the
// header says of the old entries is counted anew: it may come from a writer that did not keep it.
static int appendRecords(SQLUH_HANDLE* handle, historyList* list, entriesReport* totals)
{
    SQLUH_HEADER* header = &handle->header;
    header->entryCount = totals->count;
    int rc = sqloseek(handle->fileHandle, 0, sqloFromEnd, &totals->offset);
    for (size_t i = 0; rc == 0 && i < list->count; i++) {
        historyRecord* record = list->records[i];
        if (record->numberByPlace)
            record->data.entryNumber = totals->count + 1;
        rc = sqluhWriteEntry(handle, &record->entry);
        addToReport(totals, &record->entry);
        header->entryCount = totals->count;
        totals->offset += record->entry.size;
    }
    // offset3 is where the newest entry begins, timestamp is that entry's; old readers take the one
    // from the other.
    header->number8 = totals->maxTablespaces;
    header->maxCommandLength = totals->maxCommandLength;
    header->offset3 = static_cast<uint64_t>(totals->newestAt);
    memcpy(header->timestamp, totals->newestAt != 0 ? totals->newest : SQLUH_EMPTY_TIMESTAMP,
           timestampWidth);
    return rc;
}

// Undoes the batch; the two opens do now what the next two would do, so that both files are whole.
static void abandon(historyPlace* place, SQLUH_HANDLE** handle)
{
    sqluhEndBatch(handle, sqluhAbandon);
    for (int i = 0; i < 2; i++)
        if (sqluhOpen(handle, place->directory, SQLUH_OPEN_READ) >= 0)
            sqluhClose(handle);
}

static int runBatch(historyPlace* place, historyList* list)
{
    SQLUH_HANDLE* handle = nullptr;
    entriesReport totals = {};
    int rc = sqluhBeginBatch(&handle, place->directory);
    if (rc != 0)
        return failOpening(rc, "begin the batch", place);
    readAllEntries(handle->fileHandle, &handle->workArea, "Reading the history", &totals);
    if (totals.rc != 0) {
        abandon(place, &handle);
        return failInPlace(totals.rc, "append to the history", place);
    }
    rc = appendRecords(handle, list, &totals);
    if (rc != 0) {
        abandon(place, &handle);
        return failInPlace(rc, "write the entries", place);
    }
    rc = sqluhEndBatch(&handle, sqluhCommit);
    if (rc != 0) {
        failInPlace(rc, "commit the batch", place);
        hint(place, "the next open settles whether the entries are in; zq3hist dump DIR shows them "
                    "before they are loaded again");
    }
    return rc == 0 ? 0 : exitFailed;
}

// A history that no file of the pair holds would silently be begun anew by the batch.
static int checkUsable(historyPlace* place)
{
    return repairDueIn(place) == sqluhRepairAnew
               ? failInPlace(HISTORY_FILE_DAMAGED, "append to the history", place)
               : 0;
}

int loadMain(commandLine* line)
{
    historyPlace* place = &line->place;
    historyList list = {};
    int rc = parseInput(line->arguments[0], &list);
    if (rc == 0)
        rc = createIfMissing(place);
    if (rc == 0)
        rc = awaitLock(place, R_OK | W_OK);
    if (rc == 0)
        rc = checkUsable(place);
    if (rc == 0)
        rc = runBatch(place, &list);
    releaseSignals();
    if (rc == 0)
        printf("%zu entries appended\n", list.count);
    freeList(&list);
    return rc;
}
