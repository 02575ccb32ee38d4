// Scans over real history directories.
#include "tests/support.h"

namespace fs = std::filesystem;

// The folder of databases, with one history in it.
class ScanTest : public HistoryTest
{
  protected:
    ScanTest()
    {
        fs::rename(directory, root + "SAMPLE");
        directory = root + "SAMPLE/";
        historyPath = directory + SQLUH_HISTORY_NAME;
        shadowPath = directory + SQLUH_SHADOW_NAME;
        setenv("ZQ3DBPATH", root.c_str(), 1);
        EXPECT_EQ(0, sqluhCreate(directory.data()));
    }

    // Appends entries, without keeping the header's counts.
    void write(std::initializer_list<entryBuilder> entries)
    {
        SQLUH_HANDLE* handle = nullptr;
        ASSERT_EQ(0, sqluhBeginBatch(&handle, directory.data()));
        sqloseek(handle->fileHandle, 0, sqloFromEnd, nullptr);
        for (entryBuilder entry : entries)
            ASSERT_EQ(0, sqluhWriteEntry(handle, entry.build()));
        ASSERT_EQ(0, sqluhEndBatch(&handle, sqluhCommit));
    }

    // Replaces bytes of the history and makes the checksum of the entry they belong to right again.
    void patch(size_t entryAt, size_t size, size_t at, const std::string& bytes)
    {
        std::string file = slurp(historyPath);
        file.replace(entryAt + at, bytes.size(), bytes).replace(entryAt, 8, "00000000");
        char digits[9];
        snprintf(digits, sizeof digits, "%08X",
                 sqluhChecksum(file.data() + entryAt, static_cast<unsigned int>(size)));
        spill(historyPath, file.replace(entryAt, 8, digits));
    }
};

static entryBuilder image(const std::string& objectPart, std::vector<std::string> tablespaces)
{
    entryBuilder entry;
    entry.objectPart = objectPart;
    entry.tablespaces = std::move(tablespaces);
    return entry;
}

struct Scan {
    zq3HistoryOpenStruct request = {};
    sqlca ca = {};
    std::string alias;
    entryReader reader;

    explicit Scan(std::string name = "sample", uint32_t slots = 4, uint32_t capacity = 19)
        : alias(std::move(name)), reader(capacity, slots)
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
        for (textBuffer* part : reader.texts())
            text += part->data + std::string("/") + std::to_string(part->length) + " ";
        for (textBuffer& name : reader.tablespaceBuffers)
            text += "[" + std::string(name.data) + "/" + std::to_string(name.length) + "]";
        for (char c : {reader.data.operation, reader.data.object, reader.data.operationType,
                       reader.data.status, reader.data.auxCode})
            text += c == '\0' ? '0' : c;
        return text + " n=" + std::to_string(reader.data.numTablespaces) +
               " sqlcode=" + std::to_string(reader.ca.sqlcode);
    }
};

TEST_F(ScanTest, OnlyPlainNamesOfHistoriesOpen)
{
    fs::create_directories(root + "S/X");
    fs::create_directory(root + "A.B");
    fs::create_directory(root + "EMPTY");
    for (const char* name : {"S/", "S/X/", "A.B/"})
        ASSERT_EQ(0, sqluhCreate((root + name).data()));
    const struct {
        const char* alias;
        int sqlcode;
    } rows[] = {
        {"sample", 0},      {"SAMPLE", 0},           {"sAmPlE", 0},        {"s", 0},
        {"", -2036},        {"s/x", -2036},          {"./s", -2036},       {"a.b", -2036},
        {"sample/", -2036}, {"sample ", -2036},      {"s\n", -2036},       {"nothing", -2036},
        {"empty", -2036},   {"samplesample", -2036}, {"S\xC3\x84", -2036},
    };
    for (const auto& row : rows)
        EXPECT_EQ(row.sqlcode, Scan(row.alias).ca.sqlcode) << row.alias;
    EXPECT_TRUE(fs::is_empty(root + "EMPTY"));
    EXPECT_FALSE(fs::exists(root + "NOTHING"));
}

TEST_F(ScanTest, EntriesAreCountedAndNothingOfOneIsLeftInTheNext)
{
    entryBuilder first = image("20250101010000001", {"A", "B", "NAMEOFMORETHAN18BYTES"});
    first.idText = "id", first.note = "note", first.command = "cmd", first.longText = "long";
    first.qualifier = "q", first.name = "n", first.firstText = "f", first.lastText = "l";
    first.secondTimestamp = "20250101020000";
    first.withSqlca = true, first.ca.sqlcode = -7;
    write({first, image("20250102010000001", {"C"}), image("", {})});
    Scan scan;
    EXPECT_EQ(3u, scan.request.numRows);
    EXPECT_EQ(3u, scan.request.maxTablespaces);
    EXPECT_TRUE(lockKeyIsFree(historyPath));
    EXPECT_EQ(0, scan.get());
    EXPECT_EQ("20250101010000001/17 20250101020000/14 f/1 l/1 id/2 q/1 n/1 long/4 note/4 cmd/3 "
              "[A/1][B/1][NAMEOFMORETHAN18BY/21][/0]BDFAx n=3 sqlcode=-7",
              scan.shown());
    EXPECT_EQ(0, scan.get());
    EXPECT_EQ(
        "20250102010000001/17 /0 /0 /0 /0 /0 /0 /0 /0 /0 [C/1][/0][/0][/0]BDFAx n=1 sqlcode=0",
        scan.shown());
    EXPECT_EQ(0, scan.get());
    EXPECT_EQ("/0 /0 /0 /0 /0 /0 /0 /0 /0 /0 [/0][/0][/0][/0]BDFAx n=0 sqlcode=0", scan.shown());
    EXPECT_EQ(100, scan.get());
    EXPECT_EQ("00000 n=0 sqlcode=0", scan.shown().substr(scan.shown().size() - 19));
}

TEST_F(ScanTest, FewerSlotsThanNamesAreAWarning)
{
    write({image("20250101010000001", {"A", "B", "C"})});
    Scan scan("sample", 2);
    EXPECT_EQ(2165, scan.get());
    EXPECT_EQ("[A/1][B/1]BDFAx n=3 sqlcode=0", scan.shown().substr(scan.shown().find('[')));
}

TEST_F(ScanTest, ScansRunSideBySideAndKeepTheHistoryTheyOpened)
{
    write({image("20250101010000001", {"A"}), image("20250102010000001", {"A"})});
    Scan first, second;
    EXPECT_EQ(0, first.get());
    write({image("20250103010000001", {"A"})});
    spill(historyPath, "");
    EXPECT_EQ(0, second.get());
    EXPECT_EQ(0, second.get());
    EXPECT_EQ(100, second.get());
    second.request.handle = 0;
    EXPECT_EQ(0, first.get());
    EXPECT_STREQ("20250102010000001", first.reader.data.objectPart.data);
    Scan third;
    EXPECT_EQ(3u, third.request.numRows) << "the emptied history comes back from the shadow";
}

TEST_F(ScanTest, WrongCallsAreRefusedAndTouchNothing)
{
    write({image("20250101010000001", {"A"}), image("20250102010000001", {"A"})});
    Scan scan;
    EXPECT_EQ(0, scan.get());
    sqlca ca = {};
    char text[] = "20250101010000";
    uint16_t closed = scan.request.handle;
    uint16_t unknown = static_cast<uint16_t>(closed ^ 0x8000);
    zq3HistoryFetchStruct good = {&scan.reader.data, closed, 2}, noRecord = {nullptr, closed, 2},
                          noScan = {&scan.reader.data, unknown, 2},
                          noAction = {&scan.reader.data, closed, 1};
    zq3HistoryOpenStruct filtered = scan.request, noAlias = {};
    filtered.timestamp = text;
    using Call = int (*)(unsigned int, void*, sqlca*);
    const struct {
        Call call;
        unsigned int version;
        void* record;
        int sqlcode;
    } rows[] = {
        {zq3HistoryOpenScan, 6010001, &scan.request, -2040},
        {zq3HistoryOpenScan, zq3Version, nullptr, -2041},
        {zq3HistoryOpenScan, zq3Version, &noAlias, -2041},
        {zq3HistoryOpenScan, zq3Version, &filtered, -2041},
        {zq3HistoryGetEntry, 0, &good, -2040},
        {zq3HistoryGetEntry, zq3Version, nullptr, -2041},
        {zq3HistoryGetEntry, zq3Version, &noRecord, -2041},
        {zq3HistoryGetEntry, zq3Version, &noAction, -2041},
        {zq3HistoryGetEntry, zq3Version, &noScan, -2042},
        {zq3HistoryCloseScan, 0, &closed, -2040},
        {zq3HistoryCloseScan, zq3Version, nullptr, -2041},
        {zq3HistoryCloseScan, zq3Version, &unknown, -2042},
    };
    std::string before = scan.shown();
    for (const auto& row : rows) {
        EXPECT_NE(0, row.call(row.version, row.record, &ca));
        EXPECT_EQ(row.sqlcode, ca.sqlcode) << &row - rows;
        EXPECT_NE(0, row.call(row.version, row.record, nullptr));
    }
    EXPECT_EQ(before, scan.shown());
    EXPECT_EQ(0, scan.get());
    EXPECT_EQ(0, zq3HistoryCloseScan(zq3Version, &closed, &ca));
    Scan next; // may take the slot, not the handle
    EXPECT_NE(0, zq3HistoryCloseScan(zq3Version, &closed, &ca));
    EXPECT_EQ(-2042, ca.sqlcode);
    EXPECT_EQ(0, next.get());
}

// Three entries of 778 bytes; the second is changed. What the scan then counts and delivers.
TEST_F(ScanTest, DamageFailsTheScanWhereItStands)
{
    write({image("20250101010000001", {"A"}), image("20250102010000001", {"B"}),
           image("20250103010000001", {"C"})});
    const size_t size = 779, second = 1024 + size;
    const std::string sound = slurp(historyPath);
    const struct {
        const char* what;
        size_t at;
        std::string bytes;
        bool fixChecksum;
        uint32_t numRows, maxTablespaces;
        std::vector<int> codes;
    } rows[] = {
        {"nothing", 0, "", false, 3, 1, {0, 0, 0, 100}},
        {"a note's byte", 512, "x", false, 3, 1, {0, -2161, -2161}},
        {"lower-case digits", 23, "0000030b", true, 3, 1, {0, 0, 0, 100}},
        {"blanks for zeros", 23, "     30B", true, 3, 1, {0, 0, 0, 100}},
        {"size below the least", 23, "00000200", true, 2, 1, {0, -2161, -2161}},
        {"size behind the end", 23, "7FFFFFFF", true, 2, 1, {0, -2161, -2161}},
        {"more names than fit", 79, "FFFFFFFF", true, 3, 1, {0, -2161, -2161}},
        {"no number", 23, "????????", true, 2, 1, {0, -2161, -2161}},
    };
    for (const auto& row : rows) {
        spill(historyPath, sound);
        if (row.fixChecksum)
            patch(second, size, row.at, row.bytes);
        else
            spill(historyPath,
                  slurp(historyPath).replace(second + row.at, row.bytes.size(), row.bytes));
        Scan scan;
        EXPECT_EQ(row.numRows, scan.request.numRows) << row.what;
        EXPECT_EQ(row.maxTablespaces, scan.request.maxTablespaces) << row.what;
        for (int code : row.codes)
            EXPECT_EQ(code, scan.get()) << row.what;
        EXPECT_EQ("00000 n=0 sqlcode=0", scan.shown().substr(scan.shown().size() - 19));
    }
    for (size_t left : {size_t{1}, size_t{300}, size_t{512}, size - 1}) {
        spill(historyPath, sound.substr(0, second + left));
        spill(shadowPath, sound.substr(0, second + left));
        Scan scan;
        EXPECT_EQ(2u, scan.request.numRows) << left;
        EXPECT_EQ(0, scan.get());
        EXPECT_EQ(-2161, scan.get()) << left;
    }
}

TEST_F(ScanTest, AHistoryMadeAnewIsAWarning)
{
    spill(historyPath, "damaged");
    spill(shadowPath, "damaged");
    Scan scan;
    EXPECT_EQ(2160, scan.ca.sqlcode);
    EXPECT_EQ(0u, scan.request.numRows);
    EXPECT_EQ(100, scan.get());
}
