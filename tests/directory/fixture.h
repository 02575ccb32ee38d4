// What the tests of a whole directory share: the calls that they stand in front of, a directory's
// files as values, batches, the scenarios that are stopped, failed and cut off from power, and the
// check that a directory is sound again.
#pragma once

#include <functional>
#include <map>
#include <set>

#include "sqo/sqlzkrcb.h"
#include "support.h"

// Asked before each OS-services call (with 0) and each semaphore call (with its flags, its step or
// its command): the code that it shall fail with instead, a semaphore call's an errno; or 0.
extern std::function<int(const std::string& call, int command)> onCall;

enum diskKind { diskWrite, diskTruncate, diskCreate, diskUnlink, diskRename, diskSync, diskNames };

// A system call that changed a file or a name, or made such changes durable.
struct diskOp {
    diskKind kind;
    ino_t inode = 0;
    size_t at = 0;            // offset of a write, length after a truncation
    std::string bytes = {};   // of a write
    std::string name = {};    // of a file created, deleted or renamed; of a sync: which barrier
    std::string newName = {}; // of a renamed file
};

// At which call of the log, and how many bytes of a write still happen; of another call: nothing
// with 0, else all.
struct stopPoint {
    int call = -1;
    size_t cut = 0;
};

// While watching, such calls are logged. Behind the stop nothing happens any more: the process
// ends, or (exits false) goes on with a disk that refuses every change.
struct diskControl {
    bool watching;
    stopPoint stop;
    bool exits, stopped;
    unsigned int batchSyncs; // sqlosync calls of this batch: numbers the barriers B1 to B4
    std::vector<diskOp> log;
};
extern diskControl disk;
enum : int { stoppedStatus = 77 };

#if defined(__SANITIZE_ADDRESS__)
constexpr unsigned int slowdown = 10;
#else
constexpr unsigned int slowdown = 1;
#endif

// A directory's files by name.
using Files = std::map<std::string, std::string>;

// One use of the directory: its files before and after by words (see DirectoryTest::fileOf). At
// every moment the history has one of these numbers of entries; the last one when all was done.
struct scenario {
    std::string action;        // "open", "fatal" (an open that must start anew), or with the number
                               // of writes "commit", "abandon" or "restore"
    std::string before, after; // history, shadow and, after, the files moved aside
    std::vector<unsigned int> outcomes;
};
extern const std::vector<scenario> scenarios;

class DirectoryTest : public HistoryTest
{
  protected:
    uint16_t writer = 0;    // node number of the entries that append writes
    const char* phase = ""; // of the running scenario: "commit" between begin and end of a batch

    DirectoryTest();

    Files load();
    void store(const Files& files);

    // Sound history files of 0 to 17 entries.
    static std::vector<std::string> samples;

    std::string fileOf(const std::string& word);
    Files filesOf(const std::string& words);

    // The image without what settles by itself: its status letter, and the checksum with it.
    static std::string settledForm(std::string image);

    // Appends entries numbered on from the header's count, and keeps that count.
    int append(SQLUH_HANDLE* handle, unsigned int entries);
    int batch(unsigned int entries, unsigned int flags = sqluhCommit);
    int openAndClose();
    int run(const scenario& s);

    // Runs with the disk watched and, where told, stopped. What was done is in disk.log.
    template <typename use> int watch(use run, stopPoint stop = {}, bool exits = false)
    {
        disk = {true, stop, exits, false, 0, {}};
        const int rc = run();
        disk.watching = false;
        return rc;
    }

    // Opens the directory twice; then both files have one of these numbers of entries, are marked
    // sound and not locked. An empty text, or what is wrong.
    std::string faultOf(const std::vector<unsigned int>& outcomes);

    // A restore replaces the history in place, piece by piece. Stopped between two pieces, it
    // leaves a part of the image from its beginning, or nothing of it.
    bool isPartOfRestore(const scenario& s);

    // What sqloNLCKQuery says about the history's lock.
    SQLO_NLCKSTATE lockState(SQLO_NLCK* lock);

    // Removes the sets that a dead process left, as an administrator would who finds them by pid.
    static int removeSetsOf(pid_t pid);
};

// Waits for a child's end and returns its wait status.
int waitFor(pid_t child);
