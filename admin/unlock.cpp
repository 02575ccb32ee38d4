// zq3hist unlock: removes the locks that dead processes left, and no other.
#include "admin/zq3hist.h"

static void tellRemoved(const SQLO_NLCKSTATE* state)
{
    puts(state->state == sqloNLCKStale
             ? "Removed the lock of a process that died while it held it."
             : "Removed the lock of a process that died while it took it.");
}

// Locks whose file is gone cannot be named by a directory.
static int unlockAll(void)
{
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    int index = 0, removed = 0, left = 0;
    int rc = 0;
    while ((rc = sqloNLCKNext(&index, &lock, &state)) == 0) {
        bool isGone = isLeftByDead(&state) && sqloNLCKRemoveDead(&lock, &state) == 0;
        removed += isGone;
        left += !isGone && state.state != sqloNLCKAbsent;
        if (isGone)
            printf("Removed the lock with the key 0x%08X\n", static_cast<unsigned int>(lock.key));
    }
    printf("%d locks removed, %d left alone\n", removed, left);
    return rc == END_OF_FILE ? exitDone : failWithCode(rc, "look at the locks", "unlock");
}

int unlockMain(commandLine* line)
{
    historyPlace* place = &line->place;
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    if (line->all)
        return unlockAll();
    if (!hasHistoryFile(place))
        return failInPlace(HISTORY_FILE_MISSING, "look at the lock", place);
    int rc = sqloNLCKInit(place->historyPath, &lock, sqloNLCKUseNodeNumber);
    if (rc == 0)
        rc = sqloNLCKQuery(&lock, &state);
    if (rc != 0)
        return failInPlace(rc, "look at the lock", place);
    if (state.state == sqloNLCKForeign)
        return failInPlace(sqloNLCKKeyConflict, "remove the lock", place);
    if (state.state == sqloNLCKAbsent) {
        puts("The lock is free; nothing to remove.");
        return exitDone;
    }
    if (!isLeftByDead(&state)) {
        char holder[holderCapacity];
        describeHolder(&state, holder);
        fail(place->directory, "%s; it was left alone", holder);
        return exitLocked;
    }
    rc = sqloNLCKRemoveDead(&lock, &state);
    if (rc != 0)
        return failInPlace(rc, "remove the lock", place);
    tellRemoved(&state);
    return exitDone;
}
