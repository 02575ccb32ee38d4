// Every scenario stopped at every change that it makes on the disk, and failed at every call.
#include "directory/fixture.h"

class StopTest : public DirectoryTest
{
  protected:
    // Of the run just watched: before each call, after it, and in a write at several lengths.
    static std::vector<stopPoint> stops()
    {
        std::vector<stopPoint> all;
        for (size_t i = 0; i < disk.log.size(); i++) {
            const size_t length = disk.log[i].bytes.size();
            std::set<size_t> cuts = {0, SIZE_MAX};
            for (size_t cut : {size_t{1}, size_t{200}, size_t{512}, size_t{1024}, length - 1})
                if (cut < length)
                    cuts.insert(cut);
            for (size_t cut : cuts)
                all.push_back({static_cast<int>(i), cut});
        }
        return all;
    }

    // What a stop of the scenario may leave, with the moment of one stop that leaves it.
    std::map<Files, std::string> statesAfterStops(const scenario& s)
    {
        std::map<Files, std::string> states;
        store(filesOf(s.before));
        watch([&] { return run(s); });
        const std::vector<diskOp> whole = disk.log;
        const std::vector<stopPoint> all = stops();
        for (size_t i = 0; i < all.size(); i += (slowdown + 2) / 3, first++) {
            store(filesOf(s.before));
            watch([&] { return run(s); }, all[i]);
            EXPECT_TRUE(disk.stopped);
            states.try_emplace(load(), stopInWords(whole, all[i]));
        }
        return states;
    }

    static std::string stopInWords(const std::vector<diskOp>& log, const stopPoint& stop)
    {
        const size_t call = static_cast<size_t>(stop.call);
        return "stopped " + momentOf(log, call + (stop.cut == SIZE_MAX)) +
               (stop.cut == 0 || stop.cut == SIZE_MAX
                    ? ""
                    : ", " + std::to_string(stop.cut) + " bytes on");
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
        for (const stopPoint& stop : all)
            if (second++ % slowdown == 0) {
                store(state);
                watch(open, stop);
                EXPECT_EQ("", faultOf(outcomes)) << "its open " << stopInWords(whole, stop);
            }
    }

    unsigned int first = 0, second = 0; // stops made; the second ones in an open
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
    printf("%u first stops, %u second stops; %u opens took a part of a restored image\n", first,
           second / slowdown, parts);
    EXPECT_GT(first, 900u / slowdown);
    EXPECT_GT(parts, 0u);
}

// --- Failures ------------------------------------------------------------------------------------

class FailureTest : public DirectoryTest
{
  protected:
    std::string failed;     // the call that failed
    int code = 0;           // what it returned
    bool inCommit = false;  // between begin and end of a batch
    bool examining = false; // nothing had been changed or compared before it

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
            inCommit = inBatch;
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
        if (rc == code || (inCommit && failed != "sqlogmblkEx"))
            return rc == code;
        return rc == HISTORY_FILE_DAMAGED || (rc >= 0 && !fatal.contains(failed)) ||
               (failed == "sqloopenp" && rc == sqloNLCKKeyFailure);
    }

    static long openDescriptors()
    {
        const std::filesystem::directory_iterator list("/proc/self/fd");
        return std::distance(begin(list), end(list));
    }
};

TEST_F(FailureTest, EveryFailureIsReportedAndLeavesTheOldOrTheNewHistory)
{
    unsigned int tried = 0;
    for (size_t i = 0; i < 2 * scenarios.size(); i += slowdown == 1 ? 1 : 2) {
        const scenario& s = scenarios[i / 2];
        for (int k = 0;; k++) {
            const long descriptors = openDescriptors();
            const int rc = runFailing(s, k, i % 2 == 0);
            if (failed.empty())
                break;
            SCOPED_TRACE(testing::Message() << s.action << " on " << s.before << ", " << failed
                                            << " failing as call " << k << ", returns " << rc);
            tried++;
            EXPECT_TRUE(isDocumented(rc));
            EXPECT_EQ(descriptors, openDescriptors());
            EXPECT_EQ(0, removeSetsLeft());
            const unsigned int last = s.outcomes.back();
            const std::string fault = faultOf({rc == 0 && inCommit ? last : s.outcomes[0], last});
            // A file that cannot be opened or read just then counts as unusable, and the other one
            // is taken even where it is the worse.
            if (rc < 0 || !examining || s.before == " 10/ 10") {
                EXPECT_EQ("", fault);
            }
        }
    }
    printf("%u failures tried\n", tried);
    EXPECT_GT(tried, 1500u);
}
