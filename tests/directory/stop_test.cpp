// Every scenario stopped at every change that it makes on the disk, then read and opened; and
// failed at every call.
#include "directory/fixture.h"

static const unsigned int stopShare = takesAll ? 1 : 4 * slowdown;

class StopTest : public DirectoryTest
{
  protected:
    // Of the run just watched: before each call, after it, and in a write at several lengths.
    static std::vector<stopPoint> stops()
    {
        std::vector<stopPoint> all;
        for (size_t i = 0; i < disk.log.size(); i++) {
            const size_t length = disk.log[i].bytes.size();
            for (const size_t cut : std::set<size_t>{0, 1, 200, 512, 1024, length - 1, SIZE_MAX})
                if (cut == 0 || cut == SIZE_MAX || cut < length)
                    all.push_back({static_cast<int>(i), cut});
        }
        return all;
    }

    // What a stop of the scenario may leave, with the moment of one stop that leaves it.
    std::map<Files, std::string> statesAfterStops(const scenario& s)
    {
        std::map<Files, std::string> states;
        // A read may give what it gave before, too; of what nobody could use, a refusal, whichever.
        std::set<int> readable(s.outcomes.begin(), s.outcomes.end());
        store(filesOf(s.before));
        const int before = readCommitted();
        readable.insert(before);
        if (before < 0)
            readable.insert({HISTORY_FILE_DAMAGED, HISTORY_FILE_MISSING});
        watch([&] { return run(s); });
        const std::vector<diskOp> whole = disk.log;
        for (const stopPoint& stop : stops()) {
            store(filesOf(s.before));
            watch([&] { return run(s); }, stop);
            EXPECT_TRUE(disk.stopped);
            removeSetsLeft();
            if (states.try_emplace(load(), stopInWords(whole, stop)).second)
                readOnly(readable);
            first++;
        }
        return states;
    }

    // Reads, which changes nothing. Nothing happens beside, so the clock need not be waited for.
    void readOnly(const std::set<int>& allowed)
    {
        const auto stampOf = [](const std::string& path) {
            struct stat status = {};
            stat(path.c_str(), &status);
            const timespec& time = status.st_ctim;
            return std::tuple(status.st_ino, status.st_size, time.tv_sec, time.tv_nsec);
        };
        const auto before = std::tuple(load(), stampOf(historyPath), stampOf(shadowPath));
        clockAhead = 3600;
        const int result = readCommitted();
        clockAhead = 0;
        EXPECT_TRUE(allowed.contains(result)) << result;
        EXPECT_TRUE(before == std::tuple(load(), stampOf(historyPath), stampOf(shadowPath)));
        EXPECT_EQ(0, removeSetsLeft());
        reads++;
    }

    static std::string stopInWords(const std::vector<diskOp>& log, const stopPoint& stop)
    {
        const bool all = stop.cut == SIZE_MAX;
        return "stopped " + momentOf(log, static_cast<size_t>(stop.call) + all) +
               (all ? "" : ", " + std::to_string(stop.cut) + " bytes on");
    }

    // Opens the state; opens it and stops the open, everywhere, and opens what that leaves.
    void openAndStopTheOpen(const Files& state, const std::vector<unsigned int>& outcomes)
    {
        const auto open = [this] { return openAndClose(); };
        store(state);
        watch(open);
        const std::vector<diskOp> whole = disk.log;
        const std::vector<stopPoint> all = stops();
        EXPECT_EQ("", faultOf(outcomes));
        // Nothing that was replaced comes back.
        const unsigned int settled = idOf(slurp(historyPath));
        EXPECT_EQ(0, batch(1, sqluhAbandon));
        EXPECT_EQ("", faultOf({settled}));
        for (const stopPoint& stop : all)
            if (second++ % stopShare == 0) {
                store(state);
                watch(open, stop);
                EXPECT_EQ("", faultOf(outcomes)) << "its open " << stopInWords(whole, stop);
            }
    }

    unsigned int first = 0, second = 0, reads = 0; // stops made; the second ones in an open
};

TEST_F(StopTest, EveryStopLeavesTheOldOrTheNewHistory)
{
    for (const scenario& s : scenarios) {
        SCOPED_TRACE(s.action + " on " + s.before);
        for (const auto& [state, moment] : statesAfterStops(s)) {
            SCOPED_TRACE(moment);
            openAndStopTheOpen(state, s.outcomes);
        }
    }
    printf("%u first stops, %u reads, %u second stops\n", first, reads, second / stopShare);
    EXPECT_GT(first, 900u);
}

// --- Failures ------------------------------------------------------------------------------------

class FailureTest : public DirectoryTest
{
  protected:
    std::string failed;    // the first call that failed
    int code = 0;          // what it returned
    bool inCommit = false; // between begin and end of a batch
    unsigned int tried = 0;

    // What may come back: the call's own code, the code for a repair that failed, no key where the
    // file for it could not be made, and success where the failure only takes a shortcut away or a
    // file out of the examination.
    bool isDocumented(int rc)
    {
        static const std::set<std::string> fatal = {"sqlowrite", "sqlocopy", "sqlosync",
                                                    "sqlodelete", "sqlochgfileptr"};
        if (rc == code || (inCommit && failed != "sqlogmblkEx"))
            return rc == code;
        return rc == HISTORY_FILE_DAMAGED || (rc >= 0 && !fatal.contains(failed)) ||
               (failed == "sqloopenp" && rc == sqloNLCKKeyFailure);
    }

    static long openDescriptors()
    {
        return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
    }

    // The histories that the files hold whole and committed, under their own names.
    static std::vector<unsigned int> committed(const Files& files)
    {
        std::vector<unsigned int> ids;
        for (const char* name : {SQLUH_HISTORY_NAME, SQLUH_SHADOW_NAME}) {
            const auto file = files.find(name);
            if (file != files.end() && known.contains(file->second) &&
                (file->second[132] != 'P' || file->first == SQLUH_SHADOW_NAME))
                ids.push_back(known[file->second]);
        }
        return ids;
    }

    // Fails each call in turn, once or from it on, until none is left.
    void failEach(const scenario& s, int error, bool lasts, bool system)
    {
        std::vector<unsigned int> allowed = committed(filesOf(s.before));
        const bool hasCopy = !allowed.empty();
        allowed.insert(allowed.end(), s.outcomes.begin(), s.outcomes.end());
        const long descriptors = openDescriptors();
        for (int k = takesAll ? 0 : error % 4;;
             k += takesAll ? 1 : static_cast<int>(4 * slowdown)) {
            int calls = 0;
            const auto isDue = [&](const std::string& call) {
                const int number = calls++;
                if (number == k) {
                    failed = call;
                    inCommit = inBatch;
                }
                return number == k || (number > k && lasts);
            };
            store(filesOf(s.before));
            failed.clear();
            onSystemCall = [&](const std::string& call) {
                return system && isDue(call) ? error : 0;
            };
            onCall = [&](const std::string& call, int) {
                if (system || call.starts_with("sem") || !isDue(call))
                    return 0;
                const bool stores = call == "sqlowrite" || call == "sqlocopy" || call == "sqlosync";
                code = stores && error == ENOSPC ? int{DISK_FULL} : sqloSystemError | error;
                return code;
            };
            const int rc = run(s);
            onCall = nullptr;
            onSystemCall = nullptr;
            if (failed.empty())
                break;
            SCOPED_TRACE(testing::Message()
                         << s.action << " on " << s.before << ", " << failed << " failing as call "
                         << k << " with " << error << (lasts ? " from there on" : "") << " returns "
                         << rc);
            tried++;
            EXPECT_EQ(0, removeSetsLeft());
            EXPECT_TRUE(system || lasts || isDocumented(rc));
            EXPECT_TRUE(!hasCopy || !committed(load()).empty());
            const unsigned int last = s.outcomes.back();
            const bool done = rc == 0 && (inCommit || disk.replacing);
            EXPECT_EQ("", faultOf(done ? std::vector{last} : allowed));
        }
        EXPECT_EQ(descriptors, openDescriptors());
    }

    void failAll(bool system, unsigned int atLeast)
    {
        for (const scenario& s : scenarios)
            for (const int error : {EIO, ENOSPC, EMFILE, ENOMEM, EACCES})
                for (const bool lasts : {false, true})
                    failEach(s, error, lasts, system);
        printf("%u failures of %s tried\n", tried, system ? "system calls" : "services");
        EXPECT_GT(tried, atLeast / slowdown);
    }
};

TEST_F(FailureTest, EveryFailureIsReportedAndLeavesTheOldOrTheNewHistory)
{
    failAll(false, 1000);
}

// The same one layer deeper.
TEST_F(FailureTest, EverySystemCallMayFailOnceOrFromThenOn)
{
    unsetenv("ZQ3SYNC");
    failAll(true, 3000);
}
