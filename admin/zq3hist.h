// The administrator's tool for history directories: its subcommands and what they share.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>

#include "history/sqluhist.h"

// Exit statuses, which the subcommands return.
enum : int {
    exitDone = 0,
    exitFailed = 1,     // what was asked for could not be done, for a reason without a number
    exitUsage = 2,      // the command line is wrong
    exitDamaged = 3,    // the history is damaged or missing
    exitLocked = 4,     // the lock's owner died, it stayed busy, or another's set has its key
    exitNoImage = 5,    // no image has the timestamp, or holds the tablespace
    exitIncomplete = 6, // a chain lacks an image
};

// A history directory as the library takes it, and its two files.
struct historyPlace {
    char directory[pathCapacity]; // ends with the separator
    char historyPath[pathCapacity];
    char shadowPath[pathCapacity];
    long wait; // seconds that awaitLock waits; -1: without end
};

// --- The command line (subcommand.cpp) -----------------------------------------------------------

struct commandLine;

// What there is to know about a subcommand. run returns an exit status.
struct subcommand {
    const char* name;
    int (*run)(commandLine* line);
    int numDirectories;
    int least, most;      // arguments after the directories; most -1: any number
    unsigned int options; // that it takes
    const char* form;     // the arguments as the usage line shows them
    const char* help;
};

enum : unsigned int {
    optionJson = 1,
    optionLast = 2,
    optionSince = 4,
    optionKeep = 8,
    optionBefore = 16,
    optionIncomplete = 32,
    optionAll = 64,
    optionHave = 128,
    optionMaxAge = 256,
    optionColor = 512,
    optionSvg = 1024,
    optionWait = 2048,
    optionDryRun = 4096,
    optionForce = 8192,
    optionSkipExisting = 16384,
    optionAllLocks = 32768,    // in place of the directory
    optionNeededSince = 65536, // of unneeded
    optionPruneBefore = 131072,
    optionSalvage = 262144, // repair by force
};

// A call of a subcommand.
struct commandLine {
    const subcommand* command;
    historyPlace place;  // the directory; the first of two
    historyPlace target; // the second
    char** arguments;    // those after the directories, null after the last
    int numArguments;
    bool json, incomplete, all, dryRun, force, skipExisting;
    char before[timestampWidth + 1]; // empty: not given; so are the others, null or -1
    char since[timestampWidth + 1];
    long last, keep, maxAge, wait;
    const char *have, *color, *svg;
    char aliasPaths[2][pathCapacity]; // of directories given as aliases
    int aliasAfter[2];                // so many arguments
    int numAliases;
};

int imagesMain(commandLine* line);
int planMain(commandLine* line);
int chartMain(commandLine* line);
int checkMain(commandLine* line);
int unneededMain(commandLine* line);
int neededByMain(commandLine* line);
int loadMain(commandLine* line);
int dumpMain(commandLine* line);
int statusMain(commandLine* line);
int verifyMain(commandLine* line);
int repairMain(commandLine* line);
int copyMain(commandLine* line);
int backupMain(commandLine* line);
int restoreMain(commandLine* line);
int pruneMain(commandLine* line);
int unlockMain(commandLine* line);

// Runs the subcommand that argv[1] names and returns its exit status. hasChanged tells afterwards
// whether it was one that could have been rehearsed, and did what it was asked for.
int runProgram(int argc, char** argv);
bool hasChanged(void);

// --- Points in time (instant.cpp) ----------------------------------------------------------------

// Takes a timestamp as histories hold it, 14 digits, or as people write it: 2025-01-11 01:00:00,
// with a blank or T in the middle. timestamp: room for 15 characters. False: neither.
bool parseTimestamp(const char* text, char* timestamp);

// Whether 14 digits are a date and a time that exist.
bool isTime(const char* timestamp);

// Takes a timestamp from the command line: complains and returns exitUsage when it is none, else 0.
int takeInstant(const char* what, const char* text, char* timestamp);

// --- Messages (message.cpp) ----------------------------------------------------------------------

// Says "zq3hist: what, where" on standard error, what being formatted, and returns exitFailed.
int fail(const char* where, const char* format, ...) __attribute__((format(printf, 2, 3)));

// Says the same in the words for a code of the library, "zq3hist: cannot WHAT: reason, where", and
// returns the code's exit status.
int failWithCode(int code, const char* what, const char* where);

// Says "zq3hist: hint: advice" on standard error. DIR in the advice stands for the directory, and
// DIR/NAME for a file in it; each is put in as one word for the shell, ready to be typed.
void hint(const historyPlace* place, const char* advice);

// What to do about a lock that a dead process left.
inline constexpr char unlockAdvice[] =
    "zq3hist unlock DIR && zq3hist repair DIR  # removes the lock and settles what is unfinished";

// failWithCode about a history directory, with a hint what to do about the code.
int failInPlace(int code, const char* what, const historyPlace* place);

// Complains about the command line and returns exitUsage.
int failUsage(const char* format, ...) __attribute__((format(printf, 1, 2)));

// Complains with the subcommand's usage line and returns exitUsage.
int failForm(const commandLine* line);

const char* entryWord(unsigned long long count); // "entry" or "entries"

// The words for a code of the library. They live until the next call.
const char* wordsForCode(int code);

// The words for an exit status, and the exit status for a code of the library.
const char* wordsForStatus(int status);
int statusForCode(int code);

// Whether a code is that of a system call that failed, its errno included, and has no words of
// ours.
bool isSystemCode(int code);

// Writes bytes with everything but printable ASCII as escapes of the stanza form.
void putEscaped(FILE* out, const char* text, size_t length);

// --- Directories and locks (access.cpp) ----------------------------------------------------------

// Takes a directory from the command line, with or without its last separator. Complains and
// returns exitFailed when it is too long, no directory, or one that may not be searched, else 0.
int takePlace(const char* argument, historyPlace* place);

bool hasHistoryFile(const historyPlace* place);

// The state of the lock, looked at without touching it. False when the directory has no history
// file to make a key of, or the system does not tell.
bool queryLock(const historyPlace* place, SQLO_NLCK* lock, SQLO_NLCKSTATE* state);
bool isLeftByDead(const SQLO_NLCKSTATE* state); // its process died

// Says in words who has a lock that is neither free nor left by the dead.
enum : unsigned int { holderCapacity = 80 };
void describeHolder(const SQLO_NLCKSTATE* state, char* text);

// Looks whether the lock could be taken, sooner or later. Complains and returns an exit status when
// there is no history, when a right is missing, or when the wait would never end; else 0.
int checkLock(const historyPlace* place, int rights);

// Waits, as long as the place allows, until no living process holds the lock, and says so when it
// has to; from then on the signals that would end the process are held back until releaseSignals,
// since dying with the lock leaves it to an administrator. rights: what access(2) must grant for
// the two files. Complains and returns an exit status as checkLock does, or when the lock stays
// busy; else 0.
int awaitLock(const historyPlace* place, int rights);

// Holds those signals back, also where it is a file that would be left behind, and lets them
// through again at the end of a command.
void holdSignals(void);
void releaseSignals(void);

// Whether one of them came meanwhile. failInterrupted then complains and returns exitFailed, else
// 0.
bool isSignalHeld(void);
int failInterrupted(const historyPlace* place);

// Says why an open failed, telling a repair that failed from a history that is beyond one, and
// returns the code's exit status.
int failOpening(int code, const char* what, const historyPlace* place);

// Makes an empty pair of files, under the lock, when the directory has none. Complains on failure
// and returns exitFailed, else 0.
int createIfMissing(historyPlace* place);

// --- Looking (committed.cpp) ---------------------------------------------------------------------

// Reads the committed history, which changes nothing and waits for nobody, and says on standard
// error what whoever goes on with the history should know: that it is the shadow's, that a batch is
// unfinished, that a dead owner's lock is in the way. Complains and returns an exit status, else 0
// with what sqluhFreeCommitted releases.
int readCommitted(const historyPlace* place, SQLUH_COMMITTED** committed);

// Says what ended early what was read, and returns an exit status. what: the job that fails.
int failDamaged(const historyPlace* place, const SQLUH_COMMITTED* committed, const char* what);

// --- The two files (files.cpp) -------------------------------------------------------------------

// Whether two paths lead to one file or directory, and whether a path leads to one of the two
// files.
bool isSamePlace(const char* a, const char* b);
bool isHistoryFile(const historyPlace* place, const char* path);

// What one of the two files shows from outside.
struct fileReport {
    bool present;
    unsigned long long size;
    int rc;              // of reading the header
    SQLUH_HEADER header; // valid if rc is 0
    SQLUH_FILESTATE state;
};
void lookAtFile(const char* path, fileReport* report);

// What the next open will do about the two files, their sizes included.
sqluhRepair repairDue(const fileReport* history, const fileReport* shadow);
sqluhRepair repairDueIn(const historyPlace* place); // looks at both files

// Room for what is read of an entry where its texts do not matter, the time that it tells aside.
struct entryRoom {
    char objectPart[zq3ObjectPartCapacity];
    zq3HistoryData data;
    SQLUH_ENTRY entry;
};
void prepareRoom(entryRoom* room);

// What reading all entries of a file found.
struct entriesReport {
    int rc;           // 0, or what ended the reading early
    long long offset; // of the entry that could not be read, or of the end
    uint32_t count;
    uint32_t maxTablespaces;
    uint32_t maxCommandLength;
    char newest[timestampWidth + 1]; // largest timestamp of 14 digits; empty: none
    long long newestAt;              // offset of its last entry
    uint32_t lastNumber;             // of the last entry
    uint32_t digest;                 // equal for equal entries
};

// Counts one more entry, which begins at report->offset.
void addToReport(entriesReport* report, const SQLUH_ENTRY* entry);

// Reads all entries of an open file, those after its header. progress: null, or what a progress bar
// on the terminal is titled with when it takes long.
void readAllEntries(SQLO_FHANDLE file, SQLUH_WORKAREA* workArea, const char* progress,
                    entriesReport* report);

// Makes the header say of the entries what was found.
void setTotals(SQLUH_HEADER* header, const entriesReport* totals);
