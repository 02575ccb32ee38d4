// The named lock: an exclusive lock between processes, made of one System V semaphore set.
//
// Holding the lock means having created the set; releasing it removes the set. The lock is not
// re-entrant, and it works by key: two paths whose keys clash share one lock (ftok takes 16 bits of
// the inode number, 8 of the device number and 8 of the project identifier).
#pragma once

#include <sys/types.h>

#include <cstdint>

struct SQLO_NLCK {
    int32_t key; // key_t made by ftok; -1: none
    int32_t id;  // semaphore set; valid while the lock is being taken or held
};
static_assert(sizeof(SQLO_NLCK) == 8 && sizeof(key_t) == sizeof(int32_t));

enum : int {
    sqloNLCKKeyFailure = static_cast<int>(0x800F00AE),  // no key: usually the file does not exist
    sqloNLCKKeyConflict = static_cast<int>(0x800F00AD), // the key's set is another program's
    sqloNLCKBusy = static_cast<int>(0x870F0057),        // held elsewhere, and wait was 0
    sqloNLCKOwnerDied = static_cast<int>(0x870F0075),   // the holder died without releasing
    sqloNLCKInterrupted = static_cast<int>(0x800F0003), // a signal, and options asked to know
    sqloNLCKDeadlock = static_cast<int>(0x83000023),    // this thread holds the key: EDEADLK
    sqloNLCKLost = static_cast<int>(0x8300002B),        // the held set was taken away: EIDRM
};

enum : unsigned int { sqloNLCKUseNodeNumber = 1 };    // options of sqloNLCKInit
enum : unsigned int { sqloNLCKReportInterrupts = 1 }; // options of sqloNLCKLock

// What a key's semaphore set shows to someone who only looks.
enum : int {
    sqloNLCKAbsent,    // no set: the lock is free
    sqloNLCKSettingUp, // created, not yet ready; its creator lives or cannot be told
    sqloNLCKSetupDied, // created, never made ready, and its creator is gone
    sqloNLCKHeld,      // ready, and held by a process
    sqloNLCKStale,     // ready, and its holder died
    sqloNLCKForeign,   // not a named-lock set, or one that may not be read
    sqloNLCKFaked,     // looks stale, but its holder lives: somebody else gave the value back
};

struct SQLO_NLCKSTATE {
    int32_t state; // one of the above
    int32_t pid;   // process that last operated on the semaphore; 0: none, or not visible
    int32_t id;    // semaphore set; -1 when there is none, or none that may be opened
};

extern "C" {

// Makes the key from an existing file's path and stores it in the caller's record. options: 0, or
// sqloNLCKUseNodeNumber to make the project identifier from the engine's node number. Returns 0, or
// sqloNLCKKeyFailure with the key -1.
int sqloNLCKInit(const char* path, SQLO_NLCK* lock, unsigned int options);

// Takes the lock. options: 0, or sqloNLCKReportInterrupts. wait: 0 returns sqloNLCKBusy at once
// when the lock is held; any other value waits without limit. Either way a set that is still being
// set up is waited for. Returns 0 with the lock held, or without it sqloNLCKBusy,
// sqloNLCKKeyConflict, sqloNLCKOwnerDied (to every caller, until an administrator removes the set),
// sqloNLCKInterrupted, or sqloSystemError with the errno.
int sqloNLCKLock(SQLO_NLCK* lock, unsigned int options, int wait);

// Tells whether taking the lock would be waiting for this very thread, which holds its key already,
// be it for another file. Returns 0 or sqloNLCKDeadlock.
int sqloNLCKCheckDeadlock(const SQLO_NLCK* lock);

// Keeps the file at path, from which the held lock's key was made, locked until the release or the
// process's end, so that sqloNLCKQuery can tell a living holder from one whose death was faked.
// Where that fails the holder only goes without it.
void sqloNLCKKeepFile(const SQLO_NLCK* lock, const char* path);

// Tells whether this process still holds the lock that it took. Returns 0, or sqloNLCKLost when the
// set was removed or operated on by somebody else: then others may have come in.
int sqloNLCKCheckHeld(const SQLO_NLCK* lock);

// Releases a held lock and wakes those who wait. Returns 0 or sqloSystemError with the errno.
int sqloNLCKUnlock(SQLO_NLCK* lock);

// Ends the use of the record. Always 0; it holds nothing.
int sqloNLCKTerm(SQLO_NLCK* lock);

// Tells the state of the key's set without touching it. A process that is a zombie, or that began
// after the set's last operation and so only has the number of the one that made it, counts as
// dead. Returns 0 with *state filled, or sqloSystemError with the errno.
int sqloNLCKQuery(const SQLO_NLCK* lock, SQLO_NLCKSTATE* state);

// Finds the next named-lock set of the engine's node in the system's table, whatever its file, with
// its key in *lock and its state. *index: 0 at first; kept between the calls. Returns 0;
// END_OF_FILE when there is no other; or sqloSystemError with the errno.
int sqloNLCKNext(int* index, SQLO_NLCK* lock, SQLO_NLCKSTATE* state);

// Removes the set of a dead process, and only such a set: state must be the outcome of
// sqloNLCKQuery, and the set must still be the same and still show sqloNLCKStale or
// sqloNLCKSetupDied. Returns 0, sqloNLCKBusy when it does not, or sqloSystemError with the errno.
int sqloNLCKRemoveDead(const SQLO_NLCK* lock, const SQLO_NLCKSTATE* state);

} // extern "C"
