// Looking at the two files of a history directory.
#include "admin/zq3hist.h"

#include <cstring>
#include <ctime>
#include <sys/stat.h>
#include <unistd.h>

bool isSamePlace(const char* a, const char* b)
{
    struct stat first, second;
    return stat(a, &first) == 0 && stat(b, &second) == 0 && first.st_dev == second.st_dev &&
           first.st_ino == second.st_ino;
}

bool isHistoryFile(const historyPlace* place, const char* path)
{
    return isSamePlace(path, place->historyPath) || isSamePlace(path, place->shadowPath);
}

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

void prepareRoom(entryRoom* room)
{
    *room = {};
    room->data.objectPart = {room->objectPart, sizeof room->objectPart, 0};
    room->entry.data = &room->data;
}

void addToReport(entriesReport* report, const SQLUH_ENTRY* entry)
{
    const zq3HistoryData* data = entry->data;
    const char* timestamp = data->objectPart.data;
    report->count++;
    report->lastNumber = data->entryNumber;
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
    entryRoom room;
    SQLUH_ENTRYWALK walk = {file, &room.entry, workArea, headerLength, false};
    long long end = 0;
    progressBar bar;
    *report = {};
    prepareRoom(&room);
    int rc = sqloseek(file, 0, sqloFromEnd, &end);
    if (rc == 0)
        rc = sqluhRewind(file, nullptr);
    startProgress(&bar, progress, end);
    while (rc == 0 && (rc = sqluhNextEntry(&walk)) == 0) {
        report->offset = walk.offset;
        addToReport(report, &room.entry);
        moveProgress(&bar, walk.offset);
    }
    endProgress(&bar);
    report->offset = walk.offset;
    report->rc = walk.cutShort ? HISTORY_FILE_DAMAGED : rc == END_OF_FILE ? 0 : rc;
}

void setTotals(SQLUH_HEADER* header, const entriesReport* totals)
{
    // offset3 is where the newest entry begins, timestamp is that entry's; old readers take the one
    // from the other.
    header->entryCount = totals->count;
    header->number8 = totals->maxTablespaces;
    header->maxCommandLength = totals->maxCommandLength;
    header->offset3 = static_cast<uint64_t>(totals->newestAt);
    memcpy(header->timestamp, totals->newestAt != 0 ? totals->newest : SQLUH_EMPTY_TIMESTAMP,
           timestampWidth);
}
