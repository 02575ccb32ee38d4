// The reader of the committed history beside writers that are stopped anywhere, and the other way
// round.
#include "directory/fixture.h"

#include <csignal>
#include <ctime>
#include <dlfcn.h>
#include <sys/wait.h>

// What the clock that stamps files is made to say beside the truth.
static time_t clockAhead;

extern "C" int clock_gettime(clockid_t id, timespec* time) noexcept
{
    static const auto real =
        reinterpret_cast<int (*)(clockid_t, timespec*)>(dlsym(RTLD_NEXT, "clock_gettime"));
    const int rc = real(id, time);
    if (id == CLOCK_REALTIME_COARSE)
        time->tv_sec += clockAhead;
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
    enum { numWriters = 3, numBatches = 400 / static_cast<int>(slowdown) };
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

TEST_F(ReaderTest, ReadersThatAreEndedLeaveNothing)
{
    Files files = filesOf(" 10/ 10");
    for (auto& [name, bytes] : files)
        for (int i = 0; i < 200; i++)
            bytes += samples[10].substr(headerLength);
    store(files);
    nextTick();
    const std::string states = statesOf(historyPath) + statesOf(shadowPath);
    unsigned int seed = 1;
    for (int i = 0; i < 300; i++) {
        const pid_t reader = inAProcess([&] {
            SQLUH_COMMITTED* committed = nullptr;
            while (sqluhReadCommitted(directory.c_str(), &committed) >= 0)
                sqluhFreeCommitted(&committed);
            return false;
        });
        const timespec time = {0, rand_r(&seed) % 3000 * 1000};
        nanosleep(&time, nullptr);
        const int signals[] = {SIGKILL, SIGINT, SIGPIPE};
        kill(reader, signals[i % 3]);
        int status = 0;
        waitpid(reader, &status, 0);
        EXPECT_TRUE(WIFSIGNALED(status)) << "it ended by itself";
        ASSERT_TRUE(lockKeyIsFree(historyPath)) << "after " << i;
    }
    EXPECT_EQ(states, statesOf(historyPath) + statesOf(shadowPath));
    EXPECT_TRUE(files == load());
}
