// Directories, their locks, and opening a history.
#include "admin/zq3hist.h"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <ctime>
#include <initializer_list>
#include <sys/stat.h>
#include <unistd.h>

int takePlace(const char* argument, historyPlace* place)
{
    struct stat status;
    size_t length = strlen(argument);
    const char* separator = length != 0 && argument[length - 1] == '/' ? "" : "/";
    const char* here = argument[0] == '-' ? "./" : ""; // a hint would give it as an option
    if (strlen(here) + length + strlen(separator) > maxDirectoryLength)
        return fail(argument, "the directory's name has more than %u bytes", maxDirectoryLength);
    if (stat(argument, &status) != 0)
        return failWithCode(sqloSystemError | errno, "open the directory", argument);
    if (!S_ISDIR(status.st_mode))
        return fail(argument, "not a directory");
    if (access(argument, X_OK) != 0) // its files would seem to be missing
        return failWithCode(sqloSystemError | errno, "search the directory", argument);
    snprintf(place->directory, sizeof place->directory, "%s%s%s", here, argument, separator);
    snprintf(place->historyPath, sizeof place->historyPath, "%s%s%s" SQLUH_HISTORY_NAME, here,
             argument, separator);
    snprintf(place->shadowPath, sizeof place->shadowPath, "%s%s%s" SQLUH_SHADOW_NAME, here,
             argument, separator);
    return 0;
}

bool hasHistoryFile(const historyPlace* place)
{
    return ossPathExists(place->historyPath);
}

bool queryLock(const historyPlace* place, SQLO_NLCK* lock, SQLO_NLCKSTATE* state)
{
    return hasHistoryFile(place) &&
           sqloNLCKInit(place->historyPath, lock, sqloNLCKUseNodeNumber) == 0 &&
           sqloNLCKQuery(lock, state) == 0;
}

bool isLeftByDead(const SQLO_NLCKSTATE* state)
{
    return state->state == sqloNLCKStale || state->state == sqloNLCKSetupDied;
}

// Those that would end the process.
static void fatalSignals(sigset_t* set)
{
    sigemptyset(set);
    static constexpr int numbers[] = {SIGINT, SIGTERM, SIGHUP, SIGQUIT};
    for (int number : numbers) {
        struct sigaction action;
        if (sigaction(number, nullptr, &action) == 0 && action.sa_handler != SIG_IGN)
            sigaddset(set, number);
    }
}

void holdSignals(void)
{
    sigset_t set;
    fatalSignals(&set);
    sigprocmask(SIG_BLOCK, &set, nullptr);
}

void releaseSignals(void)
{
    sigset_t set;
    fatalSignals(&set);
    sigprocmask(SIG_UNBLOCK, &set, nullptr);
}

bool isSignalHeld(void)
{
    sigset_t fatal, pending, both;
    fatalSignals(&fatal);
    return sigpending(&pending) == 0 && sigandset(&both, &fatal, &pending) == 0 &&
           sigisemptyset(&both) == 0;
}

int failInterrupted(const historyPlace* place)
{
    return isSignalHeld() ? fail(place->directory, "interrupted; nothing was changed") : 0;
}

// A file that may not be read counts as unusable for the library, which would move it aside where
// the directory lets it: whoever lacks the rights must not get that far.
static int checkRights(const historyPlace* place, int rights)
{
    for (const char* path : {place->historyPath, place->shadowPath})
        if (ossPathExists(path) && access(path, rights) != 0)
            return failWithCode(sqloSystemError | errno, "use the history", path);
    return 0;
}

static long long milliseconds(void)
{
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return now.tv_sec * 1000LL + now.tv_nsec / 1000000;
}

void describeHolder(const SQLO_NLCKSTATE* state, char* text)
{
    snprintf(text, holderCapacity,
             state->state == sqloNLCKHeld ? "the lock is held by process %d"
             : state->state == sqloNLCKFaked
                 ? "the lock's holder lives, though process %d freed the lock"
                 : "the lock is just being taken by process %d",
             state->pid);
}

int checkLock(const historyPlace* place, int rights)
{
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    if (!hasHistoryFile(place) && !ossPathExists(place->shadowPath))
        return failInPlace(HISTORY_FILE_MISSING, "open the history", place);
    int rc = checkRights(place, rights);
    if (rc != 0 || !queryLock(place, &lock, &state))
        return rc;
    if (isLeftByDead(&state))
        return failInPlace(sqloNLCKOwnerDied, "take the lock", place);
    return state.state == sqloNLCKForeign ? failInPlace(sqloNLCKKeyConflict, "take the lock", place)
                                          : 0;
}

int awaitLock(const historyPlace* place, int rights)
{
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    char holder[holderCapacity];
    bool told = false;
    const long long start = milliseconds();
    int rc = checkLock(place, rights);
    while (rc == 0 && queryLock(place, &lock, &state) && state.state != sqloNLCKAbsent) {
        describeHolder(&state, holder);
        if (place->wait >= 0 && milliseconds() - start >= place->wait * 1000LL) {
            fail(place->directory, "%s", holder);
            return exitLocked;
        }
        if (!told)
            fprintf(stderr, "zq3hist: waiting: %s\n", holder);
        told = true;
        usleep(50 * 1000);
        rc = failInterrupted(place);
        if (rc == 0)
            rc = checkLock(place, rights);
    }
    if (rc == 0)
        holdSignals();
    return rc;
}

int failOpening(int code, const char* what, const historyPlace* place)
{
    if (code != HISTORY_FILE_DAMAGED || repairDueIn(place) == sqluhRepairAnew)
        return failInPlace(code, what, place);
    fail(place->directory,
         "cannot %s: the history needs a repair that failed; the diagnostic log tells why (a full "
         "disk, for one), and nothing is lost",
         what);
    return exitDamaged;
}

static bool isEmptyFile(const char* path)
{
    struct stat status;
    return stat(path, &status) == 0 && status.st_size == 0;
}

int createIfMissing(historyPlace* place)
{
    if (hasHistoryFile(place) && !isEmptyFile(place->historyPath))
        return 0;
    if (ossPathExists(place->shadowPath))
        return 0; // the open rebuilds the history from it
    if (strlen(place->directory) > maxCreateDirectoryLength)
        return fail(place->directory, "a new history's directory has a name of at most %u bytes",
                    maxCreateDirectoryLength);
    if (access(place->directory, W_OK) != 0)
        return failWithCode(sqloSystemError | errno, "create the history", place->directory);

    // The lock is made from the history file and needs an empty one. It is filled, not replaced, so
    // whoever waits for the lock waits for the right one; and only if nobody else did it meanwhile.
    SQLUH_HANDLE* handle = nullptr;
    int rc = hasHistoryFile(place) ? awaitLock(place, R_OK | W_OK) : 0;
    if (rc != 0)
        return rc;
    holdSignals();
    rc = sqluhHandleAllocAndInit(place->directory, &handle);
    if (rc == 0)
        rc = sqluhLock(handle);
    if (rc == 0 && isEmptyFile(place->historyPath) && !ossPathExists(place->shadowPath))
        rc = sqluhCreate(place->directory);
    if (handle != nullptr) {
        int unlocked = sqluhUnlock(handle);
        rc = rc != 0 ? rc : unlocked;
        sqluhHandleFree(&handle);
    }
    return rc == 0 ? 0 : failInPlace(rc, "create the history", place);
}
