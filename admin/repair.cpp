// zq3hist repair: opens and closes the history, which repairs it, and says what that did.
#include "admin/zq3hist.h"

#include <unistd.h>

static const char* repairedWords(sqluhRepair done)
{
    return done == sqluhRepairShadow ? "The shadow was made anew from the history file."
           : done == sqluhRepairHistory
               ? "The history file was made anew from the shadow; a batch that "
                 "was not finished is undone."
               : "Neither file could be used. Both were moved aside, to " SQLUH_SAVED_HISTORY_NAME
                 " and " SQLUH_SAVED_SHADOW_NAME ", and an empty history was made.";
}

int repairMain(commandLine* line)
{
    historyPlace* place = &line->place;
    int rc = awaitLock(place, R_OK | W_OK);
    if (rc != 0)
        return rc;

    // An open does one repair; after one of the history the shadow's mark takes another.
    sqluhRepair due = repairDueIn(place);
    if (due == sqluhRepairNone)
        puts("Nothing to repair: both files can be used and are in step.");
    bool lost = false;
    for (int round = 0; rc == 0 && due != sqluhRepairNone && round < 3; round++) {
        SQLUH_HANDLE* handle = nullptr;
        rc = sqluhOpen(&handle, place->directory, SQLUH_OPEN_UPDATE);
        lost = lost || rc == HISTORY_FILE_RECREATED;
        if (rc >= 0)
            puts(repairedWords(rc == HISTORY_FILE_RECREATED ? sqluhRepairAnew : due));
        int closed = sqluhClose(&handle);
        rc = rc < 0 ? rc : closed;
        due = repairDueIn(place);
    }
    releaseSignals();
    if (rc != 0)
        return failOpening(rc, "repair the history", place);
    if (lost)
        return fail(place->directory,
                    "the history is empty: restore a backup of it, or load it anew");
    return exitDone;
}
