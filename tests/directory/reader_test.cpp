// The reader of the committed history beside writers.
#include "directory/fixture.h"

#include <ctime>
#include <linux/magic.h>
#include <sys/vfs.h>

extern "C" int fstatfs(int fd, struct statfs* system) noexcept
{
    static const auto real = realOf(&fstatfs, "fstatfs64");
    const int rc = real(fd, system);
    if (fileSystem != 0)
        system->f_type = static_cast<decltype(system->f_type)>(fileSystem);
    return rc;
}

extern "C" int clock_gettime(clockid_t id, timespec* time) noexcept
{
    static const auto real = realOf(&clock_gettime, "clock_gettime");
    static time_t waited;
    const int rc = real(id, time);
    if (id == CLOCK_REALTIME_COARSE)
        time->tv_sec += clockAhead;
    if (id == CLOCK_MONOTONIC)
        time->tv_sec += waited = impatience == 0 ? 0 : waited + impatience;
    return rc;
}

using ReaderTest = DirectoryTest;

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
            usleep(10000); // a tick of the clock that stamps files: they look old
            calls = 0;
            onCall = [&](const std::string&, int) {
                if (calls++ == stop) {
                    const auto hook = std::exchange(onCall, nullptr);
                    EXPECT_GE(run(s), 0);
                    onCall = hook;
                }
                return 0;
            };
            const int result = readCommitted();
            onCall = nullptr;
            EXPECT_EQ(1, std::ranges::count(s.outcomes, static_cast<unsigned int>(result)))
                << s.action << " on " << s.before << " at call " << stop << ": " << result;
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
    long fileSystem;
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
        usleep(10000);
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
        EXPECT_EQ(row.sample, readCommitted()) << row.what;
        onCall = nullptr;
        clockAhead = fileSystem = changeTime = 0;
        EXPECT_EQ(row.reads, opens / 2) << row.what;
        EXPECT_EQ(row.locked, sets == 1) << row.what;
        EXPECT_EQ(0, removeSetsLeft()) << row.what;
    }
}

// An entry that is damaged in the history file is another matter in each state of the pair.
TEST_F(ReaderTest, TheShadowHelpsWithADamagedEntryOnlyWhereItHoldsTheSame)
{
    const struct {
        const char* files;
        int result;
    } rows[] = {{" 10/ 10", 10},
                {" 10/C10", 10},
                {" 10/P10", 10},
                {" 10/Q10", HISTORY_FILE_DAMAGED},
                {"C10/ 10", HISTORY_FILE_DAMAGED},
                {"P10/ 10", 10}};
    for (const auto& row : rows) {
        Files files = filesOf(row.files);
        files[SQLUH_HISTORY_NAME][2000] ^= 1;
        store(files);
        EXPECT_EQ(row.result, readCommitted()) << row.files;
    }
}
