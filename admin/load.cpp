// zq3hist load: appends entries in one batch.
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <unistd.h>

#include "admin/pair.h"
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

// --- Entries that are there ----------------------------------------------------------------------

// What entries say, their numbers aside: a checksum of 64 bits for each, sorted.
struct knownEntries {
    uint64_t* sums;
    size_t count, capacity;
};

static int compareSums(const void* a, const void* b)
{
    uint64_t first, second;
    memcpy(&first, a, sizeof first);
    memcpy(&second, b, sizeof second);
    return first < second ? -1 : first > second;
}

// FNV-1a of the stanza without its number. 0: no memory.
static uint64_t sumOf(const historyRecord* record)
{
    char* text = nullptr;
    size_t length = 0;
    uint64_t sum = 0xCBF29CE484222325;
    FILE* out = open_memstream(&text, &length);
    if (out == nullptr)
        return 0;
    writeUnnumbered(out, record);
    if (fclose(out) != 0)
        sum = 0;
    for (size_t i = 0; sum != 0 && i < length; i++)
        sum = (sum ^ static_cast<unsigned char>(text[i])) * 0x100000001B3;
    free(text);
    return sum;
}

static int addKnown(knownEntries* known, uint64_t sum)
{
    if (known->count == known->capacity) {
        size_t capacity = known->capacity * 2 + 64;
        void* grown = reallocarray(known->sums, capacity, sizeof *known->sums);
        if (grown == nullptr)
            return sqloSystemError | ENOMEM;
        known->sums = static_cast<uint64_t*>(grown);
        known->capacity = capacity;
    }
    known->sums[known->count++] = sum;
    return sum != 0 ? 0 : sqloSystemError | ENOMEM;
}

static int readKnown(const SQLUH_COMMITTED* committed, knownEntries* known)
{
    historyRecord* record = newRecord();
    int rc = record == nullptr ? sqloSystemError | ENOMEM : 0;
    for (uint32_t row = 0; rc == 0; row++) {
        rc = takeRow(committed, row, record);
        if (rc == 0)
            rc = addKnown(known, sumOf(record));
    }
    freeRecord(record);
    if (known->count != 0)
        qsort(known->sums, known->count, sizeof *known->sums, compareSums);
    return rc == END_OF_FILE ? 0 : rc;
}

// Takes the records out of the list that the history holds already; *there receives the number of
// its entries.
static int skipKnown(const historyPlace* place, historyList* list, uint32_t* there)
{
    SQLUH_COMMITTED* committed = nullptr;
    knownEntries known = {};
    size_t kept = 0;
    int rc = sqluhReadCommitted(place->directory, &committed);
    if (rc >= 0)
        rc = readKnown(committed, &known);
    for (size_t i = 0; rc == 0 && i < list->count; i++) {
        historyRecord* record = list->records[i];
        uint64_t sum = sumOf(record);
        bool isKnown = known.count != 0 &&
                       bsearch(&sum, known.sums, known.count, sizeof sum, compareSums) != nullptr;
        list->records[i] = nullptr;
        if (isKnown)
            freeRecord(record);
        else
            list->records[kept++] = record;
        if (sum == 0)
            rc = sqloSystemError | ENOMEM;
    }
    if (rc == 0)
        list->count = kept;
    *there = static_cast<uint32_t>(known.count);
    free(known.sums);
    sqluhFreeCommitted(&committed);
    return rc == 0 ? 0 : failInPlace(rc, "read the history", place);
}

// --- The batch -----------------------------------------------------------------------------------

enum : int { loadInterrupted = 1, loadOutdated = 2 }; // instead of a code

// The number of an entry that is given none: its place, but after a prune the numbers go on.
static uint32_t nextNumber(const entriesReport* totals)
{
    uint32_t last = totals->lastNumber < UINT32_MAX ? totals->lastNumber : 0;
    return (last > totals->count ? last : totals->count) + 1;
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
            record->data.entryNumber = nextNumber(totals);
        rc = sqluhWriteEntry(handle, &record->entry);
        addToReport(totals, &record->entry);
        header->entryCount = totals->count;
        totals->offset += record->entry.size;
        if (rc == 0 && isSignalHeld())
            rc = loadInterrupted;
    }
    setTotals(header, totals);
    return rc;
}

// Takes back what was appended and the mark of the batch. The shadow, which the next open would
// otherwise copy over the history, need not be as good as the entries that are there.
static void undoBatch(SQLUH_HANDLE** handle, SQLUH_HEADER header, long long end)
{
    SQLO_FHANDLE file = (*handle)->fileHandle;
    header.status = statusConsistent;
    if (ftruncate(file.descriptor, end) == 0 && sqlosync(file) == 0 &&
        sqluhWriteHeader(file, &header) == 0)
        sqlosync(file);
    sqluhEndBatch(handle, sqluhAbandon);
}

// Reads what is there, known entries if a number is given, and appends the others. Returns 0,
// loadInterrupted, loadOutdated or a code.
static int fillBatch(SQLUH_HANDLE* handle, historyList* list, const uint32_t* known)
{
    entriesReport totals = {};
    readAllEntries(handle->fileHandle, &handle->workArea, "Reading the history", &totals);
    int rc = totals.rc;
    if (rc == 0 && totals.count < handle->header.entryCount)
        rc = HISTORY_FILE_DAMAGED;
    if (rc == 0 && known != nullptr && totals.count != *known)
        rc = loadOutdated;
    return rc == 0 ? appendRecords(handle, list, &totals) : rc;
}

static int failBatch(const historyPlace* place, int rc)
{
    if (rc == loadInterrupted)
        return fail(place->directory, "interrupted; nothing was appended");
    if (rc == loadOutdated)
        return fail(place->directory, "the history changed meanwhile; load the file again");
    return failInPlace(rc, "append to the history", place);
}

static int runBatch(historyPlace* place, historyList* list, const uint32_t* known)
{
    SQLUH_HANDLE* handle = nullptr;
    long long end = 0;
    int rc = sqluhBeginBatch(&handle, place->directory);
    if (rc != 0)
        return failOpening(rc, "begin the batch", place);
    const SQLUH_HEADER header = handle->header;
    rc = sqloseek(handle->fileHandle, 0, sqloFromEnd, &end);
    if (rc == 0)
        rc = fillBatch(handle, list, known);
    if (rc != 0) {
        undoBatch(&handle, header, end);
        return failBatch(place, rc);
    }
    rc = sqluhEndBatch(&handle, sqluhCommit);
    if (rc != 0) {
        rc = failInPlace(rc, "commit the batch", place);
        hint(place, "zq3hist dump DIR  # shows whether the entries are in, before they are loaded "
                    "again");
    }
    return rc;
}

// Both files are read before anything is changed. A batch opens the history, which repairs it if it
// must, and not always from the better file: that is left to whoever has looked. Nor is a batch
// begun beside a shadow from which it could not be undone. Where writers leave no moment to look,
// the batch reads the history again.
static int checkPair(const historyPlace* place)
{
    pairFinding pair;
    bool atWork = false;
    sqluhRepair due = repairDueIn(place);
    int rc = examineQuietPair(place, true, &pair, &atWork);
    bool isMended = pair.due == due && due != sqluhRepairAnew && !pair.refused;
    return rc != 0 || atWork || isMended ? rc : failPair(place, &pair, "append to the history");
}

static int appendList(commandLine* line, historyList* list)
{
    historyPlace* place = &line->place;
    uint32_t known = 0;
    int rc = createIfMissing(place);
    if (rc == 0)
        rc = awaitLock(place, R_OK | W_OK);
    if (rc == 0)
        rc = checkPair(place);
    if (rc == 0 && line->skipExisting)
        rc = skipKnown(place, list, &known);
    return rc != 0 || list->count == 0
               ? rc
               : runBatch(place, list, line->skipExisting ? &known : nullptr);
}

// Does all but the batch.
static int rehearse(const commandLine* line, historyList* list)
{
    const historyPlace* place = &line->place;
    uint32_t known;
    if (!ossPathExists(place->historyPath) && !ossPathExists(place->shadowPath))
        return 0;
    int rc = checkLock(place, R_OK | W_OK);
    if (rc == 0)
        rc = checkPair(place);
    return rc == 0 && line->skipExisting ? skipKnown(place, list, &known) : rc;
}

static void tellLoaded(const commandLine* line, size_t appended, size_t given)
{
    if (line->json) {
        jsonWriter json = {};
        beginAnswer(&json);
        putJsonText(&json, "directory", line->place.directory);
        putJsonBool(&json, "dryRun", line->dryRun);
        putJsonNumber(&json, "appendedCount", static_cast<long long>(appended));
        putJsonNumber(&json, "skippedCount", static_cast<long long>(given - appended));
        endJsonLine(&json);
        return;
    }
    printf("%zu %s %sappended", appended, entryWord(appended), line->dryRun ? "would be " : "");
    if (line->skipExisting)
        printf(", %zu that %s there left out", given - appended, line->dryRun ? "are" : "were");
    puts("");
}

int loadMain(commandLine* line)
{
    historyList list = {};
    int rc = parseInput(line->arguments[0], &list);
    size_t given = list.count;
    if (rc == 0)
        rc = line->dryRun ? rehearse(line, &list) : appendList(line, &list);
    if (rc == 0)
        tellLoaded(line, list.count, given);
    freeList(&list);
    return rc;
}
