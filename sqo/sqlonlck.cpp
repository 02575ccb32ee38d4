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
//
// Anybody may operate on the semaphore or remove the set. So a holder also keeps the file locked
// that the key was made from, by a lock that neither a child shares nor another descriptor of the
// same process ends, and looks at its set before it relies on it.

#include "sqo/sqlonlck.h"

#include <sys/ipc.h>
#include <sys/sem.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <pthread.h>
#include <unistd.h>

#include "sqo/sqlo.h"
#include "sqo/sqlpd.h"
#include "sqo/sqlzkrcb.h"

union semun {
    int val;
    semid_ds* buf;
    seminfo* info;
};

enum : int { projectIdentifier = 'n' };
enum : unsigned int {
    signatureBits = 0747, // permission bits of every named-lock set
    readyBit = 0020,      // added once the creator holds the lock
    foreignBit = 0010,    // never part of a named-lock set
};
enum : unsigned int { pollMicroseconds = 1000, pollsUntilTold = 3000 };
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

// --- What this process holds ---------------------------------------------------------------------

struct heldLock {
    SQLO_NLCK lock;
    pthread_t thread; // that took it; 0: the slot is free
    int file;         // descriptor that keeps the file locked; -1: none
};

// A lock that finds no slot is held all the same, only without what the table is for.
static heldLock heldLocks[64];
static pthread_mutex_t heldLocksMutex = PTHREAD_MUTEX_INITIALIZER;

static void leaveSlot(heldLock* held)
{
    if (held->file != -1)
        close(held->file);
    *held = {{-1, -1}, 0, -1};
}

static void beforeFork()
{
    pthread_mutex_lock(&heldLocksMutex);
}

static void afterForkInParent()
{
    pthread_mutex_unlock(&heldLocksMutex);
}

// A child holds nothing: the file must not stay locked when the parent dies before it.
static void afterForkInChild()
{
    for (heldLock& held : heldLocks)
        if (held.thread != 0)
            leaveSlot(&held);
    pthread_mutex_unlock(&heldLocksMutex);
}

__attribute__((constructor)) static void watchForks()
{
    pthread_atfork(beforeFork, afterForkInParent, afterForkInChild);
}

// The lock's slot, or null. The mutex is held.
static heldLock* findHeld(const SQLO_NLCK* lock)
{
    for (heldLock& held : heldLocks)
        if (held.thread != 0 && held.lock.id == lock->id)
            return &held;
    return nullptr;
}

// A slot that is free, or whose lock was taken away; null when there is none. The mutex is held.
static heldLock* findFree(void)
{
    for (heldLock& held : heldLocks)
        if (held.thread == 0)
            return &held;
    for (heldLock& held : heldLocks)
        if (sqloNLCKCheckHeld(&held.lock) != 0) {
            leaveSlot(&held);
            return &held;
        }
    return nullptr;
}

static void enterHeld(const SQLO_NLCK* lock)
{
    pthread_mutex_lock(&heldLocksMutex);
    heldLock* held = findFree();
    if (held != nullptr)
        *held = {*lock, pthread_self(), -1};
    pthread_mutex_unlock(&heldLocksMutex);
}

static void forgetHeld(const SQLO_NLCK* lock)
{
    pthread_mutex_lock(&heldLocksMutex);
    heldLock* held = findHeld(lock);
    if (held != nullptr)
        leaveSlot(held);
    pthread_mutex_unlock(&heldLocksMutex);
}

void sqloNLCKKeepFile(const SQLO_NLCK* lock, const char* path)
{
    pdtEntry();

    struct flock whole = {};
    whole.l_type = F_RDLCK;
    int file = open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (file != -1 && fcntl(file, F_OFD_SETLK, &whole) == -1) {
        close(file);
        file = -1;
    }
    pthread_mutex_lock(&heldLocksMutex);
    heldLock* held = findHeld(lock);
    const int unused = held == nullptr ? file : held->file;
    if (held != nullptr)
        held->file = file;
    pthread_mutex_unlock(&heldLocksMutex);
    if (unused != -1)
        close(unused);

    pdtExit(0);
}

// --- The protocol --------------------------------------------------------------------------------

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

static void tellUnready(int id)
{
    const pdItem items[] = {
        {pdKindText, "Still waiting for a lock that is being set up; its maker may have died.", 0,
         nullptr, 0},
        {pdKindNumber, "Semaphore set:", id, nullptr, 0}};
    pdLog("sqloNLCKLock", pdLevelWarning, items, 2);
}

static int waitUntilReady(int id)
{
    semid_ds info = {};
    semun argument;
    argument.buf = &info;
    for (unsigned int polls = 0;; polls++) {
        if (semctl(id, 0, IPC_STAT, argument) == -1) {
            if (setRemoved())
                return lockCompete;
            return errno == EACCES ? keyConflict() : systemError("semctl");
        }
        if (!isNamedLock(info.sem_perm.mode))
            return keyConflict();
        if ((info.sem_perm.mode & readyBit) != 0)
            return lockNext;
        if (polls == pollsUntilTold)
            tellUnready(id);
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
    if (rc == 0)
        enterHeld(lock);

    pdtExit(rc);
    return rc;
}

int sqloNLCKUnlock(SQLO_NLCK* lock)
{
    pdtEntry();

    int rc = 0;
    bool isRemoved = true;
    if (semctl(lock->id, 0, IPC_RMID, 0) == -1) {
        isRemoved = errno == EINVAL || errno == EIDRM;
        rc = systemError("semctl");
    }
    // What could not be removed is still held, and this thread must not wait for it.
    if (isRemoved)
        forgetHeld(lock);

    pdtExit(rc);
    return rc;
}

// Identifiers are not used again soon, and every operation leaves its process's number.
int sqloNLCKCheckHeld(const SQLO_NLCK* lock)
{
    pdtEntry();
    int rc = semctl(lock->id, 0, GETPID) == getpid() ? 0 : sqloNLCKLost;
    pdtExit(rc);
    return rc;
}

int sqloNLCKCheckDeadlock(const SQLO_NLCK* lock)
{
    pdtEntry();

    int rc = 0;
    pthread_mutex_lock(&heldLocksMutex);
    const pthread_t me = pthread_self();
    for (const heldLock& held : heldLocks)
        if (held.thread == me && held.lock.key == lock->key && sqloNLCKCheckHeld(&held.lock) == 0)
            rc = sqloNLCKDeadlock;
    pthread_mutex_unlock(&heldLocksMutex);

    pdtExit(rc);
    return rc;
}

int sqloNLCKTerm(SQLO_NLCK*)
{
    pdtEntry();
    pdtExit(0);
    return 0;
}

// --- Looking at a set ----------------------------------------------------------------------------

// Reads the process's state letter and the time of its start, in seconds of the wall clock.
static bool readProcess(int pid, char* letter, time_t* started)
{
    char text[512] = {};
    unsigned long long ticks = 0;
    snprintf(text, sizeof text, "/proc/%d/stat", pid);
    int file = open(text, O_RDONLY | O_CLOEXEC);
    ssize_t length = file == -1 ? -1 : read(file, text, sizeof text - 1);
    if (file != -1)
        close(file);
    text[length > 0 ? length : 0] = '\0';
    // The name, which may hold anything, stands in parentheses; the start is field 22.
    const char* rest = strrchr(text, ')');
    if (rest == nullptr || sscanf(rest,
                                  ") %c %*s %*s %*s %*s %*s %*s %*s %*s %*s %*s %*s %*s %*s %*s "
                                  "%*s %*s %*s %*s %llu",
                                  letter, &ticks) != 2)
        return false;
    timespec boot;
    clock_gettime(CLOCK_BOOTTIME, &boot);
    *started = time(nullptr) - boot.tv_sec +
               static_cast<time_t>(ticks / static_cast<unsigned long long>(sysconf(_SC_CLK_TCK)));
    return true;
}

// Whether the process that operated on a set at the time is no more. All times are whole seconds,
// hence the two of tolerance.
static bool isGone(int pid, time_t then)
{
    char letter;
    time_t started;
    if (!readProcess(pid, &letter, &started))
        return kill(pid, 0) == -1 && errno == ESRCH;
    return letter == 'Z' || started > then + 2;
}

// The creator is known by the pid that SETVAL left on the semaphore; before that only by the set's
// age.
static bool creatorGone(int pid, const semid_ds* info)
{
    return pid > 0 ? isGone(pid, info->sem_ctime) : time(nullptr) - info->sem_ctime > setupSeconds;
}

// Whether somebody keeps a file locked from which such a key is made: the key has the low bits of
// its inode number. A lock on another file with the same bits only makes an administrator wait.
static bool isFileKept(int32_t key)
{
    char line[256];
    unsigned long inode = 0;
    bool kept = false;
    FILE* locks = fopen("/proc/locks", "re");
    while (locks != nullptr && !kept && fgets(line, sizeof line, locks) != nullptr)
        kept = sscanf(line, "%*d: OFDLCK %*s READ %*d %*x:%*x:%lu", &inode) == 1 &&
               (inode & 0xFFFF) == (static_cast<uint32_t>(key) & 0xFFFF);
    if (locks != nullptr)
        fclose(locks);
    return kept;
}

static int lookAtSet(int32_t key, SQLO_NLCKSTATE* state)
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
    if ((info.sem_perm.mode & readyBit) == 0)
        state->state = creatorGone(state->pid, &info) ? sqloNLCKSetupDied : sqloNLCKSettingUp;
    else if (value == 0 && !(state->pid > 0 && isGone(state->pid, info.sem_otime)))
        state->state = sqloNLCKHeld;
    else
        state->state = isFileKept(key) ? sqloNLCKFaked : sqloNLCKStale;
    return 0;
}

int sqloNLCKQuery(const SQLO_NLCK* lock, SQLO_NLCKSTATE* state)
{
    pdtEntry();

    int rc = 0;
    *state = {sqloNLCKAbsent, 0, semget(lock->key, 1, 0)};
    if (state->id == -1 || lookAtSet(lock->key, state) == -1) {
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

int sqloNLCKNext(int* index, SQLO_NLCK* lock, SQLO_NLCKSTATE* state)
{
    pdtEntry();

    struct seminfo table = {};
    semid_ds info = {};
    semun argument;
    argument.info = &table;
    const int last = semctl(0, 0, SEM_INFO, argument);
    int rc = last == -1 ? systemError("semctl") : END_OF_FILE;
    argument.buf = &info;
    while (rc == END_OF_FILE && *index <= last) {
        const unsigned int project = static_cast<unsigned int>(sqlz_krcbp->nodeNumber) + 1;
        lock->id = semctl((*index)++, 0, SEM_STAT, argument);
        lock->key = info.sem_perm.__key;
        if (lock->id != -1 && isNamedLock(info.sem_perm.mode) && info.sem_nsems == 1 &&
            static_cast<uint32_t>(lock->key) >> 24 == (project & 0xFF)) {
            rc = sqloNLCKQuery(lock, state);
        }
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
