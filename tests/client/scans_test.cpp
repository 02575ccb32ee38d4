// Scans over real history directories.
#include "history/records.h"

namespace fs = std::filesystem;

// The folder of databases, with one history in it.
class ScanTest : public HistoryTest
{
  protected:
    ScanTest()
    {
        setenv("ZQ3DBPATH", root.c_str(), 1);
        store("");
    }

    // Both files with these entries; the header's counts stay 0.
    void store(const std::string& entries)
    {
        spill(historyPath, newHeader() + entries);
        spill(shadowPath, newHeader() + entries);
    }
};

// Of 779 bytes each.
static const std::string threeImages = commandEntry(0, "20250101010000001", {"A"}) +
                                       commandEntry(0, "20250102010000001", {"B"}) +
                                       commandEntry(0, "20250103010000001", {"C"});

struct Scan {
    zq3HistoryOpenStruct request = {};
    sqlca ca = {};
    std::string alias;
    entryReader reader;

    explicit Scan(std::string name = "sample", uint32_t slots = 4)
        : alias(std::move(name)), reader(19, slots)
    {
        request.databaseAlias = alias.data();
        EXPECT_EQ(0, zq3HistoryOpenScan(zq3Version, &request, &ca));
    }
    ~Scan()
    {
        zq3HistoryCloseScan(zq3Version, &request.handle, &ca);
    }
    int get()
    {
        zq3HistoryFetchStruct fetch = {&reader.data, request.handle, 2};
        EXPECT_EQ(0, zq3HistoryGetEntry(zq3Version, &fetch, &ca));
        return ca.sqlcode;
    }
    // All that a get leaves in the record.
    std::string shown()
    {
        std::string text;
        for (int i = 0; i < 10; i++)
            text += reader.texts()[i].data + std::string("/") +
                    std::to_string(reader.texts()[i].length) + " ";
        for (textBuffer& name : reader.tablespaceBuffers)
            text += "[" + std::string(name.data) + "/" + std::to_string(name.length) + "]";
        for (const char* letter = &reader.data.operation; letter <= &reader.data.auxCode; letter++)
            text += *letter == '\0' ? '0' : *letter;
        return text + " n=" + std::to_string(reader.data.numTablespaces) +
               " sqlcode=" + std::to_string(reader.ca.sqlcode);
    }
};

static const std::string nothing =
    "/0 /0 /0 /0 /0 /0 /0 /0 /0 /0 [/0][/0][/0][/0]00000 n=0 sqlcode=0";

TEST_F(ScanTest, OnlyPlainNamesOfHistoriesOpen)
{
    fs::create_directories(root + "S/X");
    fs::create_directory(root + "EMPTY");
    for (const char* name : {"A.B/", "NINELONGS/", "S/", "S/X/"}) {
        fs::create_directory(root + name);
        ASSERT_EQ(0, sqluhCreate((root + name).data()));
    }
    for (const char* alias : {"sample", "SAMPLE", "sAmPlE", "s"})
        EXPECT_EQ(0, Scan(alias).ca.sqlcode) << alias;
    for (const char* alias : {"", "s/x", "./s", "a.b", "sample/", "sample ", "s\n", "nothing",
                              "empty", "ninelongs", "S\xC3\x84"})
        EXPECT_EQ(-2036, Scan(alias).ca.sqlcode) << alias;
    EXPECT_TRUE(fs::is_empty(root + "EMPTY"));
    EXPECT_FALSE(fs::exists(root + "NOTHING"));
}

TEST_F(ScanTest, EntriesAreCountedAndNothingOfOneIsLeftInTheNext)
{
    store(fullEntry() + commandEntry(0, "20250102010000001", {"C"}) + commandEntry(0));
    Scan scan, narrow("sample", 2);
    EXPECT_EQ(3u, scan.request.numRows);
    EXPECT_EQ(3u, scan.request.maxTablespaces);
    EXPECT_TRUE(lockKeyIsFree(historyPath));
    EXPECT_EQ(0, scan.get());
    EXPECT_EQ("20260102030405001/17 20260102030500/14 S0000001.LOG/12 S2.LOG-and-m/12 "
              "20250102030405/14 SCHEMA1/7 T1/2 /backup/one/11 note              /30 "
              "cccccccccccccccccc/511 [CATALOGROOM/11][/0][TS3/3][/0]B  Ax n=3 sqlcode=-1234",
              scan.shown());
    EXPECT_EQ(2165, narrow.get());
    EXPECT_TRUE(narrow.shown().ends_with("[CATALOGROOM/11][/0]B  Ax n=3 sqlcode=-1234"));
    EXPECT_EQ(0, scan.get());
    EXPECT_EQ(
        "20250102010000001/17 /0 /0 /0 /0 /0 /0 /0 /0 /0 [C/1][/0][/0][/0]B  A  n=1 sqlcode=0",
        scan.shown());
    EXPECT_EQ(0, scan.get());
    EXPECT_EQ("/0 /0 /0 /0 /0 /0 /0 /0 /0 /0 [/0][/0][/0][/0]B  A  n=0 sqlcode=0", scan.shown());
    EXPECT_EQ(100, scan.get());
    EXPECT_EQ(nothing, scan.shown());
}

TEST_F(ScanTest, ScansRunSideBySideAndKeepTheHistoryTheyOpened)
{
    store(threeImages);
    Scan first, second;
    EXPECT_EQ(0, first.get());
    spill(historyPath, "");
    for (int code : {0, 0, 0, 100})
        EXPECT_EQ(code, second.get());
    EXPECT_EQ(0, first.get());
    EXPECT_STREQ("20250102010000001", first.reader.data.objectPart.data);
    Scan third;
    EXPECT_EQ(3u, third.request.numRows) << "the emptied history comes back from the shadow";
}

TEST_F(ScanTest, WrongCallsAreRefusedAndTouchNothing)
{
    store(threeImages);
    Scan scan;
    EXPECT_EQ(0, scan.get());
    sqlca ca = {};
    uint16_t closed = scan.request.handle, unknown = static_cast<uint16_t>(closed ^ 0x8000);
    zq3HistoryFetchStruct good = {&scan.reader.data, closed, 2}, noRecord = {nullptr, closed, 2},
                          noScan = {&scan.reader.data, unknown, 2},
                          noAction = {&scan.reader.data, closed, 1};
    zq3HistoryOpenStruct filtered = scan.request, noAlias = {};
    filtered.timestamp = filtered.databaseAlias;
    const std::string before = scan.shown();
    const auto refused = [&](auto* call, unsigned int version, void* record, int sqlcode) {
        EXPECT_NE(0, call(version, record, &ca));
        EXPECT_EQ(sqlcode, ca.sqlcode);
        EXPECT_NE(0, call(version, record, nullptr));
    };
    for (auto* call : {zq3HistoryOpenScan, zq3HistoryGetEntry, zq3HistoryCloseScan}) {
        refused(call, 6010001, &good, -2040);
        refused(call, zq3Version, nullptr, -2041);
    }
    refused(zq3HistoryOpenScan, zq3Version, &noAlias, -2041);
    refused(zq3HistoryOpenScan, zq3Version, &filtered, -2041);
    refused(zq3HistoryGetEntry, zq3Version, &noRecord, -2041);
    refused(zq3HistoryGetEntry, zq3Version, &noAction, -2041);
    refused(zq3HistoryGetEntry, zq3Version, &noScan, -2042);
    refused(zq3HistoryCloseScan, zq3Version, &unknown, -2042);
    EXPECT_EQ(before, scan.shown());
    EXPECT_EQ(0, scan.get());
    EXPECT_EQ(0, zq3HistoryCloseScan(zq3Version, &closed, &ca));
    Scan next; // may take the slot, not the handle
    refused(zq3HistoryCloseScan, zq3Version, &closed, -2042);
    EXPECT_EQ(0, next.get());
}

// What a scan of three entries counts and delivers when the second one is this.
TEST_F(ScanTest, DamageFailsTheScanWhereItStands)
{
    const std::string begin = threeImages.substr(0, 779), entry = threeImages.substr(779, 779),
                      last = threeImages.substr(2 * 779);
    const auto with = [&](size_t at, const std::string& what) {
        return stamped(std::string(entry).replace(at, what.size(), what)) + last;
    };
    const std::vector<int> whole = {0, 0, 0, 100}, damaged = {0, -2161, -2161};
    const struct {
        const char* what;
        std::string entries;
        uint32_t numRows;
        std::vector<int> codes;
    } rows[] = {
        {"a note's byte", std::string(entry).replace(512, 1, "x") + last, 2, damaged},
        {"lower-case digits", with(23, "0000030b"), 3, whole},
        {"blanks for zeros", with(23, "     30B"), 3, whole},
        {"size below the least", with(23, "00000200"), 2, damaged},
        {"size past the end", with(23, "7FFFFFFF"), 2, damaged},
        {"more names than fit", with(79, "FFFFFFFF"), 2, damaged},
        {"no number", with(23, "????????"), 2, damaged},
        {"1 byte", entry.substr(0, 1), 2, damaged},
        {"300 bytes", entry.substr(0, 300), 2, damaged},
        {"512 bytes", entry.substr(0, 512), 2, damaged},
        {"1 byte short", entry.substr(0, 778), 2, damaged},
    };
    for (const auto& row : rows) {
        store(begin + row.entries);
        Scan scan;
        EXPECT_EQ(row.numRows, scan.request.numRows) << row.what;
        EXPECT_EQ(1u, scan.request.maxTablespaces) << row.what;
        for (int code : row.codes)
            EXPECT_EQ(code, scan.get()) << row.what;
        EXPECT_EQ(nothing, scan.shown());
    }
}

TEST_F(ScanTest, FilesThatCannotBeUsedAreRefusedAndStay)
{
    spill(historyPath, "damaged");
    spill(shadowPath, "damaged, too");
    zq3HistoryOpenStruct request = {};
    sqlca ca = {};
    char alias[] = "sample";
    request.databaseAlias = alias;
    EXPECT_EQ(0, zq3HistoryOpenScan(zq3Version, &request, &ca));
    EXPECT_EQ(-2161, ca.sqlcode);
    EXPECT_EQ("damaged", slurp(historyPath));
    EXPECT_EQ("damaged, too", slurp(shadowPath));
}
