// zq3hist restore and load, stopped at each of their OS-services calls.
#include <dlfcn.h>
#include <sys/wait.h>

#include "admin/zq3hist.h"
#include "tests/support.h"

static int callsLeft = -1; // the process ends before the call that finds 0 here; -1: never

template <typename Function> static Function next(const char* name)
{
    if (callsLeft >= 0 && callsLeft-- == 0)
        _exit(42);
    return reinterpret_cast<Function>(dlsym(RTLD_NEXT, name));
}

// Half of what a write or a copy does is done before the process ends.
extern "C" int sqlowrite(SQLO_FHANDLE fh, const void* buffer, uint32_t count, uint32_t* written)
{
    bool stop = callsLeft == 0;
    callsLeft = stop ? -1 : callsLeft;
    int rc = next<decltype(&sqlowrite)>("sqlowrite")(fh, buffer, stop ? count / 2 : count, written);
    if (stop)
        _exit(42);
    return rc;
}
extern "C" int sqlocopy(const char* source, const char* target, unsigned int options)
{
    if (callsLeft == 0)
        spill(target, "");
    return next<decltype(&sqlocopy)>("sqlocopy")(source, target, options);
}
extern "C" int sqlosync(SQLO_FHANDLE fh)
{
    return next<decltype(&sqlosync)>("sqlosync")(fh);
}
extern "C" int sqloclose(SQLO_FHANDLE fh)
{
    return next<decltype(&sqloclose)>("sqloclose")(fh);
}

class StopTest : public HistoryTest
{
  protected:
    int run(int (*subcommand)(int, char**), std::string file, int stopAt)
    {
        fflush(stdout);
        pid_t child = fork();
        if (child == 0) {
            char name[] = "subcommand";
            char* argv[] = {name, directory.data(), file.data(), nullptr};
            if (freopen("/dev/null", "w", stdout) == nullptr)
                _exit(99);
            callsLeft = stopAt;
            _exit(subcommand(3, argv));
        }
        int status = 0;
        waitpid(child, &status, 0);
        removeLockSet(historyPath);
        return WEXITSTATUS(status);
    }

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
};

// The old history and the new one are equally long: sizes alone would not tell them apart.
TEST_F(StopTest, WhatIsLeftIsTheOldHistoryOrTheNewOne)
{
    spill(root + "old", "Operation: backup\nTimestamp: 20250101000000\nTablespace: A\n");
    spill(root + "new", "Operation: backup\nTimestamp: 20250202000000\nTablespace: B\n");
    spill(root + "broken", "Operation: backup\nTimestamp: 2025\n");
    ASSERT_EQ(0, run(loadMain, root + "new", -1));
    ASSERT_EQ(0, run(backupMain, root + "image", -1));
    std::string newEntries = entriesAfterOpen();
    std::filesystem::remove(historyPath), std::filesystem::remove(shadowPath);
    ASSERT_EQ(0, run(loadMain, root + "old", -1));
    std::string oldEntries = entriesAfterOpen(), history = slurp(historyPath),
                shadow = slurp(shadowPath);
    ASSERT_EQ(oldEntries.size(), newEntries.size());

    const struct {
        int (*subcommand)(int, char**);
        const char* file;
        std::string after;
    } rows[] = {{restoreMain, "image", newEntries}, {loadMain, "new", ""}};
    for (const auto& row : rows) {
        int stops = 0, status = 42, changed = 0;
        for (; status == 42; stops++) {
            spill(historyPath, history);
            spill(shadowPath, shadow);
            status = run(row.subcommand, root + row.file, stops);
            std::string entries = entriesAfterOpen();
            bool isNew = row.after.empty() ? entries.size() == 2 * oldEntries.size() &&
                                                 entries.starts_with(oldEntries)
                                           : entries == row.after;
            EXPECT_TRUE(isNew || (entries == oldEntries && changed == 0)) << stops;
            changed += isNew;
        }
        EXPECT_EQ(0, status);
        EXPECT_GT(stops, 12);
        EXPECT_GT(changed, 1);
        printf("%s: stopped at %d calls\n", row.file, stops - 1);
    }
}
