// The two files of a directory: what both hold, and putting a whole history in their place.
#pragma once

#include "admin/json.h"
#include "admin/zq3hist.h"

// --- What the files hold (pair.cpp) --------------------------------------------------------------

enum fileVerdict {
    fileSound,
    fileMissing,
    fileRefused,   // the system does not deliver it; it may be sound
    fileNoHistory, // its header cannot be read
    fileDamaged,   // an entry cannot be read
    fileShort,     // it ends before the last entry that its header counts
};

struct fileFinding {
    fileVerdict verdict;
    fileReport file;
    entriesReport entries;
};

// Reads header and entries of the file at path. progress: as for readAllEntries. Returns 0, also
// for a file that is not sound; or the allocation's code.
int findInFile(const char* path, const char* progress, fileFinding* finding);

// Puts what was found as an object (verify.cpp).
void putJsonFinding(jsonWriter* json, const char* key, const fileFinding* finding);

// Says what is wrong with the file and returns exitDamaged, or the status of what the system
// refused; returns 0 without a word for a sound file whose status is neither 'P' nor unknown.
int failUnsound(const fileFinding* finding, const char* name, const char* what);

struct pairFinding {
    fileFinding history, shadow;
    bool refused;    // the system does not deliver one of them
    bool same;       // both hold the committed entries
    sqluhRepair due; // by what the files hold; sqluhRepairAnew: neither is whole
};
int examinePair(const historyPlace* place, bool withProgress, pairFinding* pair);

// Does so without the lock, again while the files are changed meanwhile, a few times; *atWork tells
// that they always were.
int examineQuietPair(const historyPlace* place, bool withProgress, pairFinding* pair, bool* atWork);

// The file that holds the committed history, if one of them does, and its finding.
const char* sourceOf(const historyPlace* place, const pairFinding* pair,
                     const fileFinding** finding);

// Hints what to do about the pair, and about a dead owner's lock.
void hintAboutPair(const historyPlace* place, const pairFinding* pair);

// Says what is wrong with the pair, with a hint, and returns an exit status. what: the job that
// fails.
int failPair(const historyPlace* place, const pairFinding* pair, const char* what);

// --- Replacing them (install.cpp) ----------------------------------------------------------------

// A name beside another one for a file that only this process writes.
int formTemporary(const char* where, char* path);

// Waits for the directory's lock and takes it, rights as for awaitLock; unlockPair releases it.
// Both complain and return an exit status; unlockPair returns rc, or the status of the release if
// that is 0.
int lockPair(historyPlace* place, int rights, SQLUH_HANDLE** handle);
int unlockPair(const historyPlace* place, SQLUH_HANDLE** handle, int rc);

// Where files that are replaced are kept; empty: there was none.
struct keptFiles {
    char history[pathCapacity];
    char shadow[pathCapacity];
};

// Copies the file at path to a name beside it that nobody uses, if it is there and holds anything.
// Complains and returns an exit status, else 0.
int keepFile(const char* path, char* kept);
int keepPair(SQLUH_HANDLE* handle, keptFiles* kept);
void tellKept(const keptFiles* kept);
void putJsonKept(jsonWriter* json, const keptFiles* kept);

// Puts the complete history file at temporary, whose status letter it changes, in the place of
// both files, under the lock. Complains and returns an exit status, else 0.
int replacePair(const historyPlace* place, SQLUH_HANDLE* handle, char* temporary);

// Does all of it: makes the pair if the directory has none, takes the lock, keeps the old files and
// replaces them. *handle is null or the caller's to be given to unlockPair.
int installHistory(historyPlace* place, char* temporary, keptFiles* kept, SQLUH_HANDLE** handle);

// --- Writing a part of a history (part.cpp) ------------------------------------------------------

struct partReport {
    uint32_t total; // entries that were read
    uint32_t kept;  // of them, that were written
    bool complete;  // reading ended where the file ends
};

// Whether an entry goes into the part. Of its texts, only objectPart is there.
typedef bool (*partFilter)(const void* context, const zq3HistoryData* entry);

// Writes a new history file of those entries of the one at source that the filter takes, byte for
// byte, up to one that cannot be read; null: all. A source without a readable header has none. The
// file at target is durable. Returns 0 or a code of the library.
int writePart(const char* source, partFilter filter, const void* context, const char* target,
              partReport* report);
