// Every scenario stopped at every change that it makes on the disk, and failed at every call.
#include "directory/fixture.h"

#include <cstdio>
#include <sys/wait.h>

// Just before each call, just after it, and in the middle of a write at several lengths.
static std::vector<stopPoint> stopsOf(const std::vector<diskOp>& log)
{
    std::vector<stopPoint> stops;
    for (size_t i = 0; i < log.size(); i++) {
        std::set<size_t> cuts = {0, SIZE_MAX};
        const size_t length = log[i].bytes.size();
        for (size_t cut : {size_t{1}, size_t{200}, size_t{512}, size_t{1024}, length - 1})
            if (cut < length)
                cuts.insert(cut);
        for (size_t cut : cuts)
            stops.push_back({static_cast<int>(i), cut});
    }
    return stops;
}

class StopTest : public DirectoryTest
{
  protected:
    unsigned int first = 0, second = 0, parts = 0, bad = 0;
    int unreachable = 0;

    // A real process ends at the stop and leaves its lock set, which is found and removed.
    Files stateBehind(const scenario& s, stopPoint stop)
    {
        store(filesOf(s.before));
        const pid_t child = fork();
        if (child == 0)
            _exit(watch([&] { return run(s); }, stop, true));
        EXPECT_EQ(stoppedStatus, WEXITSTATUS(waitFor(child))) << s.action + " on " + s.before;
        SQLO_NLCK lock = {};
        const SQLO_NLCKSTATE state = lockState(&lock);
        if (state.state == sqloNLCKStale) {
            EXPECT_EQ(child, state.pid);
            EXPECT_EQ(sqloNLCKOwnerDied, openAndClose());
            EXPECT_EQ(0, sqloNLCKRemoveDead(&lock, &state));
        }
        unreachable += removeSetsOf(child);
        first++;
        return load();
    }

    // The state is opened, which is stopped; then opened again.
    void check(const scenario& s, const Files& state, stopPoint stop)
    {
        store(state);
        if (stop.call >= 0)
            watch([this] { return openAndClose(); }, stop);
        const std::string fault = faultOf(s.outcomes);
        const bool isPart = !fault.empty() && isPartOfRestore(s);
        parts += isPart;
        bad += !fault.empty() && !isPart;
        EXPECT_TRUE(fault.empty() || isPart)
            << s.action << " on " << s.before << ", second stop at call " << stop.call << " cut at "
            << stop.cut << ": " << fault;
    }
};

TEST_F(StopTest, EveryStopLeavesTheOldOrTheNewHistory)
{
    for (const scenario& s : scenarios) {
        store(filesOf(s.before));
        watch([&] { return run(s); });
        std::set<Files> states;
        const std::vector<stopPoint> firstStops = stopsOf(disk.log);
        for (size_t i = 0; i < firstStops.size(); i += (slowdown + 2) / 3)
            states.insert(stateBehind(s, firstStops[i]));
        for (const Files& state : states) {
            store(state);
            watch([this] { return openAndClose(); });
            const std::vector<stopPoint> stops = stopsOf(disk.log);
            check(s, state, {});
            for (const stopPoint& stop : stops)
                if (second++ % slowdown == 0)
                    check(s, state, stop);
        }
    }
    printf("%u first stops, %u second stops, %u bad; %u opens took a part of a restored image, "
           "%d lock sets no longer under the history's key\n",
           first, second / slowdown, bad, parts, unreachable);
    EXPECT_GT(first, 900u / slowdown);
    EXPECT_GT(parts, 0u);
}

// --- Failures ------------------------------------------------------------------------------------

class FailureTest : public DirectoryTest
{
  protected:
    std::string failed, failedPhase; // the call that failed, and where
    int code = 0;                    // what it returned
    bool examining = false;          // nothing had been changed or compared before it

    int runFailing(const scenario& s, int failAt, bool full)
    {
        int calls = 0;
        store(filesOf(s.before));
        failed.clear();
        examining = true;
        onCall = [&](const std::string& call, int) {
            const bool writes = call == "sqlowrite" || call == "sqlocopy" || call == "sqlosync";
            if (failed.empty() && (writes || call == "ossFileGetInfoV9" || call == "sqlomove"))
                examining = false;
            if (call.starts_with("sem") || calls++ != failAt)
                return 0;
            failed = call;
            failedPhase = phase;
            const bool allocates = call == "sqlogmblkEx" || call == "sqloMemBlockReallocate";
            code = writes && full ? int{DISK_FULL} : sqloSystemError | (allocates ? ENOMEM : EIO);
            return code;
        };
        const int rc = run(s);
        onCall = nullptr;
        return rc;
    }

    // What may come back: the call's own code, the code for a repair that failed, no key where the
    // file for it could not be made, and success where the failure only takes a shortcut away or a
    // file out of the examination.
    bool isDocumented(int rc)
    {
        static const std::set<std::string> fatal = {"sqlowrite", "sqlocopy", "sqlosync",
                                                    "sqlodelete", "sqlochgfileptr"};
        if (rc == code || (failedPhase == "commit" && failed != "sqlogmblkEx"))
            return rc == code;
        return rc == HISTORY_FILE_DAMAGED || (rc >= 0 && !fatal.contains(failed)) ||
               (failed == "sqloopenp" && rc == sqloNLCKKeyFailure);
    }

    static size_t openDescriptors()
    {
        const std::filesystem::directory_iterator list("/proc/self/fd");
        return static_cast<size_t>(std::distance(begin(list), end(list)));
    }
};

TEST_F(FailureTest, EveryFailureIsReportedAndLeavesTheOldOrTheNewHistory)
{
    unsigned int tried = 0, survived = 0, givenUp = 0;
    for (size_t i = 0; i < 2 * scenarios.size(); i += slowdown == 1 ? 1 : 2) {
        const scenario& s = scenarios[i / 2];
        for (int k = 0;; k++) {
            const size_t descriptors = openDescriptors();
            const int rc = runFailing(s, k, i % 2 == 0);
            if (failed.empty())
                break;
            tried++;
            survived += rc >= 0;
            const std::string what = s.action + " on " + s.before + ", " + failed +
                                     " failing as call " + std::to_string(k) + ", returns " +
                                     std::to_string(rc);
            EXPECT_TRUE(isDocumented(rc)) << what;
            EXPECT_EQ(descriptors, openDescriptors()) << what;
            EXPECT_EQ(0, removeSetsOf(getpid())) << what;
            const bool isDone = rc == 0 && failedPhase == "commit";
            const std::string fault =
                faultOf({isDone ? s.outcomes.back() : s.outcomes[0], s.outcomes.back()});
            // A file that cannot be opened or read just then counts as unusable, and the other one
            // is taken even where it is the worse.
            if (!fault.empty() && rc >= 0 && examining && s.before != " 10/ 10")
                givenUp++;
            else
                EXPECT_TRUE(fault.empty() || isPartOfRestore(s)) << what << ": " << fault;
        }
    }
    printf("%u failures tried, %u without effect on the code, %u made the open give up the better "
           "file\n",
           tried, survived, givenUp);
    EXPECT_GT(tried, 1500u);
}
