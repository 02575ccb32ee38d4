// zq3hist check: whether everything is well, in one line for monitoring.
#include <cstdarg>
#include <cstring>
#include <ctime>

#include "admin/chains.h"
#include "admin/pair.h"

// Something that is wrong; the gravest come first.
struct problem {
    int status;
    char text[512];
};

struct checkReport {
    const commandLine* line;
    pairFinding pair;
    bool atWork; // the files were changed whenever they were looked at
    bool lockKnown;
    SQLO_NLCKSTATE lock;
    imageCatalog catalog;
    chainWalk walk;
    bool walked;
    long ageHours; // of the newest image that can be restored; -1: unknown
    const numberGap* gap;
    problem problems[8];
    int numProblems;
};

static void addProblem(checkReport* report, int status, const char* format, ...)
    __attribute__((format(printf, 3, 4)));
static void addProblem(checkReport* report, int status, const char* format, ...)
{
    constexpr int room = sizeof report->problems / sizeof *report->problems;
    if (report->numProblems == room)
        return;
    problem* added = &report->problems[report->numProblems++];
    va_list arguments;
    added->status = status;
    va_start(arguments, format);
    vsnprintf(added->text, sizeof added->text, format, arguments);
    va_end(arguments);
}

// --- The files and the lock ----------------------------------------------------------------------

static void checkFile(checkReport* report, const char* name, const fileFinding* finding)
{
    const entriesReport* entries = &finding->entries;
    int rc = finding->file.rc != 0 ? finding->file.rc : entries->rc;
    switch (finding->verdict) {
    case fileMissing:
        addProblem(report, exitDamaged, "%s is missing", name);
        break;
    case fileRefused:
        addProblem(report, exitFailed, "%s cannot be read: %s", name, wordsForCode(rc));
        break;
    case fileNoHistory:
        addProblem(report, exitDamaged, "the header of %s cannot be read", name);
        break;
    case fileDamaged:
        addProblem(report, exitDamaged, "entry %u of %s is damaged", entries->count + 1, name);
        break;
    case fileShort:
        addProblem(report, exitDamaged, "%s ends after %u of %u entries", name, entries->count,
                   finding->file.header.entryCount);
        break;
    case fileSound:
        if (finding->file.header.status != statusPending &&
            finding->file.header.entryCount != entries->count)
            addProblem(report, exitDamaged, "%s holds %u entries and counts %u", name,
                       entries->count, finding->file.header.entryCount);
    }
}

static bool isWriterAlive(const checkReport* report)
{
    return report->atWork || (report->lockKnown && (report->lock.state == sqloNLCKHeld ||
                                                    report->lock.state == sqloNLCKSettingUp));
}

// A living writer's files are in between; what is committed is then asked of the reader alone.
static void checkFiles(checkReport* report)
{
    const pairFinding* pair = &report->pair;
    if (pair->history.verdict == fileMissing && pair->shadow.verdict == fileMissing) {
        addProblem(report, exitDamaged, "the directory holds no history file");
        return;
    }
    if (isWriterAlive(report))
        return;
    checkFile(report, SQLUH_HISTORY_NAME, &pair->history);
    checkFile(report, SQLUH_SHADOW_NAME, &pair->shadow);
    if (pair->history.file.rc == 0 && pair->history.file.header.status == statusPending)
        addProblem(report, exitDamaged, "a batch is unfinished");
    else if (report->numProblems == 0 && !pair->same)
        addProblem(report, exitDamaged, "the two files hold different entries");
    else if (report->numProblems == 0 && pair->due != sqluhRepairNone)
        addProblem(report, exitDamaged, "the shadow is to be made anew");
}

static void judgeLock(checkReport* report)
{
    if (!report->lockKnown)
        return;
    if (isLeftByDead(&report->lock))
        addProblem(report, exitLocked, "process %d died while it held the lock", report->lock.pid);
    else if (report->lock.state == sqloNLCKForeign)
        addProblem(report, exitLocked, "another program's semaphore set has the lock's key");
}

// --- The images ----------------------------------------------------------------------------------

static const char* newestRestorable(const checkReport* report)
{
    int newest = report->walked ? report->walk.newestComplete : -1;
    return newest < 0 ? nullptr : report->catalog.history.entries[newest].timestamp;
}

static long hoursSince(const char* timestamp)
{
    tm at = {};
    if (sscanf(timestamp, "%4d%2d%2d%2d%2d%2d", &at.tm_year, &at.tm_mon, &at.tm_mday, &at.tm_hour,
               &at.tm_min, &at.tm_sec) != 6)
        return -1;
    at.tm_year -= 1900;
    at.tm_mon -= 1;
    at.tm_isdst = -1;
    double seconds = difftime(time(nullptr), mktime(&at));
    return seconds < 0 ? 0 : static_cast<long>(seconds / 3600);
}

static void checkAge(checkReport* report)
{
    const char* newest = newestRestorable(report);
    if (newest == nullptr) {
        addProblem(report, exitNoImage, "no image can be restored");
        return;
    }
    report->ageHours = hoursSince(newest);
    report->gap =
        gapBetween(&report->catalog, report->walk.images[report->walk.newestComplete].oldest,
                   report->walk.newestComplete);
    if (report->line->maxAge >= 0 && report->ageHours > report->line->maxAge)
        addProblem(report, exitNoImage, "the newest image that can be restored is %ld hours old",
                   report->ageHours);
}

// The version of a tablespace that lacks something; null: it lacks nothing, or is gone.
static const chainLink* lackingVersion(const chainWalk* walk, int tablespace)
{
    const chainLink* version =
        isAlive(walk, tablespace) ? &walk->links[walk->tablespaces[tablespace].head] : nullptr;
    return version != nullptr && version->lack != lacksNothing ? version : nullptr;
}

static void checkChains(checkReport* report)
{
    const chainWalk* walk = &report->walk;
    int numLacking = 0;
    const chainLink* first = nullptr;
    for (int i = 0; i < walk->numTablespaces; i++) {
        const chainLink* version = lackingVersion(walk, i);
        numLacking += version != nullptr;
        first = first != nullptr ? first : version;
    }
    if (first == nullptr)
        return;
    char lack[lackCapacity];
    char more[48] = "";
    describeLack(lackingImage(walk, first), lack);
    if (numLacking > 1)
        snprintf(more, sizeof more, " (%d tablespaces lack one)", numLacking);
    addProblem(report, exitIncomplete, "tablespace %s lacks %s%s",
               walk->tablespaces[first->tablespace].name, lack, more);
}

// The reader tells by itself of damage that leaves nothing to read.
static int checkImages(checkReport* report)
{
    SQLUH_COMMITTED* committed = nullptr;
    int rc = sqluhReadCommitted(report->line->place.directory, &committed);
    int failure = rc < 0 ? rc : committed->failure;
    if (failure != 0) {
        if (report->numProblems == 0)
            addProblem(report, statusForCode(failure), "%s", wordsForCode(failure));
        sqluhFreeCommitted(&committed);
        return 0;
    }
    rc = fillCatalog(&report->line->place, committed, report->line->have, &report->catalog);
    if (rc == 0)
        rc = walkChains(&report->catalog, report->catalog.history.numEntries - 1, &report->walk);
    report->walked = rc == 0;
    if (rc == 0) {
        checkAge(report);
        checkChains(report);
    }
    return rc;
}

// --- The answer ----------------------------------------------------------------------------------

static int statusOf(const checkReport* report)
{
    return report->numProblems == 0 ? int{exitDone} : report->problems[0].status;
}

static const char* wordFor(int status)
{
    return status == exitDone      ? "ok"
           : status == exitDamaged ? "damaged"
           : status == exitLocked  ? "locked"
           : status == exitNoImage ? "no image"
           : status == exitFailed  ? "failed"
                                   : "incomplete";
}

static void showCheckLine(const checkReport* report)
{
    const char* separator = ": ";
    fputs(wordFor(statusOf(report)), stdout);
    for (int i = 0; i < report->numProblems; i++) {
        fputs(separator, stdout);
        putEscaped(stdout, report->problems[i].text, strlen(report->problems[i].text));
        separator = "; ";
    }
    if (isWriterAlive(report)) {
        printf("%sa process is changing the history", separator);
        separator = "; ";
    }
    if (report->walked) {
        const char* newest = newestRestorable(report);
        printf("%s%u %s, %d image%s, %d incomplete", separator, report->catalog.numEntries,
               entryWord(report->catalog.numEntries), report->walk.numImages,
               report->walk.numImages == 1 ? "" : "s", report->walk.numIncomplete);
        if (newest != nullptr)
            printf("; newest that can be restored: %s, %ld hours old", newest, report->ageHours);
    }
    if (report->gap != nullptr) {
        char gap[gapCapacity];
        describeGap(report->gap, gap);
        printf("; warning: its chain was found, but the history lacks %s", gap);
    }
    putchar('\n');
}

static void putJsonProblems(jsonWriter* json, const checkReport* report)
{
    beginJson(json, "problems", '[');
    for (int i = 0; i < report->numProblems; i++) {
        beginJson(json, nullptr, '{');
        putJsonNumber(json, "exitStatus", report->problems[i].status);
        putJsonText(json, "text", report->problems[i].text);
        endJson(json, '}');
    }
    endJson(json, ']');
}

static void showCheckJson(const checkReport* report)
{
    const chainWalk* walk = &report->walk;
    jsonWriter json;
    beginAnswer(&json);
    putJsonText(&json, "directory", report->line->place.directory);
    putJsonText(&json, "verdict", wordFor(statusOf(report)));
    putJsonNumber(&json, "exitStatus", statusOf(report));
    putJsonProblems(&json, report);
    putJsonBool(&json, "writerAtWork", isWriterAlive(report));
    putJsonFinding(&json, "history", &report->pair.history);
    putJsonFinding(&json, "shadow", &report->pair.shadow);
    putJsonNumber(&json, "imageCount", walk->numImages);
    putJsonNumber(&json, "incompleteCount", walk->numIncomplete);
    putJsonText(&json, "newestRestorable", newestRestorable(report));
    if (report->ageHours >= 0)
        putJsonNumber(&json, "ageHours", report->ageHours);
    else
        putJsonText(&json, "ageHours", nullptr);
    beginJson(&json, "missing", '[');
    for (int i = 0; i < walk->numTablespaces; i++) {
        const chainLink* version = lackingVersion(walk, i);
        if (version != nullptr)
            putJsonLack(&json, walk->tablespaces[i].name, lackingImage(walk, version));
    }
    endJson(&json, ']');
    putJsonGap(&json, report->gap);
    endJsonLine(&json);
}

int checkMain(commandLine* line)
{
    checkReport report = {};
    SQLO_NLCK lock = {};
    report.line = line;
    report.ageHours = -1;
    int rc = examineQuietPair(&line->place, false, &report.pair, &report.atWork);
    if (rc != 0)
        return rc;
    report.lockKnown = queryLock(&line->place, &lock, &report.lock);
    checkFiles(&report);
    judgeLock(&report);
    rc = checkImages(&report);
    if (rc == 0 && line->json)
        showCheckJson(&report);
    else if (rc == 0)
        showCheckLine(&report);
    rc = rc != 0 ? rc : statusOf(&report);
    freeChains(&report.walk);
    freeCatalog(&report.catalog);
    return rc;
}
