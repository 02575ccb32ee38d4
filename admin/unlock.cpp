// zq3hist unlock: removes the lock that a dead process left, and no other.
#include "admin/zq3hist.h"

int unlockMain(commandLine* line)
{
    historyPlace* place = &line->place;
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    if (!hasHistoryFile(place))
        return failInPlace(HISTORY_FILE_MISSING, "look at the lock", place);
    int rc = sqloNLCKInit(place->historyPath, &lock, sqloNLCKUseNodeNumber);
    if (rc == 0)
        rc = sqloNLCKQuery(&lock, &state);
    if (rc != 0)
        return failInPlace(rc, "look at the lock", place);

    switch (state.state) {
    case sqloNLCKAbsent:
        puts("The lock is free; nothing to remove.");
        return exitDone;
    case sqloNLCKHeld:
        return fail(place->directory, "the lock is held by process %d and was left alone",
                    state.pid);
    case sqloNLCKSettingUp:
        return fail(place->directory, "the lock is just being taken and was left alone");
    case sqloNLCKForeign:
        return failInPlace(sqloNLCKKeyConflict, "remove the lock", place);
    default:
        break;
    }
    rc = sqloNLCKRemoveDead(&lock, &state);
    if (rc != 0)
        return failInPlace(rc, "remove the lock", place);
    puts(state.state == sqloNLCKStale
             ? "Removed the lock of a process that died while it held it."
             : "Removed the lock of a process that died while it took it.");
    return exitDone;
}
