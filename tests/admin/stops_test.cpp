// What changes a history, stopped wherever it changes a file.
#include <csignal>

#include "admin/zq3hist.h"
#include "tests/directory/fixture.h"

enum stopKind { killed, signalled, failsOnce, failsOn };

class StopTest : public HistoryTest
{
  protected:
    enum { untouched = 64 }; // added to the status: the step was not reached

    // Prepares the process for a stop. Killed, it leaves the disk as it was before a call that
    // changes a file, or after half of a header; else the step is a write, half of which is done,
    // or a copy.
    static void prepare(int stopAt, stopKind stops, bool* happened)
    {
        if (stops == killed) {
            disk = {true, {stopAt / 2, size_t{stopAt % 2 == 0 ? 0u : 512u}}, false, {}, false};
            return;
        }
        onCall = [=, steps = 0](const std::string& call, int) mutable {
            const int step = call == "sqlowrite" || call == "sqlocopy" ? steps++ : -1;
            if (step != stopAt && !(step > stopAt && stops == failsOn))
                return 0;
            *happened = true;
            if (stops == signalled)
                raise(SIGTERM);
            return stops == signalled ? 0 : int{DISK_FULL};
        };
    }

    // Runs a subcommand; words that begin with a slash follow the scratch directory's name.
    int run(std::vector<std::string> words, int stopAt = -1, stopKind stops = killed)
    {
        std::vector<char*> argv = {words[0].data()};
        for (std::string& word : words) {
            word = word[0] == '/' ? root + word.substr(1) : word;
            argv.push_back(word.data());
        }
        argv.push_back(nullptr);
        fflush(stdout);
        pid_t child = fork();
        if (child == 0) {
            bool happened = stopAt < 0;
            if (freopen((root + "said").c_str(), "w", stdout) == nullptr)
                _exit(98);
            dup2(STDOUT_FILENO, STDERR_FILENO);
            if (stopAt >= 0)
                prepare(stopAt, stops, &happened);
            int rc = runProgram(static_cast<int>(argv.size()) - 1, argv.data());
            fflush(stdout);
            _exit(disk.stopped ? 42 : happened ? rc : untouched + rc);
        }
        int status = 0;
        waitpid(child, &status, 0);
        if (stops == killed)
            removeLockSet(historyPath), removeLockSet(root + "source/" SQLUH_HISTORY_NAME);
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }

    // What the next program to open the history finds.
    std::string entriesAfterOpen()
    {
        SQLUH_HANDLE* handle = nullptr;
        for (int i = 0; i < 2; i++) { // the second settles the shadow's mark
            EXPECT_EQ(0, sqluhOpen(&handle, directory.data(), SQLUH_OPEN_READ));
            EXPECT_EQ(0, sqluhClose(&handle));
        }
        EXPECT_EQ(slurp(historyPath).substr(headerLength), slurp(shadowPath).substr(headerLength));
        return slurp(historyPath).substr(headerLength);
    }

    void putPair(const std::string& history, const std::string& shadow)
    {
        for (const auto& file : std::filesystem::directory_iterator(directory))
            std::filesystem::remove(file);
        spill(historyPath, history);
        spill(shadowPath, shadow);
    }
};

static std::string stanzas(const char* const (&timestamps)[2])
{
    std::string text;
    for (const char* timestamp : timestamps)
        text += std::string("Operation: backup\nTimestamp: ") + timestamp + "\nNumber: 1\n\n";
    return text;
}

// The old history and the new ones are equally long: sizes alone would not tell them apart.
TEST_F(StopTest, WhatIsLeftIsTheOldHistoryOrTheNewOne)
{
    spill(root + "old", stanzas({"20250101000000", "20250102000000"}));
    spill(root + "new", stanzas({"20250201000000", "20250202000000"}));
    std::filesystem::create_directory(root + "source");
    ASSERT_EQ(0, run({"load", "/source", "/new"}));
    ASSERT_EQ(0, run({"backup", "/source", "/image"}));
    ASSERT_EQ(0, run({"load", "/SAMPLE", "/old"}));
    const std::string history = slurp(historyPath), shadow = slurp(shadowPath);
    const std::string image = slurp(root + "image");
    const std::string cut = history.substr(0, size_t{headerLength} + entryMinLength);
    std::string noHeader = history, damaged = history;
    noHeader[10] = damaged[headerLength + 300] = '\xFF';

    const struct {
        const char* name;
        std::vector<std::string> words;
        std::string history, shadow;
    } rows[] = {
        {"restore", {"restore", "/SAMPLE", "/image"}, history, shadow},
        {"restore over a stale shadow", {"restore", "/SAMPLE", "/image"}, history, cut},
        {"restore over a broken header", {"restore", "/SAMPLE", "/image"}, noHeader, shadow},
        {"copy", {"copy", "/source", "/SAMPLE"}, history, shadow},
        {"load", {"load", "/SAMPLE", "/new"}, history, shadow},
        {"prune", {"prune", "/SAMPLE", "--before", "20250102000000"}, history, shadow},
        {"repair of a cut history", {"repair", "/SAMPLE"}, cut, shadow},
        {"repair of an entry", {"repair", "/SAMPLE"}, damaged, shadow},
        {"repair of a header", {"repair", "/SAMPLE"}, noHeader, shadow},
        {"repair of the shadow", {"repair", "/SAMPLE"}, history, damaged},
    };
    for (const auto& row : rows) {
        putPair(row.history, row.shadow);
        ASSERT_EQ(0, run(row.words)) << row.name << slurp(root + "said");
        const std::string newEntries = entriesAfterOpen();
        for (stopKind stops : {killed, failsOnce, failsOn}) {
            int steps = 0, status = 0, changed = 0;
            for (; status < untouched; steps++) {
                putPair(row.history, row.shadow);
                status = run(row.words, steps, stops);
                bool isOld = slurp(historyPath) == row.history && slurp(shadowPath) == row.shadow;
                std::string entries = isOld ? "" : entriesAfterOpen();
                changed += entries == newEntries;
                bool mayBeOld = changed == 0 || stops != killed;
                EXPECT_TRUE(entries == newEntries || isOld ||
                            (mayBeOld && entries == row.history.substr(headerLength)) ||
                            (mayBeOld && entries == row.shadow.substr(headerLength)))
                    << row.name << stops << " stopped at " << steps << slurp(root + "said");
                EXPECT_NE(0, status) << row.name << stops << " stopped at " << steps;
                EXPECT_TRUE(stops == killed || lockKeyIsFree(historyPath));
                for (const auto& file : std::filesystem::directory_iterator(directory))
                    EXPECT_TRUE(stops == killed || file.path().extension() != ".tmp");
            }
            EXPECT_EQ(untouched, status) << row.name;
            EXPECT_GT(changed, 1) << row.name;
            if (stops == killed)
                printf("%s: stopped at %d steps\n", row.name, steps - 1);
        }
    }
}

// A signal leaves neither the lock nor a temporary file, and what it ends is undone, or it is told
// that it is done.
TEST_F(StopTest, WhatIsInterruptedIsUndoneOrTold)
{
    const struct {
        std::vector<std::string> words;
        const char *undone, *told;
        size_t entries;
    } rows[] = {
        {{"load", "/SAMPLE", "/old"}, "appended", "2 entries appended\n", 6},
        {{"restore", "/SAMPLE", "/image"},
         "changed",
         "2 entries restored\nThe old file is kept",
         2},
    };
    spill(root + "old", stanzas({"20250101000000", "20250102000000"}));
    ASSERT_EQ(0, run({"load", "/SAMPLE", "/old"}));
    ASSERT_EQ(0, run({"backup", "/SAMPLE", "/image"}));
    ASSERT_EQ(0, run({"load", "/SAMPLE", "/old"}));
    const std::string history = slurp(historyPath), shadow = slurp(shadowPath);
    for (const auto& row : rows) {
        int undone = 0, done = 0, status = 0;
        for (int step = 0; status < untouched || status > 128; step++) {
            SCOPED_TRACE(row.words[0] + " at " + std::to_string(step));
            putPair(history, shadow);
            status = run(row.words, step, signalled);
            const std::string said = slurp(root + "said");
            EXPECT_TRUE(lockKeyIsFree(historyPath));
            for (const auto& file : std::filesystem::directory_iterator(directory))
                EXPECT_NE(".tmp", file.path().extension());
            const bool isOld = slurp(historyPath) == history && slurp(shadowPath) == shadow;
            undone += isOld;
            done += !isOld && status > 128;
            EXPECT_TRUE(said.starts_with(
                isOld ? std::string("zq3hist: interrupted; nothing was ") + row.undone : row.told))
                << said;
            EXPECT_EQ(headerLength + (isOld ? 4 : row.entries) * entryMinLength,
                      slurp(historyPath).size());
        }
        EXPECT_GT(undone, 0);
        EXPECT_GT(done, 1);
    }
}
