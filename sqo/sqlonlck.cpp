// The named lock, made of one System V semaphore set for each key.
//
// The set's permission bits and the value of its one semaphore carry the whole protocol:
//
//   state         value  bits  entered by                      left by
//   absent        -      -     start, IPC_RMID by the holder   IPC_CREAT | IPC_EXCL
//   being set up  1, 0   0747  the create                      IPC_SET to 0767, or IPC_RMID
//   held          0      0767  setup complete                  IPC_RMID by the holder
//   stale         1      0767  the holder's death (SEM_UNDO)   IPC_RMID by an administrator
//
// Only the creator ever holds the lock. Whoever manages to take the semaphore of an existing set
// has taken it from the dead: it is given back, so that everybody else is told too.

#include "sqo/sqlonlck.h"

#include <sys/ipc.h>
#include <sys/sem.h>

#include <cerrno>
#include <csignal>
#include <ctime>
#include <unistd.h>

#include "sqo/sqlo.h"
#include "sqo/sqlpd.h"
#include "sqo/sqlzkrcb.h"

union semun {
    int val;
    semid_ds* buf;
    unsigned short* array;
};

enum : int { projectIdentifier = 'n' };
enum : unsigned int {
    signatureBits = 0747, // permission bits of every named-lock set
    readyBit = 0020,      // added once the creator holds the lock
    foreignBit = 0010,    // never part of a named-lock set
};
enum : unsigned int { pollMicroseconds = 1000 };
// Far more than a living creator needs for its four system calls.
static constexpr time_t setupSeconds = 2;

// What one step of the protocol tells the loop of steps.
enum : int { lockCompete = 1, lockNext = 2 };

static int systemError(const char* systemCall)
{
    int failed = errno;
    int code = sqloSystemError | failed;
    pdLogSysRC("sqloNLCK", systemCall, failed, code);
    return code;
}

static int semaphoreStep(int id, short step, short flags)
{
    sembuf operation = {0, step, flags};
    return semop(id, &operation, 1);
}

static bool setRemoved(void)
{
    if (errno != EINVAL && errno != EIDRM)
        return false;
    sqltData("sqloNLCKLock", "Semaphore was removed", nullptr, 0);
    return true;
}

static int keyConflict(void)
{
    sqltData("sqloNLCKLock", "Semaphore key conflict", nullptr, 0);
    return sqloNLCKKeyConflict;
}

static bool isNamedLock(unsigned int mode)
{
    return (mode & foreignBit) == 0 && (mode & signatureBits) == signatureBits;
}

int sqloNLCKInit(const char* path, SQLO_NLCK* lock, unsigned int options)
{
    pdtEntry();

    int rc = 0;
    int project = projectIdentifier;
    if ((options & sqloNLCKUseNodeNumber) != 0)
        project = sqlz_krcbp->nodeNumber + 1;
    lock->key = ftok(path, project);
    // A set under this key would be its creator's alone and keep nobody out.
    if (lock->key == IPC_PRIVATE)
        lock->key = -1;
    if (lock->key == -1) {
        const pdItem items[] = {{pdKindText, "No lock key for path:", 0, nullptr, 0},
                                {pdKindText, path, 0, nullptr, 0},
                                {pdKindNumber, "options = ", options, nullptr, 0},
                                {pdKindCode, "rc = ", sqloNLCKKeyFailure, nullptr, 0}};
        pdLog(__func__, pdLevelError, items, 4);
        rc = sqloNLCKKeyFailure;
    }

    pdtExit(rc);
    return rc;
}

// Makes a new set the caller's: value 1, taken to 0 with undo, then marked ready.
static int setUp(int id)
{
    semid_ds info = {};
    semun argument;
    const char* failed = nullptr;
    argument.val = 1;
    if (semctl(id, 0, SETVAL, argument) == -1)
        failed = "semctl";
    else if (semaphoreStep(id, -1, SEM_UNDO) == -1)
        failed = "semop";
    argument.buf = &info;
    if (failed == nullptr && semctl(id, 0, IPC_STAT, argument) == -1)
        failed = "semctl";
    if (failed == nullptr) {
        info.sem_perm.mode |= readyBit;
        if (semctl(id, 0, IPC_SET, argument) == -1)
            failed = "semctl";
    }
    if (failed == nullptr)
        return 0;
    int rc = systemError(failed);
    semctl(id, 0, IPC_RMID, 0);
    return rc;
}

// Opens a set that somebody else created.
static int openSet(SQLO_NLCK* lock)
{
    lock->id = semget(lock->key, 1, 0);
    if (lock->id != -1)
        return lockNext;
    if (errno == ENOENT)
        return lockCompete;
    return errno == EACCES ? keyConflict() : systemError("semget");
}

static int waitUntilReady(int id)
{
    semid_ds info = {};
    semun argument;
    argument.buf = &info;
    for (;;) {
        if (semctl(id, 0, IPC_STAT, argument) == -1) {
            if (setRemoved())
                return lockCompete;
            return errno == EACCES ? keyConflict() : systemError("semctl");
        }
        if (!isNamedLock(info.sem_perm.mode))
            return keyConflict();
        if ((info.sem_perm.mode & readyBit) != 0)
            return lockNext;
        usleep(pollMicroseconds);
    }
}

// Waits for the holder's release, which removes the set; taking the semaphore means that it died.
static int waitForHolder(int id, unsigned int options, int wait)
{
    short flags = wait == 0 ? SEM_UNDO | IPC_NOWAIT : SEM_UNDO;
    while (semaphoreStep(id, -1, flags) == -1) {
        if (errno == EINTR && (options & sqloNLCKReportInterrupts) != 0)
            return sqloNLCKInterrupted;
        if (errno == EINTR)
            continue;
        if (setRemoved())
            return lockCompete;
        return errno == EAGAIN ? sqloNLCKBusy : systemError("semop");
    }
    sqltData("sqloNLCKLock", "Named Lock owner died !!!", nullptr, 0);
    if (semaphoreStep(id, 1, SEM_UNDO) == -1)
        systemError("semop");
    return sqloNLCKOwnerDied;
}

int sqloNLCKLock(SQLO_NLCK* lock, unsigned int options, int wait)
{
    pdtEntry();

    int rc = lockCompete;
    while (rc == lockCompete) {
        lock->id = semget(lock->key, 1, IPC_CREAT | IPC_EXCL | signatureBits);
        if (lock->id != -1)
            rc = setUp(lock->id);
        else if (errno != EEXIST)
            rc = systemError("semget");
        else
            rc = openSet(lock);
        if (rc == lockNext)
            rc = waitUntilReady(lock->id);
        if (rc == lockNext)
            rc = waitForHolder(lock->id, options, wait);
    }

    pdtExit(rc);
    return rc;
}

int sqloNLCKUnlock(SQLO_NLCK* lock)
{
    pdtEntry();

    int rc = semctl(lock->id, 0, IPC_RMID, 0) == -1 ? systemError("semctl") : 0;

    pdtExit(rc);
    return rc;
}

int sqloNLCKTerm(SQLO_NLCK*)
{
    pdtEntry();
    pdtExit(0);
    return 0;
}

// The creator is known by the pid that SETVAL left on the semaphore; before that only by the set's
// age.
static bool creatorGone(int pid, const semid_ds* info)
{
    if (pid > 0)
        return kill(pid, 0) == -1 && errno == ESRCH;
    return time(nullptr) - info->sem_ctime > setupSeconds;
}

static int lookAtSet(SQLO_NLCKSTATE* state)
{
    semid_ds info = {};
    semun argument;
    argument.buf = &info;
    if (semctl(state->id, 0, IPC_STAT, argument) == -1)
        return -1;
    if (!isNamedLock(info.sem_perm.mode)) {
        state->state = sqloNLCKForeign;
        return 0;
    }
    int value = semctl(state->id, 0, GETVAL);
    state->pid = value == -1 ? -1 : semctl(state->id, 0, GETPID);
    if (state->pid == -1)
        return -1;
    if ((info.sem_perm.mode & readyBit) != 0)
        state->state = value == 0 ? sqloNLCKHeld : sqloNLCKStale;
    else
        state->state = creatorGone(state->pid, &info) ? sqloNLCKSetupDied : sqloNLCKSettingUp;
    return 0;
}

int sqloNLCKQuery(const SQLO_NLCK* lock, SQLO_NLCKSTATE* state)
{
    pdtEntry();

    int rc = 0;
    *state = {sqloNLCKAbsent, 0, semget(lock->key, 1, 0)};
    if (state->id == -1 || lookAtSet(state) == -1) {
        state->pid = 0;
        if (errno == EACCES || errno == EPERM)
            state->state = sqloNLCKForeign;
        else if (errno == ENOENT || errno == EINVAL || errno == EIDRM)
            *state = {sqloNLCKAbsent, 0, -1};
        else
            rc = systemError(state->id == -1 ? "semget" : "semctl");
    }

    pdtExit(rc);
    return rc;
}

int sqloNLCKRemoveDead(const SQLO_NLCK* lock, const SQLO_NLCKSTATE* state)
{
    pdtEntry();

    SQLO_NLCKSTATE now;
    int rc = sqloNLCKQuery(lock, &now);
    if (rc == 0 && (now.id != state->id || now.state != state->state ||
                    (now.state != sqloNLCKStale && now.state != sqloNLCKSetupDied)))
        rc = sqloNLCKBusy;
    if (rc == 0 && semctl(now.id, 0, IPC_RMID, 0) == -1 && errno != EINVAL && errno != EIDRM)
        rc = systemError("semctl");

    pdtExit(rc);
    return rc;
}
