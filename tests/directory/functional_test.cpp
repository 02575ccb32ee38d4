// What every scenario ends in, and the cases that the exhaustive tests cannot see.
#include "directory/fixture.h"

using FunctionalTest = DirectoryTest;

TEST_F(FunctionalTest, EveryScenarioEndsInTheStatedFiles)
{
    const std::vector<std::string> sizesDiffer = {
        "File size 0 (0x00000000) 8904 8903",
        "Warning History files are not indentical.  Recovering shadow history file / from main "
        "history file."};
    setenv("ZQ3DIAGLOG", logPath.c_str(), 1);
    for (const scenario& s : scenarios) {
        SCOPED_TRACE(s.action + " on " + s.before);
        const Files before = filesOf(s.before), after = filesOf(s.after);
        // A check without repair changes nothing; only the file that the lock's key needs may come.
        store(before);
        EXPECT_EQ(after.size() == 2, sqluhCheckIfHistoryFilesAreUseable(directory.data()));
        const std::string touched = s.before[0] == '-' ? "empty" : s.before.substr(0, 1);
        EXPECT_TRUE(load() == filesOf(touched + s.before.substr(1)));
        store(before);
        takeLog();
        EXPECT_EQ(s.action == "fatal" ? 2160 : 0, watch([&] { return run(s); }));
        EXPECT_EQ(before == after, disk.log.empty());
        EXPECT_TRUE(load() == after);
        const std::vector<std::string> log = takeLog();
        EXPECT_EQ(s.before == " 10/ 10-1", log == sizesDiffer);
        EXPECT_TRUE(log.empty() || s.before != " 10/ 10");
    }
}

// Access mode 4 reads, all others write.
TEST_F(FunctionalTest, CloseGoesOnPastFailuresAndReturnsTheFirst)
{
    const int close = sqloSystemError | EIO, copy = DISK_FULL, unlock = sqloSystemError | EPERM;
    const int first[] = {0, close, copy, close, unlock, close, copy, close};
    for (unsigned int fails = 0; fails < 8; fails++) {
        store(filesOf(" 10/ 10"));
        SQLUH_HANDLE* handle = nullptr;
        ASSERT_EQ(0, sqluhOpen(&handle, directory.data(), fails));
        EXPECT_EQ(fails == 4 ? sqloSystemError | EBADF : 0,
                  sqluhWriteHeader(handle->fileHandle, &handle->header));
        store(filesOf(" 10/ 1"));
        handle->restoredFromImage = true;
        onCall = [&](const std::string& call, int) {
            const bool copies = call == "sqlocopy" && (fails & 2),
                       locks = call == "semctl" && (fails & 4);
            return call == "sqloclose" && (fails & 1) ? close : copies ? copy : locks ? EPERM : 0;
        };
        EXPECT_EQ(first[fails], sqluhClose(&handle));
        onCall = nullptr;
        EXPECT_EQ(nullptr, handle);
        EXPECT_TRUE(load() == filesOf((fails & 2) ? " 10/ 1" : " 10/ 10"));
        EXPECT_EQ((fails & 4) != 0, removeSetsOf(getpid()) == 1);
    }
}

// --- Batches -------------------------------------------------------------------------------------

TEST_F(FunctionalTest, FewWritesAreReplayedManyAreCopied)
{
    const struct {
        unsigned int entries, writes;
        bool counted;        // the caller raises the header's count with each write
        const char* failing; // OS-services call that fails
        bool copied, disabled;
    } rows[] = {{10, 0, false, "", false, false}, {1, 0, false, "", true, false},
                {10, 4, false, "", false, false}, {10, 5, false, "", true, false},
                {10, 6, false, "", true, true},   {16, 13, true, "", false, false},
                {10, 11, true, "", true, true},   {16, 12, true, "sqloMem", true, true}};
    for (const auto& row : rows) {
        SCOPED_TRACE(testing::Message() << row.entries << " " << row.writes);
        const std::string word = std::string(" ").append(std::to_string(row.entries));
        store(filesOf(word + "/" + word));
        int copies = 0;
        onCall = [&](const std::string& call, int) {
            copies += call == "sqlocopy";
            return *row.failing != 0 && call.starts_with(row.failing) ? -1 : 0;
        };
        SQLUH_HANDLE* handle = nullptr;
        ASSERT_EQ(0, sqluhBeginBatch(&handle, directory.data()));
        for (unsigned int i = 0; i < row.writes; i++) {
            ASSERT_EQ(0, append(handle, 1));
            handle->header.entryCount -= !row.counted;
        }
        EXPECT_EQ(row.disabled, handle->replayArea.replayDisabled != 0);
        EXPECT_EQ(0, sqluhEndBatch(&handle, sqluhCommit));
        onCall = nullptr;
        EXPECT_EQ(row.copied, copies == 1);
        const std::string history = slurp(historyPath), shadow = slurp(shadowPath);
        EXPECT_EQ(1024 + 788 * (row.entries + row.writes), history.size());
        EXPECT_TRUE(settledForm(history) == settledForm(shadow));
        EXPECT_EQ(row.writes == 0 && !row.copied ? ' ' : 'C', shadow[132]);
    }
}

// The first write is replayed from its copy and before the others, which come from what the history
// file then holds.
TEST_F(FunctionalTest, ReplayRepeatsTheWritesInOrder)
{
    store(filesOf(" 10/ 10"));
    SQLUH_HANDLE* handle = nullptr;
    ASSERT_EQ(0, sqluhBeginBatch(&handle, directory.data()));
    const size_t end = slurp(historyPath).size();
    ASSERT_EQ(0, append(handle, 1));
    std::filesystem::resize_file(historyPath, end + 100); // the next one overlaps it
    ASSERT_EQ(0, append(handle, 1));
    std::string tampered = slurp(historyPath), expected = tampered;
    tampered[end + 50] = '#';
    expected[end + 700] = tampered[end + 700] = '#';
    spill(historyPath, tampered);
    ASSERT_EQ(0, sqluhEndBatch(&handle, sqluhCommit));
    EXPECT_TRUE(slurp(shadowPath).substr(1024) == expected.substr(1024));
}

// --- Utilities -----------------------------------------------------------------------------------

// Behind the record the sqlca, the array, and from there on the texts, all of them one block.
TEST_F(FunctionalTest, HistoryDataIsOneBlockInOrder)
{
    const uint32_t capacities[] = {19, 19, 18, 15, 13, 13, 25, 31, 129, 256, 31, 101};
    zq3HistoryData* data = nullptr;
    ASSERT_EQ(0, sqluhAllocateHistoryData(&data, nullptr, 2, true, 100));
    EXPECT_EQ(2u, data->maxTablespaces);
    EXPECT_EQ(static_cast<void*>(data + 1), data->eventSqlca);
    EXPECT_EQ(static_cast<void*>(data->eventSqlca + 1), data->tablespaceBuffers);
    char* at = reinterpret_cast<char*>(data->tablespaceBuffers + 2);
    for (int i = 0; i < 12; i++) {
        const textBuffer* texts[] = {data->tablespaceBuffers + i, &data->objectPart + i - 2,
                                     &data->commandText};
        const textBuffer& text = *texts[(i >= 2) + (i == 11)];
        EXPECT_EQ(at, text.data);
        EXPECT_EQ(capacities[i], text.capacity);
        memset(at, 1, capacities[i]);
        at += capacities[i];
    }
    sqluhFreeHistoryData(&data);
    sqluhFreeHistoryData(&data);
    EXPECT_EQ(sqloSystemError | ENOMEM,
              sqluhAllocateHistoryData(&data, nullptr, 0, true, UINT32_MAX));
    EXPECT_EQ(nullptr, data);
}

TEST_F(FunctionalTest, CopyAndEmptinessOfADirectory)
{
    const struct {
        const char *before, *copy;
        int copyCode, emptyCode;
        bool isEmpty;
    } rows[] = {{"C12/ 10", " 12", 0, 0, false},
                {"junk/junk", "", 2160, 0, true},
                {"junk/P0", " 0", 0, 0, true},
                {"-/ 10", " 10", 0, -2036, false}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.before);
        const Files before = filesOf(row.before);
        store(before);
        bool isEmpty = !row.isEmpty;
        EXPECT_EQ(row.emptyCode, sqluhIsHistoryFileEmpty(directory.data(), &isEmpty));
        EXPECT_EQ(row.isEmpty, isEmpty);
        EXPECT_TRUE(row.emptyCode == 0 || load() == before);
        store(before);
        spill(root + SQLUH_HISTORY_NAME, "");
        EXPECT_EQ(row.copyCode, sqluhCopyHistoryFile(directory.data(), root.data()));
        EXPECT_TRUE(slurp(root + SQLUH_HISTORY_NAME) == fileOf(row.copy));
        EXPECT_EQ(0, removeSetsOf(getpid()));
    }
}

TEST_F(FunctionalTest, WarningCarriesTheErrorAsItsToken)
{
    sqlca ca = {};
    ca.sqlcode = -2161;
    sqluh_build_warning(&ca);
    EXPECT_EQ(2172, ca.sqlcode);
    EXPECT_EQ("-2161", std::string(ca.sqlerrmc, static_cast<size_t>(ca.sqlerrml)));
}
