// What the two files of a directory hold.
#include "admin/pair.h"

#include <cerrno>
#include <ctime>
#include <sys/stat.h>
#include <unistd.h>

static bool isKnownStatus(char status)
{
    return status == statusConsistent || status == statusPending || status == statusCommitted;
}

static fileVerdict verdictOf(const fileFinding* finding)
{
    int rc = finding->file.rc != 0 ? finding->file.rc : finding->entries.rc;
    if (finding->file.rc == (sqloSystemError | ENOENT))
        return fileMissing;
    if (isSystemCode(rc))
        return fileRefused;
    // Text that is no header may read as one of an old version, but for the letter.
    if (finding->file.rc != 0 || !isKnownStatus(finding->file.header.status))
        return fileNoHistory;
    if (rc != 0)
        return fileDamaged;
    return finding->entries.count < finding->file.header.entryCount ? fileShort : fileSound;
}

int findInFile(const char* path, const char* progress, fileFinding* finding)
{
    SQLO_FHANDLE file = sqloNoFile;
    SQLUH_WORKAREA workArea = {};
    *finding = {};
    lookAtFile(path, &finding->file);
    int rc = 0;
    if (finding->file.rc == 0 && isKnownStatus(finding->file.header.status)) {
        rc = sqluhInitWorkArea(&workArea, defaultWorkAreaSize);
        if (rc != 0)
            return rc;
        finding->file.rc = sqloopenp(path, sqloOpenRead, sqloPermissions, &file);
        if (finding->file.rc == 0) {
            readAllEntries(file, &workArea, progress, &finding->entries);
            sqloclose(file);
        }
        sqlofmblkEx(workArea.buffer);
    }
    finding->verdict = verdictOf(finding);
    return rc;
}

int failUnsound(const fileFinding* finding, const char* name, const char* what)
{
    const entriesReport* entries = &finding->entries;
    switch (finding->verdict) {
    case fileMissing:
    case fileRefused:
        return failWithCode(finding->file.rc != 0 ? finding->file.rc : entries->rc, what, name);
    case fileNoHistory:
        fail(name, "cannot %s: the file is no history", what);
        return exitDamaged;
    case fileDamaged:
        fail(name, "cannot %s: the entry at offset %lld is damaged", what, entries->offset);
        return exitDamaged;
    case fileShort:
        fail(name, "cannot %s: the file ends after %u of %u entries", what, entries->count,
             finding->file.header.entryCount);
        return exitDamaged;
    case fileSound:
        break;
    }
    if (finding->file.state.usable)
        return 0;
    fail(name, "cannot %s: a batch is unfinished in the history (status 'P')", what);
    return exitDamaged;
}

static bool hasSameEntries(const fileFinding* history, const fileFinding* shadow)
{
    return history->verdict == fileSound && shadow->verdict == fileSound &&
           history->file.state.usable && history->file.size == shadow->file.size &&
           history->entries.digest == shadow->entries.digest;
}

// What brings the pair into step without losing an entry that can be read.
static sqluhRepair repairFor(const pairFinding* pair)
{
    const fileFinding* history = &pair->history;
    const fileFinding* shadow = &pair->shadow;
    if (history->verdict == fileSound && history->file.state.usable)
        return pair->same && shadow->file.state.usable &&
                       history->file.header.status == statusConsistent
                   ? sqluhRepairNone
                   : sqluhRepairShadow;
    return shadow->verdict == fileSound ? sqluhRepairHistory : sqluhRepairAnew;
}

int examinePair(const historyPlace* place, bool withProgress, pairFinding* pair)
{
    *pair = {};
    int rc =
        findInFile(place->historyPath, withProgress ? SQLUH_HISTORY_NAME : nullptr, &pair->history);
    if (rc == 0)
        rc = findInFile(place->shadowPath, withProgress ? SQLUH_SHADOW_NAME : nullptr,
                        &pair->shadow);
    pair->refused = pair->history.verdict == fileRefused || pair->shadow.verdict == fileRefused;
    pair->same = hasSameEntries(&pair->history, &pair->shadow);
    pair->due = repairFor(pair);
    return rc == 0 ? 0 : failWithCode(rc, "read the history", place->directory);
}

// A file that is changed gets a change time that is not older than the coarse clock, nor later: one
// that is later was written before the clock was set back.
static bool isQuiet(const char* path, const struct stat* before, const timespec* clock)
{
    struct stat now = {};
    stat(path, &now);
    const timespec& changed = before->st_ctim;
    bool isEarlier = changed.tv_sec < clock->tv_sec ||
                     (changed.tv_sec == clock->tv_sec && changed.tv_nsec < clock->tv_nsec);
    bool isLater = changed.tv_sec > clock->tv_sec + 2;
    return (isEarlier || isLater) && now.st_ino == before->st_ino &&
           now.st_size == before->st_size && now.st_ctim.tv_sec == changed.tv_sec &&
           now.st_ctim.tv_nsec == changed.tv_nsec;
}

int examineQuietPair(const historyPlace* place, bool withProgress, pairFinding* pair, bool* atWork)
{
    enum : int { tries = 4, pauseMicroseconds = 10000 };
    int rc = 0;
    *atWork = true;
    for (int i = 0; rc == 0 && *atWork && i < tries; i++) {
        struct stat history = {}, shadow = {};
        timespec clock;
        if (i > 0)
            usleep(pauseMicroseconds);
        stat(place->historyPath, &history);
        stat(place->shadowPath, &shadow);
        clock_gettime(CLOCK_REALTIME_COARSE, &clock);
        rc = examinePair(place, withProgress, pair);
        *atWork = !isQuiet(place->historyPath, &history, &clock) ||
                  !isQuiet(place->shadowPath, &shadow, &clock);
    }
    return rc;
}

const char* sourceOf(const historyPlace* place, const pairFinding* pair,
                     const fileFinding** finding)
{
    if (pair->due == sqluhRepairAnew)
        return nullptr;
    bool isShadow = pair->due == sqluhRepairHistory;
    *finding = isShadow ? &pair->shadow : &pair->history;
    return isShadow ? place->shadowPath : place->historyPath;
}

// --- Hints ---------------------------------------------------------------------------------------

void hintAboutPair(const historyPlace* place, const pairFinding* pair)
{
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    bool locked = queryLock(place, &lock, &state) && isLeftByDead(&state);
    // A file that is not delivered may be sound: whoever replaces it may lose entries.
    if (pair->refused)
        hint(place, "zq3hist verify DIR  # again, once the reason that is given is gone");
    else if (pair->due == sqluhRepairAnew && locked)
        hint(place, "zq3hist unlock DIR && zq3hist restore DIR FILE  # FILE: a backup");
    else if (pair->due == sqluhRepairAnew)
        hint(place, "zq3hist restore DIR FILE  # FILE: a backup; without one, zq3hist repair "
                    "--force DIR goes on with what can be read");
    else if (locked)
        hint(place, unlockAdvice);
    else if (pair->due == sqluhRepairShadow)
        hint(place, "zq3hist repair DIR  # makes the shadow anew from the history file");
    else if (pair->due == sqluhRepairHistory)
        hint(place, "zq3hist repair DIR  # takes the entries of the shadow");
}

int failPair(const historyPlace* place, const pairFinding* pair, const char* what)
{
    const fileFinding* finding = &pair->history;
    if (finding->verdict == fileMissing && pair->shadow.verdict == fileMissing)
        return failInPlace(HISTORY_FILE_MISSING, what, place);
    bool isWhole = finding->verdict == fileSound && finding->file.state.usable;
    if (isWhole || pair->shadow.verdict == fileRefused)
        finding = &pair->shadow;
    int rc = failUnsound(finding,
                         finding == &pair->history ? place->historyPath : place->shadowPath, what);
    if (rc == 0)
        fail(place->directory, "cannot %s: the two files hold different entries", what);
    hintAboutPair(place, pair);
    return rc != 0 ? rc : exitDamaged;
}
