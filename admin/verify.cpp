// zq3hist verify: reads every entry of both files and changes nothing.
#include "admin/zq3hist.h"

#include <cstring>
#include <unistd.h>

// Reads one file and says what was found; false when it is not sound.
static bool verifyFile(const char* path, const char* name, SQLUH_WORKAREA* workArea,
                       entriesReport* entries)
{
    SQLO_FHANDLE file = sqloNoFile;
    SQLUH_HEADER header;
    int rc = sqloopenp(path, sqloOpenRead, sqloPermissions, &file);
    if (rc != 0) {
        printf("%s: cannot be opened: %s\n", name, wordsForCode(rc));
        return false;
    }
    rc = sqluhReadHeader(file, &header);
    if (rc != 0)
        printf("%s: damaged at offset 0: the header cannot be read\n", name);
    if (rc == 0) {
        readAllEntries(file, workArea, name, entries);
        rc = entries->rc;
        if (rc == HISTORY_FILE_DAMAGED)
            printf("%s: damaged at offset %lld: entry %u cannot be read\n", name, entries->offset,
                   entries->count + 1);
        else if (rc != 0)
            printf("%s: cannot be read at offset %lld: %s\n", name, entries->offset,
                   wordsForCode(rc));
        else if (header.entryCount != entries->count)
            printf("%s: sound, %u entries; its header counts %u\n", name, entries->count,
                   header.entryCount);
        else
            printf("%s: sound, %u entries\n", name, entries->count);
    }
    sqloclose(file);
    return rc == 0;
}

static int verifyBoth(historyPlace* place)
{
    SQLUH_WORKAREA workArea = {};
    entriesReport history = {}, shadow = {};
    int rc = sqluhInitWorkArea(&workArea, defaultWorkAreaSize);
    if (rc != 0)
        return failWithCode(rc, "verify the history", place->directory);
    bool historySound = verifyFile(place->historyPath, SQLUH_HISTORY_NAME, &workArea, &history);
    bool shadowSound = verifyFile(place->shadowPath, SQLUH_SHADOW_NAME, &workArea, &shadow);
    sqlofmblkEx(workArea.buffer);
    if (historySound && shadowSound) {
        if (history.digest == shadow.digest && history.count == shadow.count)
            return exitDone;
        puts("The two files hold different entries.");
        return fail(place->directory, "the history is not sound");
    }
    fail(place->directory, "the history is not sound");
    if (shadowSound)
        fprintf(stderr, "zq3hist: hint: zq3hist restore DIR DIR/" SQLUH_SHADOW_NAME
                        " takes the entries of the shadow\n");
    else if (historySound)
        fprintf(stderr, "zq3hist: hint: zq3hist restore DIR DIR/" SQLUH_HISTORY_NAME
                        " makes the shadow anew\n");
    else
        fprintf(stderr, "zq3hist: hint: zq3hist restore DIR FILE puts a backup in its place\n");
    return exitFailed;
}

int verifyMain(int argc, char** argv)
{
    historyPlace place = {};
    SQLUH_HANDLE* handle = nullptr;
    int rc = takeArguments(argc, argv, "DIR", 1, 1, nullptr);
    if (rc == 0)
        rc = takePlace(argv[1], &place);
    if (rc == 0)
        rc = awaitLock(&place, R_OK);
    if (rc != 0)
        return rc;
    // Taking the lock makes a history file where there is none, and verifying must not.
    if (hasHistoryFile(&place)) {
        rc = sqluhHandleAllocAndInit(place.directory, &handle);
        if (rc == 0)
            rc = sqluhLock(handle);
        rc = rc == 0 ? 0 : failWithCode(rc, "take the lock", place.directory);
    }
    if (rc == 0)
        rc = verifyBoth(&place);
    if (handle != nullptr) {
        int unlocked = sqluhUnlock(handle);
        sqluhHandleFree(&handle);
        if (rc == 0 && unlocked != 0)
            rc = failWithCode(unlocked, "release the lock", place.directory);
    }
    releaseSignals();
    return rc;
}
