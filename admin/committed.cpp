// Looking at a history without touching it.
#include "admin/zq3hist.h"

#include <cstdarg>
#include <cstring>

static void warn(const historyPlace* place, const char* format, ...)
    __attribute__((format(printf, 2, 3)));
static void warn(const historyPlace* place, const char* format, ...)
{
    va_list arguments;
    fflush(stdout);
    fputs("zq3hist: warning: ", stderr);
    va_start(arguments, format);
    vfprintf(stderr, format, arguments);
    va_end(arguments);
    fputs(", ", stderr);
    putEscaped(stderr, place->directory, strlen(place->directory));
    putc('\n', stderr);
}

// A lock that a dead process left does not keep a reader off, but every writer.
static bool warnOfLock(const historyPlace* place)
{
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    bool held = queryLock(place, &lock, &state);
    if (held && isLeftByDead(&state)) {
        warn(place, "a process died while it held the lock, which stops the next writer");
        hint(place, unlockAdvice);
    }
    return held && state.state == sqloNLCKHeld;
}

static void warnOfState(const historyPlace* place, const SQLUH_COMMITTED* committed)
{
    bool writing = warnOfLock(place);
    if (committed->damagedEntry != 0 && committed->failure == 0)
        warn(place, "entry %u of %s, at offset %lld, is damaged; the other file was read",
             committed->damagedEntry,
             committed->fromShadow ? SQLUH_HISTORY_NAME : SQLUH_SHADOW_NAME, committed->damagedAt);
    else if (committed->history.status == statusPending)
        warn(place, writing ? "a batch is being written; the state before it was read"
                            : "a batch is unfinished; the state before it was read");
    else if (committed->fromShadow)
        warn(place, "the history file cannot be used; the shadow was read");
    if (committed->failure == 0 && committed->numRows < committed->header.entryCount) {
        warn(place, "the history ends after %u of %u entries", committed->numRows,
             committed->header.entryCount);
        hint(place, "zq3hist verify DIR  # reads both files and tells what mends them");
    }
}

int readCommitted(const historyPlace* place, SQLUH_COMMITTED** committed)
{
    int rc = sqluhReadCommitted(place->directory, committed);
    if (rc < 0)
        return failInPlace(rc, "read the history", place);
    warnOfState(place, *committed);
    return 0;
}

int failDamaged(const historyPlace* place, const SQLUH_COMMITTED* committed, const char* what)
{
    if (committed->damagedEntry == 0)
        return failInPlace(committed->failure, what, place);
    fail(committed->fromShadow ? place->shadowPath : place->historyPath,
         "cannot %s: entry %u, at offset %lld, is damaged", what, committed->damagedEntry,
         committed->damagedAt);
    hint(place, "zq3hist verify DIR  # reads both files and tells what mends them");
    return exitDamaged;
}
