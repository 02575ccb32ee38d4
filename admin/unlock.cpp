// zq3hist unlock: removes the locks that dead processes left, and no other.
#include "admin/zq3hist.h"

static bool isDead(const SQLO_NLCKSTATE* state)
{
    return state->state == sqloNLCKStale || state->state == sqloNLCKSetupDied;
}

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
        bool isGone = isDead(&state) && sqloNLCKRemoveDead(&lock, &state) == 0;
        removed += isGone;
        left += !isGone && state.state != sqloNLCKAbsent;
        if (isGone)
            printf("Removed the lock with the key 0x%08X\n", static_cast<unsigned int>(lock.key));
    }
    printf("%d locks removed, %d left alone\n", removed, left);
    return rc == END_OF_FILE ? exitDone : failWithCode(rc, "look at the locks", "unlock");
}

static int failAlive(const historyPlace* place, const SQLO_NLCKSTATE* state)
{
    if (state->state == sqloNLCKHeld)
        fail(place->directory, "the lock is held by process %d and was left alone", state->pid);
    else if (state->state == sqloNLCKFaked)
        fail(place->directory,
             "the lock's holder lives, though process %d freed the lock; it was "
             "left alone",
             state->pid);
    else
        fail(place->directory, "the lock is just being taken and was left alone");
    return exitLocked;
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
    if (!isDead(&state))
        return failAlive(place, &state);
    rc = sqloNLCKRemoveDead(&lock, &state);
    if (rc != 0)
        return failInPlace(rc, "remove the lock", place);
    tellRemoved(&state);
    return exitDone;
}
