// The reader of the committed history: for everything that only looks. Stands on the rows, the
// header and the decision of repair; nothing in the library stands on it.
//
// Why a read without the lock can be trusted. Two things are asked of the files:
//
// Committed. The status letters tell which copy holds a committed state (the table in
// sqluhRecovery.cpp): the history file when it is blank or 'C', else a shadow that is usable or the
// source of a rebuild. A writer stopped between any two of its writes leaves one of the two so.
//
// Quiet. Nobody wrote while they were read: afterwards both files, by descriptor and by path, have
// the device, inode, size and change time that they had at first, and at first those times were
// older than the clock that the system takes them from. A later write gets a time that is not older
// than that clock, and gets it before its bytes can be seen, so it cannot hide; nor can it where
// the clock was set back and has not come to those times again. What can hide is a single write
// that the system had begun before: of the pair's writes only those of a header and of the last
// bytes of a copy matter then, and a header of which a part is seen does not pass its checksum; so
// what seems unusable is looked at again. A clock that is set takes the proof away, and the read is
// made again.
//
// Where that cannot be proven (a writer that commits without pause, a file system whose times are
// not this system's own), the files are read under the lock.

#include <cerrno>
#include <csignal>
#include <cstring>
#include <ctime>

#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/vfs.h>

#include "history/sqluhDiagnostics.h"
#include "history/sqluhHeader.h"
#include "history/sqluhRows.h"
#include "history/sqluhfun.h"

enum : int {
    quietTries = 4,    // reads without the lock before it is asked for
    doubtfulLooks = 3, // reads that find damage before it is believed
    lockSeconds = 5,   // for how long the lock is asked for
};
enum : long { lockPauseNanoseconds = 200000 };

// One of the two files during a read.
struct lookedFile {
    char path[pathCapacity];
    SQLO_FHANDLE fh;
    bool present;
    struct stat status; // when the read began
    SQLUH_HEADER header;
    SQLUH_FILESTATE state;
};

// One read of the pair.
struct pairRead {
    lookedFile history, shadow;
    timespec clock;  // when it began: what the system stamps files with
    timespec offset; // of that clock from the one that is never set
    int refusal;     // why the shadow could not be looked at; 0: it could
    bool foreign;    // the times of a file are not this system's own
    SQLUH_COMMITTED* result;
};

static int systemCode(int number)
{
    return sqloSystemError | number;
}

// Whether a code tells nothing of a file: for want of memory, descriptors or rights.
static bool isShortage(int rc)
{
    static const int numbers[] = {ENOMEM, EMFILE, ENFILE, EACCES, EPERM};
    for (int number : numbers)
        if (rc == systemCode(number))
            return true;
    return false;
}

// Lets the clock go on that the system stamps files with.
static void pauseForATick(void)
{
    timespec tick = {};
    if (clock_getres(CLOCK_REALTIME_COARSE, &tick) == 0)
        nanosleep(&tick, nullptr);
}

static void pause(long nanoseconds)
{
    const timespec time = {0, nanoseconds};
    nanosleep(&time, nullptr);
}

// --- Time ----------------------------------------------------------------------------------------

static bool isEarlier(const timespec& a, const timespec& b)
{
    return a.tv_sec != b.tv_sec ? a.tv_sec < b.tv_sec : a.tv_nsec < b.tv_nsec;
}

static bool isSameTime(const timespec& a, const timespec& b)
{
    return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

static timespec difference(const timespec& a, const timespec& b)
{
    timespec result = {a.tv_sec - b.tv_sec, a.tv_nsec - b.tv_nsec};
    if (result.tv_nsec < 0)
        result = {result.tv_sec - 1, result.tv_nsec + 1000000000};
    return result;
}

// Reads both clocks within one tick of theirs.
static void readClocks(timespec* clock, timespec* offset)
{
    timespec steady;
    timespec again;
    do {
        clock_gettime(CLOCK_REALTIME_COARSE, clock);
        clock_gettime(CLOCK_MONOTONIC_COARSE, &steady);
        clock_gettime(CLOCK_REALTIME_COARSE, &again);
    } while (!isSameTime(*clock, again));
    *offset = difference(*clock, steady);
}

// Whether a write from the beginning until now would have given the file another time. One without
// nanoseconds may be of a file system that counts whole seconds.
static bool isSettled(const lookedFile* file, const timespec& beginning, timespec now)
{
    timespec changed = file->status.st_ctim;
    now.tv_sec += 2;
    if (file->fh.descriptor == sqloNoFile.descriptor || isEarlier(now, changed))
        return true;
    if (changed.tv_nsec == 0)
        changed.tv_sec += 2;
    return isEarlier(changed, beginning);
}

// --- The two files -------------------------------------------------------------------------------

// Opens the file if it is there and reads its header. Returns 0, or what tells nothing of the file.
static int openToLook(lookedFile* file)
{
    int rc = sqloopenp(file->path, sqloOpenRead, sqloPermissions, &file->fh);
    file->present = rc != systemCode(ENOENT) && rc != systemCode(ENOTDIR);
    file->state = {false, '\0'};
    if (rc != 0)
        return isShortage(rc) ? rc : 0;
    if (fstat(file->fh.descriptor, &file->status) != 0)
        return systemCode(errno);
    rc = sqluhTakeHeader(file->fh, &file->header, nullptr);
    file->state = sqluhStateOfFile(rc, &file->header);
    return isShortage(rc) ? rc : 0;
}

static void endLook(lookedFile* file)
{
    if (file->fh.descriptor != sqloNoFile.descriptor)
        sqloclose(file->fh);
    file->fh = sqloNoFile;
}

static bool sameStatus(const struct stat& a, const struct stat& b)
{
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino && a.st_size == b.st_size &&
           isSameTime(a.st_ctim, b.st_ctim);
}

static bool isAsItWas(const lookedFile* file)
{
    struct stat status;
    bool there = stat(file->path, &status) == 0;
    if (!file->present || file->fh.descriptor == sqloNoFile.descriptor)
        return there == file->present;
    return there && sameStatus(status, file->status) && fstat(file->fh.descriptor, &status) == 0 &&
           sameStatus(status, file->status);
}

// Whether nobody wrote since the read began.
static bool nobodyWrote(const pairRead* read)
{
    timespec clock;
    timespec offset;
    bool unchanged = isAsItWas(&read->history) && isAsItWas(&read->shadow);
    readClocks(&clock, &offset);
    unchanged = unchanged && isSettled(&read->history, read->clock, clock) &&
                isSettled(&read->shadow, read->clock, clock);
    return unchanged && isSameTime(offset, read->offset) && !isEarlier(clock, read->clock);
}

// Whether the file system's times are this system's own: the usual local ones.
static bool hasOwnTimes(const lookedFile* file)
{
    static const unsigned int local[] = {EXT4_SUPER_MAGIC, XFS_SUPER_MAGIC,       BTRFS_SUPER_MAGIC,
                                         TMPFS_MAGIC,      OVERLAYFS_SUPER_MAGIC, F2FS_SUPER_MAGIC};
    struct statfs system;
    if (file->fh.descriptor == sqloNoFile.descriptor)
        return true;
    if (fstatfs(file->fh.descriptor, &system) != 0)
        return false;
    for (unsigned int type : local)
        if (static_cast<unsigned int>(system.f_type) == type)
            return true;
    return false;
}

// --- Entries -------------------------------------------------------------------------------------

// Reads and proves every entry of a file. Returns 0 with *result filled, also when entries are
// damaged, or what tells nothing of the file.
static int readRows(const lookedFile* file, SQLUH_WORKAREA* workArea, SQLUH_COMMITTED* result)
{
    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    sqluhProvenEntry proven;
    sqluhBeginProving(&proven, true);
    long long offset = headerLength;
    int rc = sqloseek(file->fh, offset, sqloFromStart, nullptr);
    while (rc == 0) {
        rc = sqluhProveEntry(file->fh, &entry, workArea, &proven, nullptr);
        // Whatever is left of an entry is one: the history must not seem to end before it.
        if (rc == END_OF_FILE && proven.begun)
            rc = HISTORY_FILE_DAMAGED;
        if (rc == 0)
            rc = sqluhAddRow(result->rows, &entry, workArea, &proven);
        if (rc == 0)
            offset += entry.size;
    }
    if (isShortage(rc))
        return rc;
    result->numRows = result->rows->count;
    result->maxTablespaces = result->rows->maxTablespaces;
    result->header = file->header;
    result->failure = rc == END_OF_FILE ? 0 : rc;
    result->damagedAt = result->failure != 0 ? offset : 0;
    result->damagedEntry = result->failure != 0 ? result->numRows + 1 : 0;
    return 0;
}

static bool agreesWithHeader(const SQLUH_COMMITTED* result)
{
    return result->failure == 0 && result->numRows == result->header.entryCount;
}

static int newCommitted(SQLUH_COMMITTED** out)
{
    void* block = nullptr;
    void* rows = nullptr;
    *out = nullptr;
    int rc = allocateZeroed(sizeof(SQLUH_COMMITTED), &block);
    if (rc == 0)
        rc = allocateZeroed(sizeof(sqluhRows), &rows);
    if (rc != 0) {
        sqlofmblkEx(block);
        return rc;
    }
    *out = static_cast<SQLUH_COMMITTED*>(block);
    (*out)->rows = static_cast<sqluhRows*>(rows);
    return 0;
}

// Whether the shadow's entries, not the history file's, are to be taken: those of a history file
// that is damaged, or that does not agree with its header where the two differ in size.
static bool isShadowBetter(const pairRead* read, const SQLUH_COMMITTED* ofShadow)
{
    const SQLUH_COMMITTED* ofHistory = read->result;
    if (read->history.status.st_size == read->shadow.status.st_size)
        return ofHistory->failure != 0 && ofShadow->failure == 0;
    return !agreesWithHeader(ofHistory) && agreesWithHeader(ofShadow);
}

// Reads the shadow beside a history file that was read and left a doubt, and takes the better one.
static int readSecond(pairRead* read, SQLUH_WORKAREA* workArea)
{
    bool sameSize = read->history.status.st_size == read->shadow.status.st_size;
    bool doubtful = sameSize ? read->result->failure != 0 : !agreesWithHeader(read->result);
    // While the history file says 'C' the shadow may be changed in part.
    if (!doubtful || read->history.state.status != statusConsistent ||
        !(read->shadow.state.usable || read->shadow.state.status == statusPending))
        return 0;
    SQLUH_COMMITTED* second = nullptr;
    int rc = newCommitted(&second);
    if (rc == 0)
        rc = readRows(&read->shadow, workArea, second);
    if (rc == 0 && isShadowBetter(read, second)) {
        second->fromShadow = true;
        second->damagedAt = read->result->damagedAt;
        second->damagedEntry = read->result->damagedEntry;
        SQLUH_COMMITTED* other = read->result;
        read->result = second;
        second = other;
    }
    sqluhFreeCommitted(&second);
    return rc;
}

// Reads the copy that the status letters tell. Returns 0, HISTORY_FILE_MISSING or
// HISTORY_FILE_DAMAGED, or what tells nothing of the files.
static int readChosen(pairRead* read)
{
    sqluhRepair due = sqluhDecideRepair(read->history.state, read->shadow.state);
    if (due == sqluhRepairAnew && read->refusal != 0)
        return read->refusal;
    if (due == sqluhRepairAnew)
        return read->history.present || read->shadow.present ? HISTORY_FILE_DAMAGED
                                                             : HISTORY_FILE_MISSING;
    bool fromShadow = due == sqluhRepairHistory;
    SQLUH_WORKAREA workArea = {};
    int rc = newCommitted(&read->result);
    if (rc == 0)
        rc = sqluhInitWorkArea(&workArea, defaultWorkAreaSize);
    if (rc == 0)
        rc = readRows(fromShadow ? &read->shadow : &read->history, &workArea, read->result);
    if (rc == 0) {
        read->result->fromShadow = fromShadow;
        if (!fromShadow)
            rc = readSecond(read, &workArea);
    }
    if (workArea.buffer != nullptr)
        sqlofmblkEx(workArea.buffer);
    return rc;
}

// --- One read ------------------------------------------------------------------------------------

static void endRead(pairRead* read)
{
    endLook(&read->history);
    endLook(&read->shadow);
    sqluhFreeCommitted(&read->result);
}

// Begins a read: the clocks first, then the files. A history file that can be read does without a
// shadow that cannot be looked at.
static int beginRead(pairRead* read)
{
    readClocks(&read->clock, &read->offset);
    int rc = openToLook(&read->history);
    read->refusal = openToLook(&read->shadow);
    return rc;
}

// Reads the pair and proves that nobody wrote. *proven: what comes back counts.
static int readQuietly(pairRead* read, bool* proven)
{
    int rc = beginRead(read);
    *proven = rc != 0;
    read->foreign = !hasOwnTimes(&read->history) || !hasOwnTimes(&read->shadow);
    if (rc == 0 && !read->foreign && isSettled(&read->history, read->clock, read->clock) &&
        isSettled(&read->shadow, read->clock, read->clock)) {
        rc = readChosen(read);
        *proven = nobodyWrote(read);
    }
    return rc;
}

// --- Under the lock ------------------------------------------------------------------------------

// Takes the lock of the history file at the path if it is free, and touches no set that is there.
// Returns 0, sqloNLCKBusy, sqloNLCKOwnerDied, sqloNLCKKeyFailure when no file is there, or another
// lock code.
static int tryLock(const char* path, SQLO_NLCK* lock)
{
    SQLO_NLCKSTATE state = {};
    if (!ossPathExists(path))
        return sqloNLCKKeyFailure;
    int rc = sqloNLCKInit(path, lock, sqloNLCKUseNodeNumber);
    if (rc == 0)
        rc = sqloNLCKQuery(lock, &state);
    if (rc != 0)
        return rc;
    lock->id = state.id;
    switch (state.state) {
    case sqloNLCKAbsent:
        return sqloNLCKLock(lock, 0, 0);
    case sqloNLCKStale:
    case sqloNLCKSetupDied:
        return sqloNLCKOwnerDied;
    case sqloNLCKForeign:
        return sqloNLCKKeyConflict;
    default:
        return sqloNLCKBusy;
    }
}

// Whether what kept writers out during a read still does: the lock of the file at the path, that of
// a dead process, or that no file is there.
static bool isStillLocked(const char* path, const SQLO_NLCK* lock, int held)
{
    SQLO_NLCK now;
    SQLO_NLCKSTATE state = {};
    if (held == sqloNLCKKeyFailure)
        return !ossPathExists(path);
    return sqloNLCKInit(path, &now, sqloNLCKUseNodeNumber) == 0 && now.key == lock->key &&
           sqloNLCKQuery(&now, &state) == 0 && state.id == lock->id;
}

// Holds back the signals that would end the process: it must not die with the lock.
static void holdBackSignals(sigset_t* before)
{
    static const int faults[] = {SIGSEGV, SIGBUS, SIGILL, SIGFPE, SIGABRT, SIGTRAP, SIGSYS};
    sigset_t held;
    sigfillset(&held);
    for (int fault : faults)
        sigdelset(&held, fault);
    pthread_sigmask(SIG_SETMASK, &held, before);
}

// Reads the pair under the lock, if that is free. A lock that a dead process left keeps writers out
// just as well.
static int readLocked(pairRead* read, bool* done)
{
    SQLO_NLCK lock = {-1, -1};
    sigset_t before;
    holdBackSignals(&before);
    int held = tryLock(read->history.path, &lock);
    int rc = held;
    *done = false;
    if (held == 0 || held == sqloNLCKOwnerDied || held == sqloNLCKKeyFailure) {
        rc = beginRead(read);
        if (rc == 0)
            rc = readChosen(read);
        *done = isStillLocked(read->history.path, &lock, held);
    }
    if (held == 0)
        sqloNLCKUnlock(&lock);
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return rc;
}

// --- The reader ----------------------------------------------------------------------------------

// Says in the log what was found wrong with the files that were read, as every reader does.
static void logDamage(const pairRead* read, int rc)
{
    SQLUH_HEADER header;
    const lookedFile* files[] = {&read->history, &read->shadow};
    for (const lookedFile* file : files)
        if (rc == HISTORY_FILE_DAMAGED && file->fh.descriptor != sqloNoFile.descriptor)
            sqluhReadHeader(file->fh, &header);
    if (rc != 0 || read->result->damagedAt == 0)
        return;
    bool inShadow = read->result->fromShadow && read->result->failure != 0;
    SQLO_FHANDLE fh = inShadow ? read->shadow.fh : read->history.fh;
    SQLUH_WORKAREA workArea = {};
    sqluhProvenEntry proven;
    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    if (sqloseek(fh, read->result->damagedAt, sqloFromStart, nullptr) == 0 &&
        sqluhInitWorkArea(&workArea, defaultWorkAreaSize) == 0) {
        sqluhBeginProving(&proven, false);
        sqluhCheckEntry(fh, &entry, &workArea, &proven);
        sqlofmblkEx(workArea.buffer);
    }
}

// Whether a result may be of a write that was seen in part.
static bool isDoubtful(const pairRead* read, int rc)
{
    return rc == HISTORY_FILE_DAMAGED || rc == HISTORY_FILE_MISSING ||
           (rc == 0 && read->result->damagedAt != 0);
}

// Reads the pair without the lock, some times. *done: what comes back counts.
static int readUnlocked(pairRead* read, bool* done)
{
    int rc = 0;
    int doubts = 0;
    for (int tries = 0; !*done && !read->foreign && tries < quietTries; tries++) {
        endRead(read);
        rc = readQuietly(read, done);
        if (*done && isDoubtful(read, rc) && ++doubts < doubtfulLooks) {
            *done = false;
            tries = 0;
        }
        if (!*done)
            pauseForATick();
    }
    return rc;
}

// Reads the pair whichever way comes first, for some seconds.
static int readEitherWay(pairRead* read)
{
    bool done = false;
    timespec start;
    timespec now;
    int rc = readUnlocked(read, &done);
    clock_gettime(CLOCK_MONOTONIC, &start);
    now = start;
    // Who holds the lock may give it back, and writers may pause; nothing else is waited for.
    while (!done && now.tv_sec - start.tv_sec < lockSeconds &&
           !(read->foreign && rc < 0 && rc != sqloNLCKBusy)) {
        endRead(read);
        rc = readLocked(read, &done);
        if (!done) {
            pause(lockPauseNanoseconds);
            endRead(read);
            int quiet = readQuietly(read, &done);
            rc = done ? quiet : rc;
        }
        clock_gettime(CLOCK_MONOTONIC, &now);
    }
    return done || rc < 0 ? rc : static_cast<int>(sqloNLCKBusy);
}

int sqluhReadCommitted(const char* directory, SQLUH_COMMITTED** out)
{
    pdtEntry();

    pairRead read = {};
    *out = nullptr;
    read.history.fh = read.shadow.fh = sqloNoFile;
    int rc = sqluhCheckDirectory(directory);
    if (rc == 0)
        rc = sqluhJoinPath(read.history.path, pathCapacity, directory, SQLUH_HISTORY_NAME);
    if (rc == 0)
        rc = sqluhJoinPath(read.shadow.path, pathCapacity, directory, SQLUH_SHADOW_NAME);
    if (rc == 0) {
        rc = readEitherWay(&read);
        logDamage(&read, rc);
    }
    if (rc == 0) {
        SQLUH_COMMITTED* result = read.result;
        result->history = read.history.state;
        result->shadow = read.shadow.state;
        *out = result;
        read.result = nullptr;
        if (result->damagedAt != 0 && result->failure == 0)
            rc = HISTORY_READ_PAST_DAMAGE;
        else if (result->fromShadow)
            rc = HISTORY_READ_FROM_SHADOW;
    }
    endRead(&read);

    pdtExit(rc);
    return rc;
}

int sqluhGetCommitted(const SQLUH_COMMITTED* committed, uint32_t row, SQLUH_ENTRY* entry,
                      bool asWritten)
{
    if (row < committed->numRows)
        return sqluhTakeRow(committed->rows->rows[row], entry, asWritten);
    return committed->failure != 0 ? committed->failure : static_cast<int>(END_OF_FILE);
}

void sqluhFreeCommitted(SQLUH_COMMITTED** committed)
{
    if (*committed != nullptr) {
        sqluhFreeRows((*committed)->rows);
        sqlofmblkEx((*committed)->rows);
        sqlofmblkEx(*committed);
    }
    *committed = nullptr;
}
