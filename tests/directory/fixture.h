// What the tests of a whole directory share: the calls that they stand in front of, a directory's
// files as values, batches, the scenarios that are stopped, failed and cut off from power, and the
// check that a directory is sound again.
#pragma once

#include <algorithm>
#include <climits>
#include <functional>
#include <map>
#include <set>
#include <sstream>

#include <dlfcn.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include "sqo/sqlzkrcb.h"
#include "support.h"

// Asked before each OS-services call (with 0) and each semaphore call (with its flags, its step or
// its command): the code that it shall fail with instead, a semaphore call's an errno; or 0. An
// open that returns a warning is made. A transfer that fails has moved some bytes, a write else
// half of them; with onlyShort that is all that is wrong.
inline std::function<int(const std::string& call, int command)> onCall;
inline int64_t movedByFailure = -1; // bytes; -1: as it comes
constexpr int onlyShort = INT_MIN;

// The same for each system call under the files, asked with its name and sizes: an errno, or 0.
inline std::function<int(const std::string& call)> onSystemCall;
inline size_t longestWrite = SIZE_MAX; // of more bytes only so many are written

inline void failCall(const std::string& name, int command, int error)
{
    onCall = [=](const std::string& call, int given) {
        return call == name && given == command ? error : 0;
    };
}

inline void failSystemCall(const std::string& name, int error)
{
    onSystemCall = [=](const std::string& call) { return call.starts_with(name) ? error : 0; };
}

// The function that a hook of that name stands in front of.
template <typename function> static function realOf(function, const char* name)
{
    return reinterpret_cast<function>(dlsym(RTLD_NEXT, name));
}

// What the system is made to tell as every file's change time, in whole seconds; 0: the truth.
inline time_t changeTime;
// What the clock that stamps files is made to say beside the truth.
inline time_t clockAhead;
// Whether time runs for who waits, and the file system that there seems to be.
inline time_t impatience;
inline long fileSystem;

enum diskKind {
    diskWrite,
    diskTruncate,
    diskMode, // the mark of an incomplete file
    diskCreate,
    diskUnlink,
    diskRename,
    diskSync,
    diskNames
};

// A system call that changed a file or a name, or made such changes durable.
struct diskOp {
    diskKind kind;
    ino_t inode = 0;
    size_t at = 0; // offset of a write, length after a truncation, mark, of a sync: mode too
    std::string bytes = {};   // of a write
    std::string name = {};    // of the file
    std::string newName = {}; // of a renamed file
    std::string barrier = {}; // of a sync, or of a write that waits, too; docs/architecture.md says
                              // what each is for
};

// At which call of the log, and how many bytes of a write still happen; of another call: nothing
// with 0, else all.
struct stopPoint {
    int call = -1;
    size_t cut = 0;
};

// The moment after the first calls of a log, in words.
inline std::string momentOf(const std::vector<diskOp>& log, size_t calls)
{
    const char* kinds[] = {"write",    "truncation", "marking", "creation",
                           "deletion", "renaming",   "sync",    "D"};
    const auto isBarrier = [](const diskOp& op) { return !op.barrier.empty(); };
    const auto here = log.begin() + static_cast<ptrdiff_t>(calls);
    const auto next = std::find_if(here, log.end(), isBarrier);
    std::string moment = "before all";
    if (calls != 0)
        moment = std::string("after the ") + kinds[here[-1].kind] + " of " + here[-1].name +
                 " at " + std::to_string(here[-1].at);
    return moment + ", " + (next == log.end() ? "no barrier to come" : "before " + next->barrier);
}

// While watching, such calls are logged. After the stop the disk refuses every change: it keeps
// what a process that ends there leaves.
struct diskControl {
    bool watching;
    stopPoint stop;
    bool stopped;
    std::vector<diskOp> log;
    bool replacing; // syncs that the library asks for belong to no batch
};
inline diskControl disk;
inline std::string without; // a safeguard that the hooks take out

// The exhaustive tests take all there is; without, a part that is soon done.
inline const bool takesAll = getenv("ZQ3_ALL_STATES") != nullptr;

#if defined(__SANITIZE_ADDRESS__)
constexpr unsigned int slowdown = 10;
#else
constexpr unsigned int slowdown = 1;
#endif

// Runs in a process of its own, which ends with what it returns.
template <typename use> static pid_t inChild(use run)
{
    const pid_t child = fork();
    if (child == 0)
        _exit(run());
    return child;
}

// The status that the process ended with.
inline int waitFor(pid_t child)
{
    int status = -1;
    waitpid(child, &status, 0);
    return status;
}

// A directory's files by name; "*" after the name of one that is marked as incomplete.
using Files = std::map<std::string, std::string>;

// One use of the directory: its files before and after by words (see DirectoryTest::fileOf). At
// every moment the history has one of these numbers of entries; the last one when all was done.
struct scenario {
    std::string action; // "open", "fatal" (an open that must start anew), "create", "restore"
                        // or "copy" (of the last outcome), or with the number of writes
                        // "commit" or "abandon"
    std::string before, after; // history, shadow and, after, the files moved aside
    std::vector<unsigned int> outcomes;
};
// clang-format off
inline const std::vector<scenario> scenarios = {
    {"commit 1", " 10/ 10", " 11/C11", {10, 11}},  {"commit 2", " 10/ 10", " 12/C12", {10, 12}},
    {"commit 3", " 10/ 10", " 13/C13", {10, 13}},  {"commit 4", " 10/ 10", " 14/C14", {10, 14}},
    {"commit 5", " 10/ 10", " 15/C15", {10, 15}},  {"commit 6", " 10/ 10", " 16/C16", {10, 16}},
    {"commit 1", " 1/ 1", " 2/C2", {1, 2}},        {"commit 2", " 1/ 1", " 3/C3", {1, 3}},
    {"commit 1", "-/-", " 1/C1/empty", {0, 1}},    {"abandon 0", " 10/ 10", "P10/ 10", {10}},
    {"abandon 1", " 10/ 10", "P10+788/ 10", {10}}, {"restore", " 10/ 10", " 12/ 12", {10, 12}},
    {"restore", " 10/ 10", " 30/ 30", {10, 30}},   {"restore", " 10/P10", " 1/ 1", {10, 1}},
    {"restore", "-/-", " 12/ 12/empty", {0, 12}},  {"create", "-/-", " 0/ 0", {0}},
    {"copy", " 10/ 10", " 12/-", {10, 12}},        {"copy", " 10/ 10", " 30/-", {10, 30}},
    {"copy", "C12/ 10", " 30/-", {12, 30}},        {"copy", "P12/C10", " 30/-", {10, 30}},
    {"copy", " 10/junk", " 30/-", {10, 30}},       {"copy", "-/-", " 12/-", {0, 12}},
    {"copy", " 10/ 9", " 30/-", {10, 30}},
    {"open", " 10/ 10", " 10/ 10", {10}},          {"open", " 10/C10", " 10/C10", {10}},
    {"open", " 10/-", " 10/ 10", {10}},            {"open", " 10/junk", " 10/ 10", {10}},
    {"open", " 10/P10", " 10/ 10", {10}},          {"open", " 10/Q12", " 10/ 10", {10}},
    {"open", " 10/ 10-1", " 10/ 10", {10}},        {"open", "C12/ 10", " 12/C12", {12}},
    {"open", "C12/C12", " 12/C12", {12}},          {"open", "C12/C12-876", " 12/C12", {12}},
    {"open", "C12/P10", " 12/C12", {12}},          {"open", "C12/-", " 12/C12", {12}},
    {"open", "C12/junk", " 12/C12", {12}},         {"open", "P10+900/ 10", " 10/P10", {10}},
    {"open", "P12/C10", " 10/P10", {10}},          {"open", "P12/P10", " 10/P10", {10}},
    {"open", "Q12/ 10", " 10/P10", {10}},          {"open", "junk/C12", " 12/P12", {12}},
    {"open", "empty/P10", " 10/P10", {10}},        {"open", "-/ 10", " 10/P10", {10}},
    {"fatal", "-/-", " 0/ 0/empty", {0}},          {"fatal", "junk/Q10", " 0/ 0/junk/Q10", {0}},
    {"fatal", "P10/-", " 0/ 0/P10", {0}},          {"fatal", "-/junk", " 0/ 0/empty/junk", {0}},
};
// clang-format on

class DirectoryTest : public HistoryTest
{
  protected:
    // Sound history files by the number of their entries; 30 to 32: of 10 to 12, the first ten by
    // another writer. And whose these and the same with other status letters are.
    inline static std::map<unsigned int, std::string> samples;
    inline static std::map<std::string, unsigned int> known;
    uint16_t writer = 0;  // node number of the entries that append writes
    bool inBatch = false; // between begin and end of a batch
    SQLO_NLCK lock = {};  // as lockState filled it
    SQLUH_HANDLE* mine = nullptr;
    std::string sourceDirectory = root + "SOURCE/";

    DirectoryTest()
    {
        // Keys hold 16 bits of the inode number, and these tests make many files: test programs
        // that run side by side take different node numbers, which are in the key, too.
        sqlz_krcbp->nodeNumber = static_cast<int16_t>(getpid() % 240);
        setenv("ZQ3DIAGLOG", "/dev/null", 1);
        onCall = nullptr;
        onSystemCall = nullptr;
        disk = {};
        without.clear();
        std::filesystem::create_directory(sourceDirectory);
        for (unsigned int i = static_cast<unsigned int>(samples.size()); i <= 32; i++) {
            writer = i > 17 && i <= 30;
            EXPECT_EQ(0, i == 0 || i == 20 ? sqluhCreate(directory.data()) : batch(1));
            samples[i] = slurp(historyPath);
            EXPECT_EQ(1024 + 788 * (i < 20 ? i : i - 20), samples[i].size());
            for (const char status : {' ', 'C', 'P'})
                known.try_emplace(fileOf(status + std::to_string(i)), i);
        }
        writer = 0;
        store({});
    }

    // --- Files as values -------------------------------------------------------------------------

    Files load()
    {
        Files files;
        for (const auto& file : std::filesystem::directory_iterator(directory))
            files[file.path().filename().string() + (isMarked(file.path()) ? "*" : "")] =
                slurp(file.path());
        return files;
    }

    // Files that exist keep their inodes, so that a directory has few lock keys over its life.
    void store(const Files& files)
    {
        using namespace std::filesystem;
        for (const auto& file : directory_iterator(directory)) {
            const std::string name = file.path().filename();
            if (!files.contains(name) && !files.contains(name + "*"))
                remove(file.path());
        }
        for (const auto& [name, bytes] : files) {
            const std::string path = directory + name.substr(0, name.find('*'));
            spill(path, bytes);
            if (isMarked(path) != name.ends_with('*'))
                permissions(path, perms::sticky_bit,
                            isMarked(path) ? perm_options::remove : perm_options::add);
        }
    }

    static bool isMarked(const std::string& path)
    {
        struct stat status;
        return stat(path.c_str(), &status) == 0 && (status.st_mode & S_ISVTX) != 0;
    }

    // "C12": a history of 12 entries with status C; "C12-876": the same without its last 876 bytes;
    // "P10+900": with 900 bytes of the entries that would come next; "-": no file.
    std::string fileOf(const std::string& word)
    {
        char status = 0;
        unsigned int entries = 0;
        int more = 0;
        if (sscanf(word.c_str(), "%c%u%d", &status, &entries, &more) < 2)
            return word == "junk" ? std::string(3000, 'x') : "";
        std::string path = root + "word";
        spill(path, samples.at(entries));
        EXPECT_EQ(0, sqluhUpdateHeaderStatus(path.data(), status));
        const size_t length = samples.at(entries).size();
        return (slurp(path) + samples.at(entries + 2 * (more > 0)).substr(length))
            .substr(0, length + static_cast<size_t>(more));
    }

    Files filesOf(const std::string& words)
    {
        const char* names[] = {SQLUH_HISTORY_NAME, SQLUH_SHADOW_NAME, SQLUH_SAVED_HISTORY_NAME,
                               SQLUH_SAVED_SHADOW_NAME};
        Files files;
        std::istringstream list(words);
        std::string word;
        for (size_t i = 0; std::getline(list, word, '/'); i++)
            if (word != "-")
                files[names[i]] = fileOf(word);
        return files;
    }

    // The image without what settles by itself: its status letter, and the checksum with it.
    static std::string settledForm(std::string image)
    {
        constexpr size_t checksumWidth = 8, statusAt = 132;
        if (image.size() < headerLength)
            return image;
        image[statusAt] = '-';
        return image.substr(checksumWidth);
    }

    static unsigned int idOf(const std::string& image)
    {
        const auto found = known.find(image);
        return found == known.end() ? 999 : found->second;
    }

    // --- Uses of a directory ---------------------------------------------------------------------

    // Appends entries numbered on from the header's count, and keeps that count.
    int append(SQLUH_HANDLE* handle, unsigned int entries)
    {
        int rc = sqloseek(handle->fileHandle, 0, sqloFromEnd, nullptr);
        for (unsigned int i = 0; rc == 0 && i < entries; i++) {
            entryBuilder builder;
            builder.data.entryNumber = handle->header.entryCount + 1;
            builder.data.entryNode = writer;
            builder.note = "entry " + std::to_string(builder.data.entryNumber);
            builder.tablespaces = {"USERDATA01"};
            rc = sqluhWriteEntry(handle, builder.build());
            handle->header.entryCount += rc == 0;
        }
        return rc;
    }

    int batch(unsigned int entries, unsigned int flags = sqluhCommit)
    {
        SQLUH_HANDLE* handle = nullptr;
        int rc = sqluhBeginBatch(&handle, directory.data());
        EXPECT_EQ(rc != 0, handle == nullptr);
        inBatch = rc == 0;
        if (inBatch)
            rc = append(handle, entries);
        // A batch that could not be written is given up.
        const int ended = sqluhEndBatch(&handle, rc == 0 ? flags : unsigned{sqluhAbandon});
        EXPECT_EQ(nullptr, handle);
        inBatch = false;
        return rc != 0 ? rc : ended;
    }

    int openAndClose()
    {
        SQLUH_HANDLE* handle = nullptr;
        const int rc = sqluhOpen(&handle, directory.data(), SQLUH_OPEN_READ);
        EXPECT_EQ(rc < 0, handle == nullptr);
        const int closed = sqluhClose(&handle);
        return rc < 0 ? rc : closed != 0 ? closed : rc;
    }

    // Puts the image in the history's place, piece by piece.
    static int restore(SQLUH_HANDLE* handle, std::string image)
    {
        int rc = 0;
        auto* bytes = reinterpret_cast<unsigned char*>(image.data());
        const unsigned int size = static_cast<unsigned int>(image.size()), length = 2500;
        for (unsigned int at = 0; rc == 0 && at < size; at += length)
            rc = sqluh_write_restore_buffer(handle, at, bytes + at, std::min(length, size - at));
        return rc;
    }

    int run(const scenario& s)
    {
        disk.replacing = s.action == "restore" || s.action == "copy";
        if (s.action == "open" || s.action == "fatal")
            return openAndClose();
        if (s.action == "create")
            return sqluhCreate(directory.data());
        const std::string& image = samples.at(s.outcomes.back());
        if (s.action == "copy") {
            spill(sourceDirectory + SQLUH_HISTORY_NAME, image);
            spill(sourceDirectory + SQLUH_SHADOW_NAME, image);
            return sqluhCopyHistoryFile(sourceDirectory.data(), directory.data());
        }
        if (!disk.replacing)
            return batch(static_cast<unsigned int>(s.action.back() - '0'),
                         s.action[0] == 'c' ? sqluhCommit : sqluhAbandon);
        SQLUH_HANDLE* handle = nullptr;
        int rc = sqluhOpen(&handle, directory.data(), SQLUH_OPEN_UPDATE);
        if (rc >= 0)
            rc = restore(handle, image);
        const int closed = sqluhClose(&handle);
        return rc != 0 ? rc : closed;
    }

    // Which of the samples a read of the committed history gives, or its code.
    int readCommitted()
    {
        SQLUH_COMMITTED* committed = nullptr;
        const int rc = sqluhReadCommitted(directory.c_str(), &committed);
        if (rc < 0)
            return rc;
        zq3HistoryData data = {};
        SQLUH_ENTRY entry = {};
        entry.data = &data;
        for (uint32_t row = committed->numRows; row > 0; row--) {
            sqluhGetCommitted(committed, row - 1, &entry, false);
            EXPECT_EQ(row, data.entryNumber);
        }
        const int number = static_cast<int>(committed->numRows) + (data.entryNode == 1 ? 20 : 0);
        const int result = committed->failure != 0 ? committed->failure : number;
        sqluhFreeCommitted(&committed);
        EXPECT_EQ(nullptr, committed);
        return result;
    }

    // Runs with the disk watched and, where told, stopped. What was done is in disk.log.
    template <typename use> int watch(use run, stopPoint stop = {})
    {
        disk = {true, stop, false, {}, false};
        const int rc = run();
        disk.watching = false;
        return rc;
    }

    // --- Checks ----------------------------------------------------------------------------------

    // Opens the directory twice; then both files are, byte for byte, one of these histories, the
    // history file without a status and not locked. An empty text, or what is wrong.
    std::string faultOf(const std::vector<unsigned int>& outcomes)
    {
        for (int i = 0; i < 2; i++)
            if (const int rc = openAndClose(); rc < 0)
                return "open returns " + std::to_string(rc);
        const std::string history = slurp(historyPath);
        const unsigned int id = idOf(history);
        if (std::ranges::count(outcomes, id) == 0)
            return "neither old nor new: " + std::to_string(history.size()) + " bytes";
        if (idOf(slurp(shadowPath)) != id)
            return "the files differ";
        return history != samples[id] || !lockKeyIsFree(historyPath) ? "not blank, or locked" : "";
    }

    // What sqloNLCKQuery says about the history's lock.
    SQLO_NLCKSTATE lockState()
    {
        SQLO_NLCKSTATE state = {};
        if (sqloNLCKInit(historyPath.c_str(), &lock, sqloNLCKUseNodeNumber) == 0) {
            EXPECT_EQ(0, sqloNLCKQuery(&lock, &state));
        }
        return state;
    }

    // Removes the lock sets that this process has left, under whatever key.
    static int removeSetsLeft()
    {
        struct seminfo info;
        struct semid_ds set;
        int removed = 0;
        for (int index = semctl(0, 0, SEM_INFO, &info); index >= 0; index--) {
            const int id = semctl(index, 0, SEM_STAT, &set);
            if (id >= 0 && semctl(id, 0, GETPID) == getpid())
                removed += semctl(id, 0, IPC_RMID) == 0;
        }
        return removed;
    }
};
