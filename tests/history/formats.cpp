// The records byte for byte, what comes back from them, and the filters of the reader.

#include <clocale>

#include "records.h"
#include "scanaside.h"

class Formats : public HistoryTest
{
  protected:
    SQLUH_HANDLE* handle = nullptr;

    void SetUp() override
    {
        spill(historyPath, newHeader());
        ASSERT_EQ(0, sqluhHandleAllocAndInit(directory.data(), &handle));
        handle->fileHandle = open();
        ASSERT_EQ(0, sqloseek(handle->fileHandle, 1024, sqloFromStart, nullptr));
    }
    void TearDown() override
    {
        sqloclose(handle->fileHandle);
        sqluhHandleFree(&handle);
    }
    // The bytes that writing this entry adds to the file.
    std::string written(SQLUH_ENTRY* entry)
    {
        size_t before = slurp(historyPath).size();
        EXPECT_EQ(0, sqluhWriteEntry(handle, entry));
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
    EXPECT_EQ("C.UTF-8", std::string(setlocale(LC_CTYPE, nullptr)));
    setlocale(LC_CTYPE, "C");
    deep.insert(deep.size() - 1, "e");
    std::filesystem::create_directories(deep);
    EXPECT_EQ(sqluhPathTooLong, sqluhCreate(deep.data()));
    EXPECT_TRUE(std::filesystem::is_empty(deep));
}

TEST_F(Formats, EntryWithEverySectionByteForByte)
{
    entryBuilder b;
    // clang-format off
    const char* texts[] = {"20260102030405001", "20260102030500", "S0000001.LOG", "S2.LOG-and-more",
                           "20250102030405", "SCHEMA1", "T1", "/backup/one", "note"};
    // clang-format on
    for (size_t i = 0; i < std::size(texts); i++)
        *b.texts()[i] = texts[i];
    b.command = std::string(255, 'c') + std::string(255, 'd') + "e";
    b.tablespaces = {"CATALOGROOM", "", "TS3"};
    b.withSqlca = true;
    // What is shorter than its field is padded with blanks.
    // clang-format off
    b.ca = {{'S', 'Q', 'L', 'C', 'A', ' ', ' ', ' '}, 136, -1234, 0x1F, "tokens", "PRODUCT",
            {}, {'W', ' ', 'x'}, {'5', '1', '0', '2', '4'}};
    // clang-format on
    b.ca.sqlerrd[1] = INT32_MIN;
    b.ca.sqlerrd[5] = INT32_MAX;
    memcpy(b.data.logPosition, "\x00\x1F\xAB\xFF\x10\x09", 6);
    b.data.entryNode = 0xBEEF;
    b.data.entryNumber = 0xDEADBEEF;
    b.data.object = b.data.operationType = '\0';
    SQLUH_ENTRY* entry = b.build();
    b.data.noteText.length = 99; // not what decides: the entry's own length does
    b.tablespaceBuffers[2].length = 0;
    entry->noteLength = 0x1E;
    entry->version = 1;
    EXPECT_EQ(fullEntry(), written(entry));
    EXPECT_EQ(3u, b.tablespaceBuffers[2].length);
}

TEST_F(Formats, SectionsAndPlaceholdersByteForByte)
{
    entryBuilder b;
    const auto sections = [&] { return written(b.build()).substr(768); };
    b.data.object = b.data.operationType = b.data.auxCode = '\0';
    b.data.entryNode = 42;
    b.data.entryNumber = 7;
    EXPECT_EQ(commandEntry(0), written(b.build()));
    b.objectPart = b.secondTimestamp = " 2026"; // a leading blank counts as empty
    b.firstText = b.lastText = b.idText = " x";
    EXPECT_EQ(commandEntry(0), written(b.build()));
    b.build();
    for (textBuffer* text = &b.data.objectPart; text <= &b.data.commandText; text++)
        text->data = nullptr;
    EXPECT_EQ(commandEntry(0), written(&b.entry));
    for (size_t length : {1u, 254u, 255u, 256u, 510u, 511u}) {
        b.command.assign(length, 'c');
        EXPECT_EQ(commandEntry(length), written(b.build()));
    }
    b.command.clear();
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

static void expectSame(entryBuilder& w, entryReader& r)
{
    static const size_t widths[] = {17, 14, 12, 12, 24, 900, 900, 255, 30, 900};
    for (size_t i = 0; i < 10; i++)
        expectText(*w.texts()[i], widths[i], *r.texts()[i]);
    for (size_t i = 0; i < w.tablespaces.size() && i < r.tablespaceBuffers.size(); i++)
        expectText(w.tablespaces[i], 900, r.tablespaceBuffers[i]);
    ASSERT_EQ(0, memcmp(w.data.logPosition, r.data.logPosition, 6));
    SQLUH_ENTRY expected = w.entry;
    expected.noteLength = std::min(expected.noteLength, 30u);
    expected.longTextLength = std::min(expected.longTextLength, 255u);
    ASSERT_TRUE(sameNumbers(expected, r.entry));
    ASSERT_EQ("SQLUHINF", std::string(r.data.eyecatcher, 8));
    sqlca ca = w.ca;
    if (!w.withSqlca)
        sqloinca(&ca);
    ASSERT_EQ(0, memcmp(&ca, &r.ca, sizeof ca));
}

TEST_F(Formats, EntriesComeBackAsTheyWereWritten)
{
    static const size_t lengths[] = {1, 17, 30, 31, 254, 255, 256, 257, 511, 900};
    const auto text = [](size_t length, size_t seed) {
        std::string letters;
        while (letters.size() < length)
            letters += static_cast<char>('a' + (letters.size() * letters.size() + seed) % 26);
        return letters;
    };
    std::vector<entryBuilder> entries(120);
    for (size_t i = 0; i < entries.size(); i++) {
        entryBuilder& b = entries[i];
        for (size_t t = 0; t < 10; t++) // every combination of the optional sections
            *b.texts()[t] = text((i >> t % 5 & 1) * lengths[(i + t) % 10], t);
        for (size_t name = 0; name < i % 9; name++)
            b.tablespaces.push_back(text(lengths[(i + name) % 10], name));
        b.withSqlca = i % 4 != 0;
        b.ca.sqlcode = static_cast<int32_t>(i % 7 * i % 5 * 429496729);
        b.ca.sqlerrd[1] = i % 2 == 0 ? INT32_MIN : -12345;
        b.ca.sqlerrml = 0x1F;
        memcpy(b.ca.sqlerrmc, text(78, i).data(), 78);
        memcpy(b.data.logPosition, text(6, i).data(), 6);
        b.data.entryNumber = static_cast<uint32_t>(i << 24);
        ASSERT_EQ(0, sqluhWriteEntry(handle, b.build()));
    }
    for (uint32_t capacity : {4096u, 0u, 1u, 18u, 255u, 256u, 900u}) {
        entryReader r(capacity, capacity / 64, capacity + 512);
        long long at = 0;
        uint32_t largest = r.workArea.size;
        ASSERT_EQ(0, sqluhRewind(handle->fileHandle, &at));
        for (entryBuilder& b : entries) {
            int expected = b.tablespaces.size() > capacity / 64 ? 2165 : 0;
            ASSERT_EQ(expected, r.read(handle->fileHandle));
            ASSERT_NO_FATAL_FAILURE(expectSame(b, r));
            ASSERT_EQ(b.withSqlca && b.ca.sqlcode != 0 ? 0x40u : 0u, r.flags);
            ASSERT_EQ(at += b.entry.size, positionOf(handle->fileHandle));
            ASSERT_EQ(largest = std::max(largest, b.entry.size), r.workArea.size);
        }
        ASSERT_EQ(END_OF_FILE, r.read(handle->fileHandle));
    }
    EXPECT_EQ("", joined(takeLog()));
}

TEST_F(Formats, FiltersSetTheirBits)
{
    entryBuilder named, bare;
    named.objectPart = "20260505000000003";
    named.qualifier = "Q";
    named.tablespaces = {"AA", "B", "CC"};
    bare.withSqlca = true;
    bare.ca.sqlcode = 1;
    ASSERT_EQ(0, sqluhWriteEntry(handle, named.build()));
    ASSERT_EQ(0, sqluhWriteEntry(handle, bare.build()));
    const struct {
        bool second;
        const char *timestamp, *qualifier, *name, *tablespace;
        unsigned int flags;
    } rows[] = {
        // clang-format off
        {false, nullptr, "Q", nullptr, nullptr, 0x01},
        {false, nullptr, "QQ", "", nullptr, 0x02},
        {false, nullptr, "", "T", "A", 0},
        {false, nullptr, nullptr, nullptr, "CC", 0x04}, // behind what the caller has room for
        {false, "20260505000001", nullptr, nullptr, nullptr, 0x08},
        {false, "20260505000000999", nullptr, nullptr, nullptr, 0x10},
        {false, "2026050500000", nullptr, nullptr, nullptr, 0x20},
        {false, "2027", "Q", "", "AA", 0x0F},
        {true, "00000101000000", "", "", "", 0x50},
        {true, "", nullptr, nullptr, nullptr, 0x60},
        // clang-format on
    };
    for (const auto& row : rows) {
        entryReader r(64, 2);
        sqloseek(handle->fileHandle, row.second ? 1024 + named.entry.size : 1024, 0, nullptr);
        int rc = r.read(handle->fileHandle, row.timestamp, row.qualifier, row.name, row.tablespace);
        EXPECT_EQ(row.second ? 0 : 2165, rc);
        EXPECT_EQ(row.flags, r.flags) << &row - rows;
    }
}

TEST_F(Formats, RecordsThatDoNotAddUpAreNotWritten)
{
    const struct {
        int byteCount;
        uint32_t sqlcaLength, qualifierLength;
        std::string actual, size, dump;
    } rows[] = {{136, 100, 0, "962", "868", " |  [History File Entry: 868 bytes]"},
                {136, 195, 0, "962", "963", " |  [History File Entry: 963 bytes]"},
                {-1, 194, 0, "963", "962", " |  [History File Entry: 962 bytes]"},
                {-1, 195, 0, "963", "963", " |  [History File Entry: 963 bytes]"},
                {136, 0, 0xFFFFFFFE, "0", "768", ""}}; // wraps in 32 bits
    for (const auto& row : rows) {
        entryBuilder b;
        b.ca.sqlcabc = row.byteCount;
        b.build()->sqlcaLength = row.sqlcaLength;
        b.entry.qualifierLength = row.qualifierLength;
        EXPECT_EQ(-2161, sqluhWriteEntry(handle, &b.entry));
        EXPECT_EQ("Actual entry size: " + row.actual + "   Size field: " + row.size +
                      ". rc = -2161 (0xFFFFF78F)" + row.dump,
                  joined(takeLog()));
        EXPECT_EQ(newHeader(), slurp(historyPath));
        EXPECT_EQ(1024, positionOf(handle->fileHandle));
    }
}
