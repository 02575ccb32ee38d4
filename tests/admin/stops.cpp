// What changes a history, stopped wherever it changes a file.
#include <csignal>
#include <dlfcn.h>
#include <sys/wait.h>

#include "admin/zq3hist.h"
#include "tests/support.h"

static int stepsLeft = -1; // what ends the process happens at the step that finds 0; -1: never
static bool bySignal = false;

static void endAtStep()
{
    if (stepsLeft < 0 || stepsLeft-- != 0)
        return;
    if (!bySignal)
        _exit(42);
    raise(SIGTERM);
}

// A write is two steps, nothing and half of it done; so is a copy, the target untouched and empty.
extern "C" int sqlowrite(SQLO_FHANDLE fh, const void* buffer, uint32_t count, uint32_t* written)
{
    auto write = reinterpret_cast<decltype(&sqlowrite)>(dlsym(RTLD_NEXT, "sqlowrite"));
    endAtStep();
    int rc = write(fh, buffer, stepsLeft == 0 && !bySignal ? count / 2 : count, written);
    endAtStep();
    return rc;
}

extern "C" int sqlocopy(const char* source, const char* target, unsigned int options)
{
    auto copy = reinterpret_cast<decltype(&sqlocopy)>(dlsym(RTLD_NEXT, "sqlocopy"));
    endAtStep();
    if (stepsLeft == 0 && !bySignal)
        spill(target, "");
    endAtStep();
    return copy(source, target, options);
}

class StopTest : public HistoryTest
{
  protected:
    // Runs a subcommand; words that begin with a slash follow the scratch directory's name.
    int run(std::vector<std::string> words, int stopAt = -1, bool signalled = false)
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
            freopen((root + "said").c_str(), "w", stdout);
            dup2(STDOUT_FILENO, STDERR_FILENO);
            stepsLeft = stopAt;
            bySignal = signalled;
            int rc = runProgram(static_cast<int>(argv.size()) - 1, argv.data());
            fflush(stdout);
            _exit(rc);
        }
        int status = 0;
        waitpid(child, &status, 0);
        if (!signalled)
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
        int stops = 0, status = 42, changed = 0;
        for (; status == 42; stops++) {
            putPair(row.history, row.shadow);
            status = run(row.words, stops);
            std::string left = slurp(historyPath);
            bool untouched = left == row.history && slurp(shadowPath) == row.shadow;
            std::string entries = untouched ? "" : entriesAfterOpen();
            changed += entries == newEntries;
            EXPECT_TRUE(entries == newEntries || untouched ||
                        (changed == 0 && entries == row.history.substr(headerLength)) ||
                        (changed == 0 && entries == row.shadow.substr(headerLength)))
                << row.name << " stopped at " << stops;
        }
        EXPECT_EQ(0, status) << row.name;
        EXPECT_GT(changed, 1) << row.name;
        printf("%s: stopped at %d steps\n", row.name, stops - 1);
    }
}

// A signal does not leave the lock, and a load that it ends is undone, or it is told that it is
// done.
TEST_F(StopTest, AnInterruptedLoadIsUndoneOrTold)
{
    spill(root + "old", stanzas({"20250101000000", "20250102000000"}));
    ASSERT_EQ(0, run({"load", "/SAMPLE", "/old"}));
    const std::string history = slurp(historyPath), shadow = slurp(shadowPath);
    int undone = 0, done = 0, status = 128 + SIGTERM;
    for (int step = 0; status != 0; step++) {
        putPair(history, shadow);
        status = run({"load", "/SAMPLE", "/old"}, step, true);
        std::string said = slurp(root + "said");
        EXPECT_TRUE(lockKeyIsFree(historyPath)) << step;
        if (slurp(historyPath) == history && slurp(shadowPath) == shadow) {
            EXPECT_EQ("zq3hist: interrupted; nothing was appended, " + directory + "\n", said);
            undone++;
        } else {
            EXPECT_EQ("2 entries appended\n", said) << step;
            EXPECT_EQ(history.size() + 2 * size_t{entryMinLength}, slurp(historyPath).size());
            done += status != 0;
        }
    }
    EXPECT_GT(undone, 1);
    EXPECT_GT(done, 1);
}
