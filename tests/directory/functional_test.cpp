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
        const bool isFatal = s.action == "fatal", hasHistory = before.contains(SQLUH_HISTORY_NAME);
        // A check without repair changes nothing; only the file that the lock's key needs may come.
        store(before);
        EXPECT_EQ(s.outcomes[0] != 0, sqluhCheckIfHistoryFilesAreUseable(directory.data()));
        EXPECT_TRUE(load() == filesOf(hasHistory ? s.before : "empty" + s.before.substr(1)));
        store(before);
        takeLog();
        EXPECT_EQ(isFatal ? 2160 : 0, watch([&] { return run(s); }));
        EXPECT_EQ(before == after, disk.log.empty());
        EXPECT_TRUE(load() == after);
        const std::vector<std::string> log = takeLog();
        EXPECT_EQ(s.before == " 10/ 10-1", log == sizesDiffer);
        EXPECT_TRUE(log.empty() || s.before != " 10/ 10");
        if (s.action != "open" && !isFatal)
            continue;
        // Copying the history, or asking whether it is empty, opens the directory, too.
        const std::string copy = root + SQLUH_HISTORY_NAME;
        store(before);
        spill(copy, "");
        EXPECT_EQ(isFatal ? 2160 : 0, sqluhCopyHistoryFile(directory.data(), root.data()));
        EXPECT_TRUE(slurp(copy) == (isFatal ? "" : after.at(SQLUH_HISTORY_NAME)));
        store(before);
        bool isEmpty = !isFatal;
        EXPECT_EQ(hasHistory ? 0 : -2036, sqluhIsHistoryFileEmpty(directory.data(), &isEmpty));
        EXPECT_EQ(isFatal && hasHistory, isEmpty);
        EXPECT_TRUE(load() == (hasHistory ? after : before));
        EXPECT_EQ(0, removeSetsLeft());
    }
}

// Access mode 4 reads, all others write.
TEST_F(FunctionalTest, CloseGoesOnPastFailuresAndReturnsTheFirst)
{
    const int close = sqloSystemError | EIO, copy = DISK_FULL, unlock = sqloSystemError | EPERM;
    const int first[] = {0, close, copy, close, unlock, close, copy, close};
    for (unsigned int fails = 0; fails < 8; fails++) {
        store(filesOf(" 10/ 10"));
        ASSERT_EQ(0, sqluhOpen(&mine, directory.data(), fails));
        EXPECT_EQ(fails == 4 ? sqloSystemError | EBADF : 0,
                  sqluhWriteHeader(mine->fileHandle, &mine->header));
        store(filesOf(" 10/ 1"));
        mine->restoredFromImage = true;
        onCall = [&](const std::string& call, int) {
            return (fails & 1) && call == "sqloclose"  ? close
                   : (fails & 2) && call == "sqlocopy" ? copy
                   : (fails & 4) && call == "semctl"   ? EPERM
                                                       : 0;
        };
        EXPECT_EQ(first[fails], sqluhClose(&mine));
        onCall = nullptr;
        EXPECT_EQ(nullptr, mine);
        EXPECT_TRUE(load() == filesOf((fails & 2) ? " 10/ 1" : " 10/ 10"));
        EXPECT_EQ((fails & 4) != 0, removeSetsLeft() == 1);
    }
}

TEST_F(FunctionalTest, WhatCannotBeMovedAsideIsNotReplaced)
{
    store(filesOf(" 10/ 10"));
    EXPECT_EQ(0, sqluhHandleAllocAndInit(directory.data(), &mine) + sqluhLock(mine));
    failSystemCall("rename", EACCES);
    EXPECT_EQ(sqloSystemError | EACCES, sqluhRecoverFromFatalError(mine));
    onSystemCall = nullptr;
    EXPECT_TRUE(load() == filesOf(" 10/ 10"));
    EXPECT_EQ(0, sqluhUnlock(mine) + openAndClose());
    EXPECT_EQ(0, sqluhRecoverFromFatalError(mine)); // also without the lock
    EXPECT_TRUE(load() == filesOf(" 0/ 0/ 10/ 10"));
    sqluhHandleFree(&mine);
}

TEST_F(FunctionalTest, PathsThatDoNotFitAreRefused)
{
    std::string longest(maxDirectoryLength - 1, 'd'), tooLong = longest + "d/", none = "d";
    bool isEmpty = true;
    longest += '/';
    store(filesOf(" 10/ 10"));
    EXPECT_EQ(0, sqluhHandleAllocAndInit(longest.data(), &mine));
    EXPECT_EQ(longest, mine->directory);
    EXPECT_EQ(longest + SQLUH_HISTORY_NAME, mine->historyPath);
    EXPECT_EQ(longest + SQLUH_SHADOW_NAME, mine->shadowPath);
    EXPECT_EQ(sqluhPathTooLong, sqluhRecoverFromFatalError(mine));
    sqluhHandleFree(&mine);
    EXPECT_EQ(sqluhPathTooLong, sqluhHandleAllocAndInit(tooLong.data(), &mine));
    EXPECT_EQ(nullptr, mine);
    EXPECT_EQ(sqluhPathTooLong, sqluhCopyHistoryFile(directory.data(), tooLong.data()));
    EXPECT_EQ(sqluhPathNoSeparator, sqluhCopyHistoryFile(directory.data(), none.data()));
    EXPECT_EQ(sqluhPathTooLong, sqluhIsHistoryFileEmpty(tooLong.data(), &isEmpty));
    EXPECT_TRUE(!isEmpty && load() == filesOf(" 10/ 10"));
}

// The writes are counted: of w of them on e entries, w < (e + w) / 2 are few. However many they
// are, a batch waits for the disk four times, or five where the whole file is copied, and for its
// name; one without writes, three times.
TEST_F(FunctionalTest, FewWritesAreReplayedManyAreCopied)
{
    const struct {
        unsigned int entries, writes;
        bool copied, disabled;
        int waits;
    } rows[] = {{10, 0, false, false, 3},  {1, 0, true, false, 6},  {10, 8, false, false, 4},
                {10, 9, true, false, 6},   {10, 10, true, true, 6}, {10, 13, true, true, 6},
                {17, 13, false, false, 4}, {17, 12, true, true, 6}}; // 12: no memory to record them
    unsetenv("ZQ3SYNC");
    for (const auto& row : rows) {
        SCOPED_TRACE(testing::Message() << row.entries << " " << row.writes);
        const std::string word = std::string(" ").append(std::to_string(row.entries));
        bool copied = false, disabled = false;
        store(filesOf(word + "/" + word));
        onCall = [&](const std::string& call, int) {
            copied |= call == "sqlocopy";
            return row.writes == 12 && call == "sqloMemBlockReallocate" ? -1 : 0;
        };
        EXPECT_EQ(0, watch([&] {
                      EXPECT_EQ(0, sqluhBeginBatch(&mine, directory.data()));
                      EXPECT_EQ(0, append(mine, row.writes));
                      disabled = mine->replayArea.replayDisabled != 0;
                      return sqluhEndBatch(&mine, sqluhCommit);
                  }));
        onCall = nullptr;
        EXPECT_EQ(row.disabled, disabled);
        EXPECT_EQ(row.waits, std::ranges::count_if(
                                 disk.log, [](const diskOp& op) { return !op.barrier.empty(); }));
        EXPECT_EQ(row.copied, copied);
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
    ASSERT_EQ(0, sqluhBeginBatch(&mine, directory.data()));
    const size_t end = slurp(historyPath).size();
    ASSERT_EQ(0, append(mine, 1));
    std::filesystem::resize_file(historyPath, end + 100); // the next one overlaps it
    ASSERT_EQ(0, append(mine, 1));
    std::string tampered = slurp(historyPath), expected = tampered;
    tampered[end + 50] = '#';
    expected[end + 700] = tampered[end + 700] = '#';
    spill(historyPath, tampered);
    ASSERT_EQ(0, sqluhEndBatch(&mine, sqluhCommit));
    EXPECT_TRUE(slurp(shadowPath).substr(1024) == expected.substr(1024));
}

// --- Utilities -----------------------------------------------------------------------------------

// After the record the sqlca, the array, and from there on the texts, all of them one block.
TEST_F(FunctionalTest, HistoryDataIsOneBlockInOrder)
{
    zq3HistoryData* data = nullptr;
    ASSERT_EQ(0, sqluhAllocateHistoryData(&data, nullptr, 2, true, 100));
    EXPECT_EQ(2u, data->maxTablespaces);
    EXPECT_EQ(static_cast<void*>(data + 1), data->eventSqlca);
    EXPECT_EQ(static_cast<void*>(data->eventSqlca + 1), data->tablespaceBuffers);
    char* at = reinterpret_cast<char*>(data->tablespaceBuffers + 2);
    const textBuffer* text = data->tablespaceBuffers;
    for (const uint32_t capacity :
         {19u, 19u, 18u, 15u, 13u, 13u, 25u, 31u, 129u, 256u, 31u, 101u}) {
        EXPECT_EQ(at, text->data);
        EXPECT_EQ(capacity, text->capacity);
        memset(at, 1, capacity);
        at += capacity;
        text = text == data->tablespaceBuffers + 1 ? &data->objectPart : text + 1;
    }
    sqluhFreeHistoryData(&data);
    sqluhFreeHistoryData(&data);
    EXPECT_EQ(sqloSystemError | ENOMEM,
              sqluhAllocateHistoryData(&data, nullptr, 0, true, UINT32_MAX));
    ASSERT_EQ(0, sqluhAllocateHistoryData(&data, nullptr, 0, false, 100));
    EXPECT_EQ(nullptr, data->tablespaceBuffers);
    EXPECT_EQ(nullptr, data->commandText.data);
    EXPECT_EQ(0u, data->maxTablespaces + data->commandText.capacity);
    sqluhFreeHistoryData(&data);
}

TEST_F(FunctionalTest, BackupTypesAreToldByTheirLetters)
{
    for (const char letter : std::string("IODEFNSi -")) {
        const bool isIncr = letter == 'I' || letter == 'O',
                   isDelta = letter == 'D' || letter == 'E';
        EXPECT_EQ(isIncr, sqluhIsHistEntryIncr(letter)) << letter;
        EXPECT_EQ(isDelta, sqluhIsHistEntryDelta(letter)) << letter;
        EXPECT_EQ(isIncr || isDelta, sqluhIsHistEntryIncrOrDelta(letter)) << letter;
    }
}

// A write of a batch that comes out short without a code for it.
TEST_F(FunctionalTest, ShortWritesAreFailures)
{
    const int entry = sqloSystemError | EIO, header = HISTORY_FILE_DAMAGED;
    const int expected[] = {header, entry, header, header, entry, header, 0};
    for (int k = 0; k < 7; k++) {
        int writes = 0;
        store(filesOf(" 10/ 10"));
        onCall = [&](const std::string& call, int) {
            return call == "sqlowrite" && writes++ == k ? onlyShort : 0;
        };
        EXPECT_EQ(expected[k], batch(1)) << k;
        onCall = nullptr;
        EXPECT_EQ("", faultOf({k < 2 ? 10u : k == 2 ? idOf(slurp(historyPath)) : 11u})) << k;
    }
}

TEST_F(FunctionalTest, ABackupIsReadPieceByPiece)
{
    store(filesOf(" 10/ 10"));
    ASSERT_EQ(0, sqluhOpen(&mine, directory.data(), SQLUH_OPEN_READ));
    std::string image, piece(1000, '?');
    auto* buffer = reinterpret_cast<unsigned char*>(piece.data());
    for (unsigned int at = 0, got = 1; got != 0; at += got) {
        ASSERT_EQ(0, sqluh_fill_backup_buffer(mine, at, 1000, buffer, &got));
        image.append(piece, 0, got);
    }
    EXPECT_TRUE(image == samples.at(10));
    EXPECT_EQ(0, sqluhClose(&mine));
}

TEST_F(FunctionalTest, WarningCarriesTheErrorAsItsToken)
{
    sqlca ca = {};
    ca.sqlcode = -2161;
    sqluh_build_warning(&ca);
    EXPECT_EQ(2172, ca.sqlcode);
    EXPECT_EQ("-2161", std::string(ca.sqlerrmc, static_cast<size_t>(ca.sqlerrml)));
}
