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
    report->state = sqluhStateOfFile(report->rc, &report->header);
}

sqluhRepair repairDue(const fileReport* history, const fileReport* shadow)
{
    sqluhRepair due = sqluhDecideRepair(history->state, shadow->state);
    return due == sqluhRepairNone && history->size != shadow->size ? sqluhRepairShadow : due;
}

sqluhRepair repairDueIn(const historyPlace* place)
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

void addToReport(entriesReport* report, const SQLUH_ENTRY* entry)
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
    SQLUH_ENTRYWALK walk = {file, &entry, workArea, headerLength, false};
    long long end = 0;
    progressBar bar;
    *report = {};
    int rc = sqloseek(file, 0, sqloFromEnd, &end);
    if (rc == 0)
        rc = sqluhRewind(file, nullptr);
    startProgress(&bar, progress, end);
    while (rc == 0 && (rc = sqluhNextEntry(&walk)) == 0) {
        report->offset = walk.offset;
        addToReport(report, &entry);
        moveProgress(&bar, walk.offset);
    }
    endProgress(&bar);
    report->offset = walk.offset;
    report->rc = walk.cutShort ? HISTORY_FILE_DAMAGED : rc == END_OF_FILE ? 0 : rc;
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
