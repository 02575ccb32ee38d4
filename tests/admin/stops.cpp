// zq3hist restore and load, stopped wherever they change a file.
#include <dlfcn.h>
#include <sys/wait.h>

#include "admin/zq3hist.h"
#include "tests/support.h"

static int stepsLeft = -1; // the process ends at the step that finds 0 here; -1: never

static void endAtStep()
{
    if (stepsLeft >= 0 && stepsLeft-- == 0)
        _exit(42);
}

// A write is two steps, nothing and half of it done; so is a copy, the target untouched and empty.
extern "C" int sqlowrite(SQLO_FHANDLE fh, const void* buffer, uint32_t count, uint32_t* written)
{
    auto write = reinterpret_cast<decltype(&sqlowrite)>(dlsym(RTLD_NEXT, "sqlowrite"));
    endAtStep();
    int rc = write(fh, buffer, stepsLeft == 0 ? count / 2 : count, written);
    endAtStep();
    return rc;
}

extern "C" int sqlocopy(const char* source, const char* target, unsigned int options)
{
    auto copy = reinterpret_cast<decltype(&sqlocopy)>(dlsym(RTLD_NEXT, "sqlocopy"));
    endAtStep();
    if (stepsLeft == 0)
        spill(target, "");
    endAtStep();
    return copy(source, target, options);
}

class StopTest : public HistoryTest
{
  protected:
    int run(std::string subcommand, std::string file, int stopAt)
    {
        pid_t child = fork();
        if (child == 0) {
            char* argv[] = {nullptr, subcommand.data(), directory.data(), file.data(), nullptr};
            stepsLeft = stopAt;
            _exit(runProgram(4, argv));
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
    spill(root + "old", "Operation: backup\nTimestamp: 20250101000000\nNumber: 1\n");
    spill(root + "new", "Operation: backup\nTimestamp: 20250202000000\nNumber: 1\n");
    ASSERT_EQ(0, run("load", root + "new", -1));
    ASSERT_EQ(0, run("backup", root + "image", -1));
    std::string newEntries = entriesAfterOpen();
    std::filesystem::remove(historyPath), std::filesystem::remove(shadowPath);
    ASSERT_EQ(0, run("load", root + "old", -1));
    std::string oldEntries = entriesAfterOpen(), history = slurp(historyPath),
                shadow = slurp(shadowPath);
    ASSERT_EQ(oldEntries.size(), newEntries.size());

    const struct {
        const char* subcommand;
        const char* file;
        std::string after;
    } rows[] = {{"restore", "image", newEntries}, {"load", "new", oldEntries + newEntries}};
    for (const auto& row : rows) {
        int stops = 0, status = 42, changed = 0;
        for (; status == 42; stops++) {
            spill(historyPath, history);
            spill(shadowPath, shadow);
            status = run(row.subcommand, root + row.file, stops);
            std::string entries = entriesAfterOpen();
            EXPECT_TRUE(entries == row.after || (entries == oldEntries && changed == 0)) << stops;
            changed += entries == row.after;
        }
        EXPECT_EQ(0, status);
        EXPECT_GT(changed, 1);
        printf("%s: stopped at %d steps\n", row.file, stops - 1);
    }
}
