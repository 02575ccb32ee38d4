// zq3hist status: both files and the lock, as they stand.
#include "admin/zq3hist.h"

#include <cstring>

#include "admin/json.h"

struct directoryReport {
    fileReport history, shadow;
    sqluhRepair due;
    bool lockKnown;
    SQLO_NLCK lock;
    SQLO_NLCKSTATE lockState;
};

static const char* statusWords(char status, bool isShadow)
{
    switch (status) {
    case statusConsistent:
        return "consistent";
    case statusCommitted: // what the shadow keeps of a commit
        return isShadow ? "consistent since the last commit" : "a batch waits for the shadow";
    case statusPending:
        return isShadow ? "the history was rebuilt from it" : "a batch is unfinished";
    default:
        return "no known status";
    }
}

static const char* lockWords(int state)
{
    switch (state) {
    case sqloNLCKAbsent:
        return "free";
    case sqloNLCKSettingUp:
        return "being taken";
    case sqloNLCKSetupDied:
        return "left by a process that died while it took it";
    case sqloNLCKHeld:
        return "held";
    case sqloNLCKStale:
        return "left by a process that died while it held it";
    case sqloNLCKFaked:
        return "held, though another process freed it";
    default:
        return "another program's semaphore set has its key";
    }
}

static bool isUnreadable(const fileReport* file)
{
    return file->present && isSystemCode(file->rc);
}

static bool isRefused(const directoryReport* report)
{
    return isUnreadable(&report->history) || isUnreadable(&report->shadow);
}

// Whether the file ends before the entry that its header calls the newest.
static bool isCut(const fileReport* file)
{
    return file->rc == 0 && file->header.offset3 != 0 &&
           file->header.offset3 + entryMinLength > file->size;
}

static bool isPairCut(const directoryReport* report)
{
    return report->due == sqluhRepairNone && (isCut(&report->history) || isCut(&report->shadow));
}

static const char* verdict(const directoryReport* report)
{
    sqluhRepair due = report->due;
    if (isPairCut(report))
        return "cut short: the newest entry is not there";
    if (due == sqluhRepairAnew && isRefused(report))
        return "cannot be read";
    return due == sqluhRepairNone     ? "usable; both files are in step"
           : due == sqluhRepairShadow ? "usable; the next open rebuilds the shadow from the history"
           : due == sqluhRepairHistory
               ? "usable; the next open rebuilds the history from the shadow"
               : "not usable; the next open would move both files aside";
}

static void showFile(const char* title, const char* name, const fileReport* file)
{
    bool isShadow = strcmp(name, SQLUH_SHADOW_NAME) == 0;
    printf("%-10s%s: ", title, name);
    if (!file->present) {
        puts("missing");
        return;
    }
    printf("%llu bytes, ", file->size);
    if (file->rc != 0) {
        printf("header not readable: %s\n", wordsForCode(file->rc));
        return;
    }
    fputs("status '", stdout);
    putEscaped(stdout, &file->header.status, 1);
    printf("' (%s), %u %s, newest ", statusWords(file->header.status, isShadow),
           file->header.entryCount, entryWord(file->header.entryCount));
    putEscaped(stdout, file->header.timestamp, timestampWidth);
    printf(" at offset %llu, node %u\n", static_cast<unsigned long long>(file->header.offset3),
           file->header.nodeNumber);
}

static void showLock(const directoryReport* report)
{
    printf("%-10s", "lock");
    if (!report->lockKnown) {
        puts("unknown");
        return;
    }
    printf("%s (key 0x%08X", lockWords(report->lockState.state),
           static_cast<unsigned int>(report->lock.key));
    if (report->lockState.pid > 0)
        printf(", process %d", report->lockState.pid);
    puts(")");
}

static void putJsonFile(jsonWriter* json, const char* key, const fileReport* file)
{
    const SQLUH_HEADER* header = &file->header;
    beginJson(json, key, '{');
    putJsonBool(json, "present", file->present);
    if (file->present) {
        putJsonNumber(json, "size", static_cast<long long>(file->size));
        putJsonBool(json, "usable", file->state.usable);
    }
    if (file->rc == 0) {
        putJsonBytes(json, "headerStatus", &header->status, 1);
        putJsonNumber(json, "headerEntryCount", header->entryCount);
        putJsonBytes(json, "newestTimestamp", header->timestamp, timestampWidth);
        putJsonNumber(json, "newestOffset", static_cast<long long>(header->offset3));
        putJsonNumber(json, "maxTablespaceCount", header->number8);
        putJsonNumber(json, "maxCommandLength", header->maxCommandLength);
        putJsonNumber(json, "node", header->nodeNumber);
    }
    endJson(json, '}');
}

static void showStatusJson(const historyPlace* place, const directoryReport* report)
{
    static const char* const repairs[] = {"none", "shadow", "history", "anew"};
    static const char* const states[] = {"free",        "being taken", "setup died", "held",
                                         "holder died", "foreign",     "freed"};
    jsonWriter json = {};
    beginAnswer(&json);
    putJsonText(&json, "directory", place->directory);
    putJsonBool(&json, "usable", report->due != sqluhRepairAnew);
    putJsonText(&json, "repair", repairs[report->due]);
    putJsonFile(&json, "history", &report->history);
    putJsonFile(&json, "shadow", &report->shadow);
    if (report->lockKnown) {
        beginJson(&json, "lock", '{');
        putJsonText(&json, "state", states[report->lockState.state]);
        putJsonNumber(&json, "key", static_cast<unsigned int>(report->lock.key));
        putJsonNumber(&json, "process", report->lockState.pid);
        endJson(&json, '}');
    } else {
        putJsonText(&json, "lock", nullptr);
    }
    endJsonLine(&json);
}

static void hintAfter(const historyPlace* place, const directoryReport* report)
{
    if (report->lockKnown && isLeftByDead(&report->lockState))
        hint(place, unlockAdvice);
    else if ((report->due != sqluhRepairNone || isPairCut(report)) &&
             !(report->lockKnown && report->lockState.state == sqloNLCKHeld))
        hint(place, "zq3hist verify DIR  # reads both files and tells what mends them");
}

int statusMain(commandLine* line)
{
    historyPlace* place = &line->place;
    bool json = line->json;
    directoryReport report = {};
    lookAtFile(place->historyPath, &report.history);
    lookAtFile(place->shadowPath, &report.shadow);
    if (!report.history.present && !report.shadow.present && !json)
        return failInPlace(HISTORY_FILE_MISSING, "show the history", place);
    report.due = repairDue(&report.history, &report.shadow);
    report.lockKnown = queryLock(place, &report.lock, &report.lockState);
    if (json) {
        showStatusJson(place, &report);
    } else {
        showFile("history", SQLUH_HISTORY_NAME, &report.history);
        showFile("shadow", SQLUH_SHADOW_NAME, &report.shadow);
        showLock(&report);
        printf("%-10s%s\n", "", verdict(&report));
    }
    hintAfter(place, &report);
    if (report.due == sqluhRepairAnew || isPairCut(&report))
        return isRefused(&report) ? exitFailed : exitDamaged;
    bool isFree = report.lockState.state == sqloNLCKAbsent ||
                  report.lockState.state == sqloNLCKSettingUp ||
                  report.lockState.state == sqloNLCKHeld;
    return report.lockKnown && !isFree ? exitLocked : exitDone;
}
