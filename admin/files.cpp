// Looking at the two files of a history directory.
#include "admin/zq3hist.h"

#include <cstring>
#include <ctime>
#include <unistd.h>

void lookAtFile(const char* path, fileReport* report)
{
    SQLO_FHANDLE file = sqloNoFile;
    ossFileRequest request = {ossFileVersion, path, 0, 0, 1};
    ossFileInfo info = {};
    *report = {};
    report->present = ossFileGetInfoV9(&request, &info) == 0;
    report->size = info.size;
    report->rc = sqloopenp(path, sqloOpenRead, sqloPermissions, &file);
    if (report->rc == 0) {
        report->rc = sqluhReadHeader(file, &report->header);
        sqloclose(file);
    }
    report->usable = report->rc == 0 && (report->header.status == statusConsistent ||
                                         report->header.status == statusCommitted);
}

repairKind repairDue(const fileReport* history, const fileReport* shadow)
{
    bool rebuilding = shadow->rc == 0 && shadow->header.status == statusPending;
    if (!history->usable && !shadow->usable && !rebuilding)
        return repairAnew;
    if (!history->usable)
        return repairHistory;
    bool inStep = history->header.status == statusConsistent && shadow->usable &&
                  history->size == shadow->size;
    return inStep ? repairNothing : repairShadow;
}

repairKind repairDueIn(const historyPlace* place)
{
    fileReport history, shadow;
    lookAtFile(place->historyPath, &history);
    lookAtFile(place->shadowPath, &shadow);
    return repairDue(&history, &shadow);
}

// --- Progress ------------------------------------------------------------------------------------

struct progressBar {
    const char* title; // null: none is shown
    long long total;
    long long step; // what is read between two looks at the clock
    long long next;
    timespec start;
    bool shown;
};

static void startProgress(progressBar* bar, const char* title, long long total)
{
    *bar = {};
    bar->title = isatty(STDERR_FILENO) ? title : nullptr;
    bar->total = total;
    bar->step = total / 100 + 1;
    clock_gettime(CLOCK_MONOTONIC, &bar->start);
}

// Draws the bar once half a second has gone by.
static void moveProgress(progressBar* bar, long long done)
{
    static const char full[] = "########################################";
    if (bar->title == nullptr || done < bar->next)
        return;
    bar->next = done + bar->step;
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    long long elapsed =
        (now.tv_sec - bar->start.tv_sec) * 1000LL + (now.tv_nsec - bar->start.tv_nsec) / 1000000;
    if (elapsed < 500)
        return;
    int width = static_cast<int>(sizeof full - 1);
    fprintf(stderr, "\r%s [%-*.*s] %3d%%", bar->title, width,
            static_cast<int>(done * width / bar->total), full,
            static_cast<int>(done * 100 / bar->total));
    bar->shown = true;
}

static void endProgress(const progressBar* bar)
{
    if (bar->shown)
        fputs("\r\033[K", stderr);
}

// --- Entries -------------------------------------------------------------------------------------

void countEntry(entriesReport* report, const SQLUH_ENTRY* entry)
{
    const zq3HistoryData* data = entry->data;
    const char* timestamp = data->objectPart.data;
    report->count++;
    report->digest = (report->digest << 5 | report->digest >> 27) ^ entry->checksum;
    if (data->numTablespaces > report->maxTablespaces)
        report->maxTablespaces = data->numTablespaces;
    if (entry->commandLength > report->maxCommandLength)
        report->maxCommandLength = entry->commandLength;
    if (timestamp != nullptr && strspn(timestamp, "0123456789") >= timestampWidth &&
        memcmp(timestamp, report->newest, timestampWidth) >= 0) {
        memcpy(report->newest, timestamp, timestampWidth);
        report->newestAt = report->offset;
    }
}

void readAllEntries(SQLO_FHANDLE file, SQLUH_WORKAREA* workArea, const char* progress,
                    entriesReport* report)
{
    char objectPart[18] = {};
    zq3HistoryData data = {};
    data.objectPart = {objectPart, sizeof objectPart, 0};
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    unsigned int flags = 0;
    long long end = 0;
    progressBar bar;
    *report = {};
    int rc = sqloseek(file, 0, sqloFromEnd, &end);
    if (rc == 0)
        rc = sqluhRewind(file, &report->offset);
    startProgress(&bar, progress, end);
    while (rc == 0) {
        rc = sqluhReadEntry(file, &entry, workArea, nullptr, nullptr, nullptr, nullptr, &flags);
        if (rc == TABLESPACE_LIST_TRUNCATED)
            rc = 0;
        if (rc != 0)
            break;
        countEntry(report, &entry);
        rc = sqloseek(file, 0, sqloFromCurrent, &report->offset);
        moveProgress(&bar, report->offset);
    }
    endProgress(&bar);
    // The reader's end of file may also lie between an entry's first lines and the others.
    if (rc == END_OF_FILE)
        rc = report->offset >= end ? 0 : static_cast<int>(HISTORY_FILE_DAMAGED);
    report->rc = rc;
}

static bool isSoundFile(SQLO_FHANDLE file, const char* name, const char* what)
{
    SQLUH_HEADER header;
    SQLUH_WORKAREA workArea = {};
    entriesReport entries = {};
    int rc = sqluhReadHeader(file, &header);
    if (rc != 0) {
        failWithCode(rc, what, name);
        return false;
    }
    if (header.status != statusConsistent && header.status != statusCommitted) {
        fail(name,
             header.status == statusPending
                 ? "cannot %s: a batch is unfinished in the history (status 'P')"
                 : "cannot %s: the file is no history",
             what);
        return false;
    }
    rc = sqluhInitWorkArea(&workArea, defaultWorkAreaSize);
    if (rc == 0) {
        readAllEntries(file, &workArea, what, &entries);
        sqlofmblkEx(workArea.buffer);
        rc = entries.rc;
    }
    if (rc == HISTORY_FILE_DAMAGED)
        fail(name, "cannot %s: the entry at offset %lld is damaged", what, entries.offset);
    else if (rc != 0)
        failWithCode(rc, what, name);
    return rc == 0;
}

bool isSoundImage(const char* path, const char* name, const char* what)
{
    SQLO_FHANDLE file = sqloNoFile;
    int rc = sqloopenp(path, sqloOpenRead, sqloPermissions, &file);
    if (rc != 0) {
        failWithCode(rc, what, name);
        return false;
    }
    bool sound = isSoundFile(file, name, what);
    sqloclose(file);
    return sound;
}
