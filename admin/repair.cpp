// zq3hist repair: brings both files into step from the one that is whole, and says what it did.
#include "admin/pair.h"

#include <cstdio>
#include <unistd.h>

struct repairReport {
    sqluhRepair done;
    uint32_t count; // entries of the history afterwards
    keptFiles kept;
};

// The history file may look usable to an open, and then a mark in the shadow would give it away:
// the copy comes first.
static int takeShadow(SQLUH_HANDLE* handle)
{
    int rc = sqlocopy(handle->shadowPath, handle->historyPath, 0);
    if (rc == 0)
        rc = sqluhUpdateHeaderStatus(handle->shadowPath, statusConsistent);
    return rc == 0 ? sqluhUpdateHeaderStatus(handle->historyPath, statusConsistent) : rc;
}

static int repairFromSource(historyPlace* place, SQLUH_HANDLE* handle, bool fromShadow,
                            repairReport* report)
{
    int rc = fromShadow ? keepFile(place->historyPath, report->kept.history)
                        : keepFile(place->shadowPath, report->kept.shadow);
    if (rc != 0)
        return rc;
    int code = fromShadow ? takeShadow(handle) : sqluhRecoverShadowFromHistory(handle);
    return code == 0 ? 0 : failWithCode(code, "repair the history", place->directory);
}

static bool isShadowFuller(const pairFinding* pair)
{
    return pair->shadow.entries.count > pair->history.entries.count;
}

// Neither file is whole: the one with more entries that can be read is taken up to its damage.
static int salvage(historyPlace* place, SQLUH_HANDLE* handle, const pairFinding* pair,
                   repairReport* report)
{
    char temporary[pathCapacity];
    partReport part = {};
    int rc = formTemporary(place->historyPath, temporary);
    if (rc == 0)
        rc = keepPair(handle, &report->kept);
    if (rc != 0)
        return rc;
    int code = writePart(isShadowFuller(pair) ? place->shadowPath : place->historyPath, nullptr,
                         nullptr, temporary, &part);
    if (code != 0)
        rc = failWithCode(code, "repair the history", place->directory);
    if (rc == 0)
        rc = replacePair(place, handle, temporary);
    unlink(temporary);
    return rc;
}

static int repairPair(commandLine* line, SQLUH_HANDLE* handle, repairReport* report)
{
    historyPlace* place = &line->place;
    const fileFinding* finding = nullptr;
    pairFinding pair;
    int rc = examinePair(place, true, &pair);
    if (rc != 0)
        return rc;
    report->done = pair.due;
    if (pair.refused || (pair.due == sqluhRepairAnew && !line->force))
        return failPair(place, &pair, "repair the history");
    if (sourceOf(place, &pair, &finding) == nullptr)
        finding = isShadowFuller(&pair) ? &pair.shadow : &pair.history;
    report->count = finding->entries.count;
    if (line->dryRun || pair.due == sqluhRepairNone)
        return 0;
    return pair.due == sqluhRepairAnew
               ? salvage(place, handle, &pair, report)
               : repairFromSource(place, handle, pair.due == sqluhRepairHistory, report);
}

static void showReport(const repairReport* report, bool dryRun)
{
    const char* is = dryRun ? "would be" : "was";
    const char* entries = entryWord(report->count);
    if (report->done == sqluhRepairNone)
        printf("Nothing to repair: both files hold the same %u %s\n", report->count, entries);
    else if (report->done == sqluhRepairAnew)
        printf("Neither file is whole; a history of what can be read %s made: %u %s\n", is,
               report->count, entries);
    else
        printf("The %s %s made anew from the %s: %u %s\n",
               report->done == sqluhRepairShadow ? "shadow" : "history file", is,
               report->done == sqluhRepairShadow ? "history file" : "shadow", report->count,
               entries);
    tellKept(&report->kept);
}

static void showJsonReport(const historyPlace* place, const repairReport* report, bool dryRun)
{
    static const char* const words[] = {"nothing", "shadow", "history", "both"};
    jsonWriter json = {};
    beginAnswer(&json);
    putJsonText(&json, "directory", place->directory);
    putJsonBool(&json, "dryRun", dryRun);
    putJsonText(&json, "madeAnew", words[report->done]);
    putJsonNumber(&json, "entryCount", report->count);
    putJsonKept(&json, &report->kept);
    endJsonLine(&json);
}

int repairMain(commandLine* line)
{
    historyPlace* place = &line->place;
    SQLUH_HANDLE* handle = nullptr;
    repairReport report = {};
    int rc = line->dryRun ? checkLock(place, R_OK | W_OK) : lockPair(place, R_OK | W_OK, &handle);
    if (rc == 0)
        rc = repairPair(line, handle, &report);
    if (rc == 0 && line->json)
        showJsonReport(place, &report, line->dryRun);
    else if (rc == 0)
        showReport(&report, line->dryRun);
    return unlockPair(place, &handle, rc);
}
