// The records byte for byte, what comes back from them, and the filters of the reader.

#include <clocale>

#include "records.h"
#include "scanaside.h"

class Formats : public HistoryTest
{
  protected:
    SQLUH_HANDLE handle = {};

    Formats()
    {
        spill(historyPath, newHeader());
        handle.fileHandle = open();
        handle.replayArea.replayDisabled = 1;
        sqloseek(handle.fileHandle, 1024, sqloFromStart, nullptr);
    }
    ~Formats() override
    {
        sqloclose(handle.fileHandle);
    }
    // The bytes that writing this entry adds to the file.
    std::string written(SQLUH_ENTRY* entry)
    {
        size_t before = slurp(historyPath).size();
        EXPECT_EQ(0, sqluhWriteEntry(&handle, entry));
        return slurp(historyPath).substr(before);
    }
};

TEST_F(Formats, NewPairOfFilesByteForByteInDirectoriesUpToTheLimit)
{
    std::string deep = directory + std::string(100, 'd') + "/";
    deep += std::string(242 - deep.size(), 'e') + "/";
    std::filesystem::create_directories(deep);
    ASSERT_NE(nullptr, setlocale(LC_CTYPE, "C.UTF-8"));
    for (std::string at : {directory, directory + "no-separator-is-put-in", deep}) {
        EXPECT_EQ(0, sqluhCreate(at.data()));
        EXPECT_EQ(newHeader(), slurp(at + "zq3rhist.asc"));
        EXPECT_EQ(newHeader(), slurp(at + "zq3rhist.bak"));
    }
    EXPECT_STREQ("C.UTF-8", setlocale(LC_CTYPE, nullptr));
    setlocale(LC_CTYPE, "C");
    deep.insert(deep.size() - 1, "e");
    std::filesystem::create_directories(deep);
    EXPECT_EQ(sqluhPathTooLong, sqluhCreate(deep.data()));
    EXPECT_TRUE(std::filesystem::is_empty(deep));
}

TEST_F(Formats, EveryFieldIsReadAndWrittenByteForByte)
{
    entryReader r;
    spill(historyPath, newHeader() + fullEntry());
    ASSERT_EQ(0, r.read(handle.fileHandle));
    EXPECT_EQ("B  Ax", std::string(&r.data.operation, 5));
    EXPECT_EQ("SQLUHINF", std::string(r.data.eyecatcher, 8));
    // What the writer completes, and what it does not look at.
    r.data.object = r.data.operationType = '\0';
    r.tablespaceBuffers[2].length = 0;
    r.data.noteText.length = 99;
    r.entry.version = 1;
    EXPECT_EQ(fullEntry(), written(&r.entry));
    EXPECT_EQ(3u, r.tablespaceBuffers[2].length);
    ASSERT_EQ(0, sqluhRewind(handle.fileHandle, nullptr));
    EXPECT_EQ(0, sqluhVerifyOneEntry(handle.fileHandle, &r.workArea)); // with names for no buffer
}

TEST_F(Formats, PlaceholdersAndCommandsByteForByte)
{
    entryBuilder b;
    b.data.object = b.data.operationType = b.data.auxCode = '\0';
    b.data.entryNode = 42;
    b.data.entryNumber = 7;
    EXPECT_EQ(commandEntry(0), written(b.build()));
    b.objectPart = b.secondTimestamp = b.firstText = b.lastText = b.idText = " x"; // as if empty
    EXPECT_EQ(commandEntry(0), written(b.build()));
    for (textBuffer* text = &b.data.objectPart; text <= &b.data.commandText; text++)
        text->data = nullptr;
    EXPECT_EQ(commandEntry(0), written(&b.entry));
    for (size_t length : {1u, 254u, 255u, 256u, 510u, 511u}) {
        b.command.assign(length, 'c');
        EXPECT_EQ(commandEntry(length), written(b.build()));
    }
}

TEST_F(Formats, SectionsByteForByte)
{
    entryBuilder b;
    const auto sections = [&] { return written(b.build()).substr(768); };
    b.longText = std::string(300, 'l');
    EXPECT_EQ(std::string(255, 'l') + "\n", sections());
    b.longText.clear();
    b.withSqlca = true;
    memcpy(b.ca.sqlerrmc, "text", 4); // sqlerrml is 0
    memset(b.ca.sqlerrp, 0, 8);
    EXPECT_EQ("SQLCA   0000000136+00000000000000" + padded("-", 70) + padded("-", 8) +
                  "+0000000000+0000000000+0000000000+0000000000+0000000000+0000000000" +
                  std::string(11, ' ') + "-    \n",
              sections());
    b.withSqlca = false;
    b.name = "TABLE";
    EXPECT_EQ("\nTABLE\n", sections());
    // Texts shorter than their lengths are padded.
    b.command = "run";
    b.tablespaces = {"TS"};
    b.build()->commandLength = 257;
    b.entry.nameLength = 7;
    b.tablespaceBuffers[0].length = 5;
    EXPECT_EQ("\nTABLE  \n00000005:TS   \n" + line("run") + "  \n", written(&b.entry).substr(768));
}

// A text of which a reader with a buffer of this capacity gets the first width characters at most.
static void expectText(const std::string& source, size_t width, const textBuffer& text)
{
    const std::string expected = source.substr(0, width);
    ASSERT_EQ(expected.size(), text.length);
    ASSERT_EQ(expected.substr(0, std::max(text.capacity, 1u) - 1), text.data ? text.data : "");
}

// The i-th entry of many: every combination of the optional sections, every length in each.
static void fillEntry(entryBuilder* b, size_t i)
{
    static const size_t lengths[] = {1, 17, 30, 31, 254, 255, 256, 257, 511, 900};
    const auto text = [](size_t length, size_t seed) {
        std::string letters;
        while (letters.size() < length)
            letters += static_cast<char>('a' + (letters.size() * letters.size() + seed) % 26);
        return letters;
    };
    for (size_t t = 0; t < 10; t++)
        *b->texts()[t] = text((i >> t % 5 & 1) * lengths[(i + t) % 10], t);
    for (size_t name = 0; name < i % 9; name++)
        b->tablespaces.push_back(text(lengths[(i + name) % 10], name));
    b->withSqlca = i % 4 != 0;
    b->ca.sqlcode = static_cast<int32_t>(i % 7 * i % 5 * 429496729);
    b->ca.sqlerrd[1] = i % 2 == 0 ? INT32_MIN : -12345;
    b->ca.sqlerrml = 0x1F;
    memcpy(b->ca.sqlerrmc, text(78, i).data(), 78);
    b->data.entryNumber = static_cast<uint32_t>(i << 24);
}

// What a reader with buffers of this capacity has of an entry that was written.
static void expectSame(entryBuilder& b, entryReader& r, uint32_t capacity)
{
    static const size_t widths[] = {17, 14, 12, 12, 24, 900, 900, 255, 30, 900};
    sqlca initial;
    sqloinca(&initial);
    ASSERT_EQ(std::max(capacity + 512, b.entry.size), r.workArea.size);
    ASSERT_EQ(b.withSqlca && b.ca.sqlcode != 0 ? 0x40u : 0u, r.flags);
    for (size_t t = 0; t < 10; t++)
        ASSERT_NO_FATAL_FAILURE(expectText(*b.texts()[t], widths[t], r.texts()[t]));
    for (size_t name = 0; name < std::min(b.tablespaces.size(), r.tablespaceBuffers.size()); name++)
        ASSERT_NO_FATAL_FAILURE(expectText(b.tablespaces[name], 900, r.tablespaceBuffers[name]));
    ASSERT_TRUE(sameNumbers(b.entry, r.entry));
    ASSERT_EQ(0, memcmp(b.withSqlca ? &b.ca : &initial, &r.ca, sizeof initial));
}

TEST_F(Formats, EntriesComeBackAsTheyWereWritten)
{
    for (size_t i = 0; i < 120; i++) {
        entryBuilder b;
        fillEntry(&b, i);
        const long long at = positionOf(handle.fileHandle);
        ASSERT_EQ(0, sqluhWriteEntry(&handle, b.build()));
        b.entry.noteLength = std::min(b.entry.noteLength, 30u);
        b.entry.longTextLength = std::min(b.entry.longTextLength, 255u);
        for (uint32_t capacity : {4096u, 0u, 1u, 18u, 255u, 256u, 900u}) {
            entryReader r(capacity, capacity / 64, capacity + 512);
            sqloseek(handle.fileHandle, at, sqloFromStart, nullptr);
            ASSERT_EQ(i % 9 > capacity / 64 ? 2165 : 0, r.read(handle.fileHandle));
            ASSERT_EQ(at + b.entry.size, positionOf(handle.fileHandle));
            ASSERT_NO_FATAL_FAILURE(expectSame(b, r, capacity)) << i << " " << capacity;
        }
    }
    EXPECT_EQ("", joined(takeLog()));
}

TEST_F(Formats, FiltersSetTheirBits)
{
    spill(historyPath, newHeader() + fullEntry() + commandEntry(0));
    const struct {
        int at;
        const char *timestamp, *qualifier, *name, *tablespace;
        unsigned int flags;
    } rows[] = {
        // clang-format off
        {1024, nullptr, "SCHEMA1", nullptr, nullptr, 0x41},
        {1024, nullptr, "SCHEMA12", "T1", nullptr, 0x42},
        {1024, nullptr, "SCHEMA", "", "TS", 0x40},
        {1024, nullptr, nullptr, nullptr, "TS3", 0x44}, // after what the caller has room for
        {1024, "20260102030406", nullptr, nullptr, nullptr, 0x48},
        {1024, "20260102030405999", nullptr, nullptr, nullptr, 0x50},
        {1024, "2026010203040", nullptr, nullptr, nullptr, 0x60},
        {1024, "2027", "SCHEMA1", "T1", "CATALOGROOM", 0x4F},
        {2811, "00000101000000", "", "", "", 0x10},
        {2811, "", nullptr, nullptr, nullptr, 0x20},
        // clang-format on
    };
    for (const auto& row : rows) {
        entryReader r(64, 2);
        sqloseek(handle.fileHandle, row.at, sqloFromStart, nullptr);
        int rc = r.read(handle.fileHandle, row.timestamp, row.qualifier, row.name, row.tablespace);
        EXPECT_EQ(row.at == 1024 ? 2165 : 0, rc);
        EXPECT_EQ(row.flags, r.flags) << &row - rows;
    }
}

TEST_F(Formats, RecordsThatDoNotAddUpAreNotWritten)
{
    const struct {
        int byteCount;
        uint32_t sqlcaLength, qualifierLength;
        const char *sizes, *dump;
    } rows[] = {
        {136, 100, 0, "962   Size field: 868", " |  [History File Entry: 868 bytes]"},
        {-1, 194, 0, "963   Size field: 962", " |  [History File Entry: 962 bytes]"},
        {-1, 195, 0, "963   Size field: 963", " |  [History File Entry: 963 bytes]"},
        {136, 0, 0xFFFFFFFE, "0   Size field: 768", ""}, // wraps in 32 bits
    };
    for (const auto& row : rows) {
        entryBuilder b;
        b.ca.sqlcabc = row.byteCount;
        b.build()->sqlcaLength = row.sqlcaLength;
        b.entry.qualifierLength = row.qualifierLength;
        EXPECT_EQ(-2161, sqluhWriteEntry(&handle, &b.entry));
        EXPECT_EQ(std::string("Actual entry size: ") + row.sizes + ". rc = -2161 (0xFFFFF78F)" +
                      row.dump,
                  joined(takeLog()));
        EXPECT_EQ(newHeader(), slurp(historyPath));
        EXPECT_EQ(1024, positionOf(handle.fileHandle));
    }
}
