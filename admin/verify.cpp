// zq3hist verify: reads every entry of both files and changes nothing.
#include "admin/zq3hist.h"

#include <cerrno>
#include <unistd.h>

// Reads one file and says what was found. Returns 0 when it is sound, or what is wrong with it.
static int verifyFile(const char* path, const char* name, SQLUH_WORKAREA* workArea,
                      entriesReport* entries)
{
    SQLO_FHANDLE file = sqloNoFile;
    SQLUH_HEADER header;
    *entries = {};
    int rc = sqloopenp(path, sqloOpenRead, sqloPermissions, &file);
    if (rc != 0) {
        printf("%s: cannot be opened: %s\n", name, wordsForCode(rc));
        return rc;
    }
    rc = sqluhReadHeader(file, &header);
    // Text that is no header may read as one of an old version, but for the letter.
    if (rc == 0 && header.status != statusConsistent && header.status != statusPending &&
        header.status != statusCommitted)
        rc = HISTORY_FILE_DAMAGED;
    bool headerRead = rc == 0;
    if (headerRead) {
        readAllEntries(file, workArea, name, entries);
        rc = entries->rc;
    }
    sqloclose(file);
    if (isSystemCode(rc))
        printf("%s: cannot be read at offset %lld: %s\n", name, entries->offset, wordsForCode(rc));
    else if (!headerRead)
        printf("%s: damaged at offset 0: the header cannot be read\n", name);
    else if (rc != 0)
        printf("%s: damaged at offset %lld: entry %u cannot be read\n", name, entries->offset,
               entries->count + 1);
    else if (header.entryCount != entries->count)
        printf("%s: sound, %u entries; its header counts %u\n", name, entries->count,
               header.entryCount);
    else
        printf("%s: sound, %u entries\n", name, entries->count);
    return rc;
}

// Whether the system refused to deliver a file that is there.
static bool isRefused(int rc)
{
    return isSystemCode(rc) && rc != (sqloSystemError | ENOENT);
}

static const char* adviceFor(int history, int shadow)
{
    // The file may be sound: whoever replaces it from elsewhere may lose entries.
    if (isRefused(history) || isRefused(shadow))
        return "what could not be read may be sound; remove the reason that is given, then repeat "
               "zq3hist verify DIR";
    if (history == 0) // also when both are sound: it is the one that programs read
        return "zq3hist restore DIR DIR/" SQLUH_HISTORY_NAME " makes the shadow anew";
    if (shadow == 0)
        return "zq3hist restore DIR DIR/" SQLUH_SHADOW_NAME " takes the entries of the shadow";
    return "zq3hist restore DIR FILE puts a backup in its place";
}

static int verifyBoth(const historyPlace* place)
{
    SQLUH_WORKAREA workArea = {};
    entriesReport inHistory, inShadow;
    int rc = sqluhInitWorkArea(&workArea, defaultWorkAreaSize);
    if (rc != 0)
        return failInPlace(rc, "verify the history", place);
    int history = verifyFile(place->historyPath, SQLUH_HISTORY_NAME, &workArea, &inHistory);
    int shadow = verifyFile(place->shadowPath, SQLUH_SHADOW_NAME, &workArea, &inShadow);
    sqlofmblkEx(workArea.buffer);
    bool bothSound = history == 0 && shadow == 0;
    if (bothSound && inHistory.digest == inShadow.digest && inHistory.count == inShadow.count)
        return exitDone;
    if (bothSound)
        puts("The two files hold different entries.");
    fail(place->directory, "the history is not sound");
    hint(place, adviceFor(history, shadow));
    return exitFailed;
}

int verifyMain(commandLine* line)
{
    historyPlace* place = &line->place;
    SQLUH_HANDLE* handle = nullptr;
    int rc = awaitLock(place, R_OK);
    if (rc != 0)
        return rc;
    // Taking the lock makes a history file where there is none, and verifying must not.
    if (hasHistoryFile(place)) {
        rc = sqluhHandleAllocAndInit(place->directory, &handle);
        if (rc == 0)
            rc = sqluhLock(handle);
        rc = rc == 0 ? 0 : failInPlace(rc, "take the lock", place);
    }
    if (rc == 0)
        rc = verifyBoth(place);
    if (handle != nullptr) {
        int unlocked = sqluhUnlock(handle);
        sqluhHandleFree(&handle);
        if (rc == 0 && unlocked != 0)
            rc = failInPlace(unlocked, "release the lock", place);
    }
    releaseSignals();
    return rc;
}
