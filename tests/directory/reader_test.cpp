// The reader of the committed history beside writers that are stopped anywhere, and the other way
// round.
#include "directory/fixture.h"

#include <csignal>
#include <ctime>
#include <dlfcn.h>
#include <linux/magic.h>
#include <sys/vfs.h>
#include <sys/wait.h>

// What the clock that stamps files is made to say beside the truth; whether time runs; and the file
// system that there seems to be.
static time_t clockAhead;
static time_t impatience;
static decltype(statfs::f_type) fileSystem;

extern "C" int fstatfs(int fd, struct statfs* system) noexcept
{
    static const auto real =
        reinterpret_cast<int (*)(int, struct statfs*)>(dlsym(RTLD_NEXT, "fstatfs64"));
    const int rc = real(fd, system);
    if (fileSystem != 0)
        system->f_type = fileSystem;
    return rc;
}

extern "C" int clock_gettime(clockid_t id, timespec* time) noexcept
{
    static const auto real =
        reinterpret_cast<int (*)(clockid_t, timespec*)>(dlsym(RTLD_NEXT, "clock_gettime"));
    const int rc = real(id, time);
    if (id == CLOCK_REALTIME_COARSE)
        time->tv_sec += clockAhead;
    static time_t waited;
    if (id == CLOCK_MONOTONIC)
        time->tv_sec += waited = impatience == 0 ? 0 : waited + impatience;
    return rc;
}

class ReaderTest : public DirectoryTest
{
  protected:
    // Which of the samples was read; or what ended its entries.
    static int sampleOf(const SQLUH_COMMITTED* committed)
    {
        zq3HistoryData data = {};
        SQLUH_ENTRY entry = {};
        entry.data = &data;
        for (uint32_t row = committed->numRows; row > 0; row--) {
            sqluhGetCommitted(committed, row - 1, &entry, false);
            EXPECT_EQ(row, data.entryNumber);
        }
        const int number = static_cast<int>(committed->numRows);
        return committed->failure != 0 ? committed->failure
               : data.entryNode == 1   ? number + 20
                                       : number;
    }

    // Which of the samples a read gives, or the read's code.
    int read()
    {
        SQLUH_COMMITTED* committed = nullptr;
        const auto hook = std::exchange(onCall, nullptr);
        const bool watching = std::exchange(disk.watching, false);
        int result = sqluhReadCommitted(directory.c_str(), &committed);
        if (committed != nullptr)
            result = sampleOf(committed);
        sqluhFreeCommitted(&committed);
        disk.watching = watching;
        onCall = hook;
        reads++;
        return result;
    }

    // What a read may give while the scenario is under way: its outcomes, or what it gave before;
    // of files that nobody could use, a refusal, whichever.
    std::set<int> allowed(const scenario& s)
    {
        std::set<int> results(s.outcomes.begin(), s.outcomes.end());
        store(filesOf(s.before));
        if (const int before = read(); before >= 0)
            results.insert(before);
        else
            results.insert({HISTORY_FILE_DAMAGED, HISTORY_FILE_MISSING});
        return results;
    }

    static std::string statesOf(const std::string& path)
    {
        struct stat status;
        return stat(path.c_str(), &status) != 0
                   ? "none"
                   : std::to_string(status.st_ino) + "/" + std::to_string(status.st_size) + "/" +
                         std::to_string(status.st_ctim.tv_sec) + "." +
                         std::to_string(status.st_ctim.tv_nsec);
    }

    // A tick of the clock that stamps files, so that what was written before it looks old.
    static void nextTick()
    {
        const timespec tick = {0, 10000000};
        nanosleep(&tick, nullptr);
    }

    unsigned int reads = 0;
};

// Nothing happens beside these reads, so the clock need not be waited for.
TEST_F(ReaderTest, EveryStopOfAWriterShowsTheStateBeforeOrAfter)
{
    clockAhead = 3600;
    std::set<Files> seen;
    for (const scenario& s : scenarios) {
        const std::set<int> results = allowed(s);
        store(filesOf(s.before));
        watch([&] { return run(s); });
        const std::vector<diskOp> whole = disk.log;
        for (size_t i = 0; i < whole.size(); i++)
            for (size_t cut : {size_t{0}, size_t{1}, size_t{200}, size_t{1024}, SIZE_MAX}) {
                if (cut != 0 && cut != SIZE_MAX && cut >= whole[i].bytes.size())
                    continue;
                store(filesOf(s.before));
                watch([&] { return run(s); }, {static_cast<int>(i), cut});
                removeSetsLeft();
                if (!seen.insert(load()).second)
                    continue;
                const Files before = load();
                const std::string states = statesOf(historyPath) + statesOf(shadowPath);
                const int result = read();
                EXPECT_TRUE(results.contains(result))
                    << s.action << " on " << s.before << " stopped at " << i << " + " << cut << ", "
                    << momentOf(whole, i) << ": " << result;
                EXPECT_TRUE(before == load());
                EXPECT_EQ(states, statesOf(historyPath) + statesOf(shadowPath));
                EXPECT_EQ(0, removeSetsLeft());
            }
    }
    clockAhead = 0;
    printf("%u reads of %zu states\n", reads, seen.size());
    EXPECT_GT(seen.size(), 200u);
}

// A writer runs through while the reader stands before one of its calls.
TEST_F(ReaderTest, AWriterThatRunsThroughAReadCostsAtMostARetry)
{
    const std::vector<scenario> writers = {
        {"commit 1", " 10/ 10", "", {10, 11}}, {"commit 6", " 10/ 10", "", {10, 16}},
        {"abandon 1", " 10/ 10", "", {10}},    {"restore", " 10/ 10", "", {10, 30}},
        {"copy", " 10/ 10", "", {10, 30}},     {"open", "C12/ 10", "", {12}},
        {"open", "P10+900/ 10", "", {10}},     {"open", "junk/C12", "", {12}},
        {"open", " 10/-", "", {10}},
    };
    unsigned int stops = 0;
    for (const scenario& s : writers)
        for (int stop = 0, calls = 1; stop < calls; stop += static_cast<int>(slowdown)) {
            store(filesOf(s.before));
            nextTick();
            SQLUH_COMMITTED* committed = nullptr;
            calls = 0;
            onCall = [&](const std::string&, int) {
                if (calls++ == stop) {
                    const auto hook = std::exchange(onCall, nullptr);
                    EXPECT_GE(run(s), 0);
                    onCall = hook;
                }
                return 0;
            };
            const int rc = sqluhReadCommitted(directory.c_str(), &committed);
            onCall = nullptr;
            ASSERT_GE(rc, 0) << s.action << " on " << s.before << " at call " << stop;
            const int sample = sampleOf(committed);
            EXPECT_TRUE(std::ranges::count(s.outcomes, static_cast<unsigned int>(sample)) != 0)
                << s.action << " on " << s.before << " at call " << stop << ": " << sample;
            sqluhFreeCommitted(&committed);
            EXPECT_EQ(0, removeSetsLeft());
            stops++;
        }
    printf("a writer ran at %u stops of a reader\n", stops);
    EXPECT_GT(stops, 150u / slowdown);
}

// What may have hidden a write: how often the files are read then, and whether under the lock.
static const struct {
    const char* what;
    const char* files;
    int sample;
    time_t ahead, aheadLater; // the clock, before and from the first entry on
    time_t age;               // of the files in whole seconds
    bool torn;                // the first read meets half a header
    decltype(statfs::f_type) fileSystem;
    unsigned int reads;
    bool locked;
} doubts[] = {
    {"nothing", "C12/ 10", 12, 0, 0, 0, false, 0, 1, false},
    {"clock set forward", "C12/ 10", 12, 0, 3600, 0, false, 0, 2, false},
    {"clock set back", "C12/ 10", 12, 0, -3600, 0, false, 0, 2, false},
    {"clock set back before", "C12/ 10", 12, 0, 0, -3600, false, 0, 1, false},
    {"written in this tick", " 10/C12", 10, -3600, 0, 0, false, 0, 2, false},
    {"whole seconds, just written", "C12/ 10", 12, 0, 0, 1, false, 0, 5, true},
    {"whole seconds", "C12/ 10", 12, 0, 0, 4, false, 0, 1, false},
    {"a write under way", "P12/ 10", 10, 0, 0, 4, true, 0, 2, false},
    {"network", "C12/ 10", 12, 0, 0, 0, false, NFS_SUPER_MAGIC, 2, true},
    {"user space", "P12/ 10", 10, 0, 0, 4, false, FUSE_SUPER_MAGIC, 2, true},
};

TEST_F(ReaderTest, WhatCannotBeProvenIsReadAgainOrUnderTheLock)
{
    for (const auto& row : doubts) {
        const Files files = filesOf(row.files);
        store(files);
        nextTick();
        clockAhead = row.ahead;
        changeTime = row.age != 0 ? time(nullptr) - row.age : 0;
        fileSystem = row.fileSystem;
        unsigned int opens = 0, sets = 0;
        onCall = [&](const std::string& call, int command) {
            opens += call == "sqloopenp";
            sets += call == "semget" && (command & IPC_CREAT) != 0;
            clockAhead = call == "sqloseek" ? row.aheadLater : clockAhead;
            if (row.torn && opens > 1)
                spill(shadowPath,
                      (opens == 2 ? "x" : "") + files.at(SQLUH_SHADOW_NAME).substr(opens == 2));
            return 0;
        };
        SQLUH_COMMITTED* committed = nullptr;
        EXPECT_GE(sqluhReadCommitted(directory.c_str(), &committed), 0) << row.what;
        onCall = nullptr;
        clockAhead = fileSystem = changeTime = 0;
        EXPECT_EQ(row.sample, sampleOf(committed)) << row.what;
        sqluhFreeCommitted(&committed);
        EXPECT_EQ(row.reads, opens / 2) << row.what;
        EXPECT_EQ(row.locked, sets == 1) << row.what;
        EXPECT_EQ(0, removeSetsLeft()) << row.what;
    }
}

// --- Several processes ---------------------------------------------------------------------------

// Runs in a process of its own, which ends with 0 when it returns true.
template <typename use> static pid_t inAProcess(use run)
{
    const pid_t child = fork();
    if (child == 0)
        _exit(run() ? 0 : 1);
    return child;
}

TEST_F(ReaderTest, BesideBusyWritersEveryReadGivesWholeBatches)
{
    enum { numWriters = 3, numBatches = 1500 / static_cast<int>(slowdown) };
    store(filesOf(" 9/ 9"));
    std::vector<pid_t> writers;
    for (int i = 0; i < numWriters; i++)
        writers.push_back(inAProcess([&] {
            for (int k = 0; k < numBatches; k++)
                if (batch(3) != 0)
                    return false;
            return true;
        }));
    unsigned int rows = 9, whileWriting = 0;
    for (size_t ended = 0; ended < writers.size(); whileWriting++) {
        SQLUH_COMMITTED* committed = nullptr;
        ASSERT_GE(sqluhReadCommitted(directory.c_str(), &committed), 0);
        EXPECT_EQ(0, committed->failure);
        EXPECT_EQ(0u, committed->numRows % 3);
        EXPECT_GE(committed->numRows, rows);
        rows = committed->numRows;
        sqluhFreeCommitted(&committed);
        int status = 0;
        while (waitpid(-1, &status, WNOHANG) > 0) {
            EXPECT_EQ(0, status);
            ended++;
        }
    }
    printf("%u reads beside %d writers of %d batches\n", whileWriting, numWriters, numBatches);
    EXPECT_EQ(9 + numWriters * numBatches * 3, read());
}

// Where only the lock helps: that of the living is waited for, for some seconds; that of the dead
// keeps writers out.
TEST_F(ReaderTest, SomebodyElsesLockIsLeftAsItIs)
{
    store(filesOf(" 10/ 10"));
    const pid_t holder = inAProcess([&] {
        SQLUH_HANDLE* handle = nullptr;
        return sqluhBeginBatch(&handle, directory.data()) == 0 && ::pause() == 0;
    });
    while (lockState().state != sqloNLCKHeld)
        nextTick();
    fileSystem = NFS_SUPER_MAGIC;
    impatience = 1;
    EXPECT_EQ(sqloNLCKBusy, read());
    impatience = 0;
    const SQLO_NLCKSTATE held = lockState();
    EXPECT_EQ(sqloNLCKHeld, held.state);
    kill(holder, SIGKILL);
    waitpid(holder, nullptr, 0);
    EXPECT_EQ(10, read());
    fileSystem = 0;
    const SQLO_NLCKSTATE stale = lockState();
    EXPECT_EQ(sqloNLCKStale, stale.state);
    EXPECT_EQ(held.id, stale.id);
    EXPECT_EQ(held.pid, stale.pid);
}
