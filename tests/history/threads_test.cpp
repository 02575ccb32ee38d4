// Handles in several threads at once, in a program that has set a locale.

#include <clocale>
#include <thread>

#include "support.h"

class Threads : public HistoryTest
{
};

// Runs batches in the directory. Returns the first code that is not 0.
static int runBatches(std::string directory, int count)
{
    int rc = 0;
    entryBuilder builder;
    builder.objectPart = "20260101010000001";
    builder.tablespaces = {"USERS", "CATALOG"};
    builder.withSqlca = true;
    for (int i = 0; rc >= 0 && i < count; i++) {
        SQLUH_HANDLE* handle = nullptr;
        rc = sqluhBeginBatch(&handle, directory.data());
        if (rc == 0)
            rc = sqloseek(handle->fileHandle, 0, sqloFromEnd, nullptr);
        if (rc == 0)
            rc = sqluhWriteEntry(handle, builder.build());
        if (handle != nullptr)
            handle->header.entryCount++;
        int ended = sqluhEndBatch(&handle, sqluhCommit);
        rc = rc != 0 ? rc : ended;
    }
    return rc;
}

TEST_F(Threads, WriteTheSameBytesInAnyLocaleAndLeaveItAlone)
{
    enum { numThreads = 4, numBatches = 40 };
    ASSERT_EQ(0, runBatches(directory, numBatches));
    const std::string expected = slurp(historyPath);
    ASSERT_NE(nullptr, setlocale(LC_ALL, "C.UTF-8"));
    int codes[numThreads];
    std::vector<std::thread> threads;
    const auto place = [&](int i) { return root + "T" + std::to_string(i) + "/"; };
    for (int i = 0; i < numThreads; i++) {
        std::filesystem::create_directory(place(i));
        threads.emplace_back([&, i] { codes[i] = runBatches(place(i), numBatches); });
    }
    for (std::thread& thread : threads)
        thread.join();
    for (int i = 0; i < numThreads; i++) {
        EXPECT_EQ(0, codes[i]) << i;
        EXPECT_TRUE(expected == slurp(place(i) + SQLUH_HISTORY_NAME)) << i;
    }
    EXPECT_STREQ("C.UTF-8", setlocale(LC_CTYPE, nullptr));
    setlocale(LC_ALL, "C");
}
