// Damaged entries, and the two ways to take a fixed part apart.

#include <random>

#include "history/sqluhRows.h"
#include "records.h"
#include "scanaside.h"

// The full entry with other bytes and the checksum that goes with them.
static std::string with(size_t at, const std::string& what)
{
    return stamped(fullEntry().replace(at, what.size(), what));
}

// Up to where the reader came: nothing, the first numbers of the fixed part, or all of it.
enum reached { none, some, all };

struct damage {
    std::string name, entry, log; // no log: the end of the file
    reached state;
    uint32_t position; // after the start of the entry
};

static const std::string full = fullEntry(), zero(1, '\0'),
                         zeros(8, '\0'), end = " found. rc = -2029060087 (0x870F0009) Bytes read: ",
                         partial = "Error reading history entry: partial entry" + end,
                         body = "Error reading history entry body: partial body" + end,
                         fields = "Error parsing history entry: invalid number of fields "
                                  "found. Number of fields read: ",
                         lengths = "Error parsing history entry: invalid section lengths "
                                   "found. Size field: ",
                         sum = "Error verifying checksum of history entry. Expected: ";

static const damage damages[] = {
    // clang-format off
    {"sound", full, "", all, 0x6FB},
    {"nothing", "", "", none, 0},
    {"511 bytes", full.substr(0, 511), partial + "511 [512 bytes]", none, 511},
    {"fixed part alone", full.substr(0, 512), "", all, 512},
    {"1 byte of body", full.substr(0, 513), body + "1 [1 bytes]", all, 513},
    {"1 byte short", full.substr(0, 0x6FA), body + "1274 [1274 bytes]", all, 0x6FA},
    {"zero status", with(41, zero), fields + "5 [512 bytes]", some, 512},
    {"zero first byte", zero + full.substr(1), fields + "0 [512 bytes]", none, 512},
    {"zero operation", with(256, zero), fields + "13 [512 bytes]", some, 512},
    {"tab as operation", with(256, "\t"), fields + "14 [512 bytes]", some, 512},
    {"blank in idText", with(336, " "), fields + "22 [512 bytes]", some, 512},
    {"no hexadecimal number", with(43, "x"), fields + "6 [512 bytes]", some, 512},
    {"size 767", with(23, "000002FF"), lengths + "767 [512 bytes]", all, 512},
    {"huge size", with(23, "FFFFFFFF"), body + "1275 [1275 bytes]", all, 0x6FB},
    {"huge, no body", with(23, "FFFFFFFF").substr(0, 512), "", all, 512},
    {"body", std::string(full).replace(1000, 1, "x"), sum + "1914337134 (0x721A776E) Observed: "
     "1914337078 (0x721A7736)", all, 0x6FB},
    {"checksum", "F2345678" + full.substr(8), sum + "-231451016 (0xF2345678) Observed: "
     "1914337134 (0x721A776E)", all, 0x6FB},
    {"sqlca past size", stamped(with(23, "000004A9").substr(0, 0x4A9)), lengths + "1193", all,
     0x4A9},
    {"zeros for a length", with(1035, zeros + ":x00000001:x"), lengths + "1787",
     all, 0x6FB},
    // clang-format on
};

// Lengths of the qualifier, the name, the number of tablespaces, the command, a tablespace.
static const struct {
    size_t at;
    const char* what;
} badLengths[] = {
    // clang-format off
    {61, "000001F0"}, {61, "FFFFFFFF:00000004"}, {61, "FFFFFFFE"}, {79, "00000004"},
    {79, "FFFFFFFF"}, {97, "00000200"}, {97, "FF000000"}, {1035, "zzzzzzzz"}, {1035, "000003FF"},
    {1035, "FFFFFFF9"}, {1035, "-0000001"}, {1056, "00000001"},
    // clang-format on
};

class Damage : public HistoryTest
{
  protected:
    // Reads the entry into records that hold something, and compares all that is left in them.
    void expectTold(const damage& row, uint32_t capacity)
    {
        SCOPED_TRACE(row.name + " " + std::to_string(capacity));
        spill(historyPath, newHeader() + row.entry);
        SQLO_FHANDLE fh = open(sqloOpenRead);
        sqloseek(fh, 1024, sqloFromStart, nullptr);
        entryReader r(32, 1, capacity);
        r.entry.size = 77;
        r.data.entryNumber = 88;
        r.data.auxCode = '#';
        int expected = !row.log.empty() ? -2161 : row.entry == full ? 2165 : END_OF_FILE;
        EXPECT_EQ(expected, r.read(fh));
        EXPECT_EQ(1024 + row.position, positionOf(fh));
        sqloclose(fh);
        EXPECT_EQ(std::max(row.position, capacity), r.workArea.size);
        EXPECT_EQ(row.state == none ? "0000004D" : row.entry.substr(23, 8), hex8(r.entry.size));
        EXPECT_EQ(row.state == none ? 88u : 0xDEADBEEF, r.data.entryNumber);
        EXPECT_EQ(row.state == all ? 'x' : '#', r.data.auxCode);
        if (row.log.starts_with(sum)) { // the texts are as they were
            EXPECT_EQ('~', r.data.noteText.data[0]);
            EXPECT_EQ(0u, r.data.noteText.length + r.data.commandText.length);
        }
        const std::string where = " | Error reading history entry at file offset 1024. | "
                                  "Administration message 8500 |  [History File Entry: " +
                                  std::to_string(r.workArea.size) + " bytes]";
        EXPECT_EQ(row.log.empty() ? "" : row.log + where, joined(takeLog()));
    }
};

TEST_F(Damage, EveryClassIsToldAndLeavesTheCallersRecordsDefined)
{
    for (uint32_t capacity : {512u, 4096u}) {
        for (const damage& row : damages)
            expectTold(row, capacity);
        for (const auto& [at, what] : badLengths)
            expectTold({what, with(at, what), lengths + "1787", all, 0x6FB}, capacity);
    }
}

static std::string mutated(std::string record, std::mt19937& random)
{
    static const std::string odd(" \t\n\v\r+-0xX:fFg/@`\xA0\x7F\0", 21);
    for (unsigned long i = random() % 3 + 1; i > 0; i--) {
        // The checksum's own digits are stamped afterwards; the line break is hit often.
        size_t at = random() % 8 == 0 ? 250 + random() % 8 : 9 + random() % 360;
        const std::string what = odd.substr(random() % odd.size(), random() % 2 + 1);
        if (random() % 3 == 0) // shifts the line in the neighbourhood of its field
            record.insert(at, what).erase(at + what.size() + random() % 12, what.size());
        else
            record.replace(at, what.size(), what);
    }
    return stamped(padded(record, 768));
}

// Half of them plain, half with words and a log position to be mutated.
static std::vector<std::string> mutatedEntries(size_t count)
{
    std::mt19937 random(4711);
    std::string busy = commandEntry(0, "20260102030405001");
    busy.replace(258, 3, "d:i").replace(295, 3, "S:1").replace(321, 12, "00abCDef1x09");
    busy.replace(334, 24, std::string(24, 'i'));
    std::vector<std::string> records(count);
    for (std::string& record : records)
        record = mutated(random() % 2 == 0 ? commandEntry(0) : busy, random);
    return records;
}

// A body that the lengths do not describe is refused in any case.
static bool isPlain(const scannedPart& s)
{
    const SQLUH_ENTRY& e = s.entry;
    return s.found == 23 && e.size == 768 &&
           (e.longTextLength | e.qualifierLength | e.nameLength | e.sqlcaLength | e.commandLength |
            s.data.numTablespaces) == 0;
}

TEST_F(Damage, ReaderTakesWhatTheScanningFormatTakes)
{
    setenv("ZQ3DIAGLOG", "/dev/null", 1);
    const std::vector<std::string> records = mutatedEntries(20000);
    std::string file = newHeader();
    for (const std::string& record : records)
        file += record;
    spill(historyPath, file);
    SQLO_FHANDLE fh = open(sqloOpenRead);
    int taken = 0;
    for (size_t i = 0; i < records.size(); i++) {
        scannedPart s;
        entryReader r(64, 0, 768);
        scanAside(records[i].c_str(), &s);
        sqloseek(fh, static_cast<long long>(1024 + 768 * i), sqloFromStart, nullptr);
        int rc = r.read(fh);
        ASSERT_TRUE(agrees(&s, rc, r.entry)) << records[i];
        ASSERT_EQ(isPlain(s), rc == 0) << records[i];
        taken += rc == 0;
    }
    EXPECT_GT(taken, 2000);
    sqloclose(fh);
}

// Whether both hold the same, in all of their buffers.
static bool holdTheSame(entryReader& a, entryReader& b)
{
    bool same = sameNumbers(a.entry, b.entry) && a.storage == b.storage &&
                memcmp(&a.ca, &b.ca, sizeof a.ca) == 0 &&
                memcmp(a.data.logPosition, b.data.logPosition, sizeof a.data.logPosition) == 0 &&
                memcmp(a.data.eyecatcher, b.data.eyecatcher, sizeof a.data.eyecatcher) == 0;
    for (int i = 0; i < 10; i++)
        same &= a.texts()[i].length == b.texts()[i].length;
    for (size_t i = 0; i < a.tablespaceBuffers.size(); i++)
        same &= a.tablespaceBuffers[i].length == b.tablespaceBuffers[i].length;
    return same;
}

// A quarter of them mutated, the others as they came; few enough kinds that many share their lists.
static std::vector<std::string> mixedEntries(size_t count)
{
    std::mt19937 random(815);
    std::vector<std::string> kinds = {full,
                                      with(79, "00000002"),
                                      with(1035, "0000000a"),
                                      with(1044, zero + "ATALOG"),
                                      commandEntry(256, "00000101000000", {"A", "BB", "C"}),
                                      commandEntry(0, "20260102030405", {"A", "BB", "D"}),
                                      with(768, zeros),
                                      with(1100, "   "),
                                      mutatedEntries(1)[0]};
    std::vector<std::string> records(count);
    for (std::string& record : records) {
        record = kinds[random() % kinds.size()];
        if (random() % 4 == 0)
            record = stamped(record.replace(9 + random() % (record.size() - 9), 1, 1,
                                            "0 \n:1F-\0"[random() % 8]));
    }
    return records;
}

TEST_F(Damage, RowsHoldWhatTheReaderReads)
{
    setenv("ZQ3DIAGLOG", "/dev/null", 1);
    sqluhRows rows = {};
    sqluhProvenEntry proven;
    sqluhBeginProving(&proven, true);
    entryReader prover(8, 0, 512);
    uint32_t taken = 0;
    for (const std::string& record : mixedEntries(8000)) {
        spill(historyPath, record);
        SQLO_FHANDLE fh = open(sqloOpenRead);
        const bool roomy = taken % 2 == 0;
        entryReader read(roomy ? 600 : 7, roomy ? 32 : 1), row(roomy ? 600 : 7, roomy ? 32 : 1);
        const int rc = read.read(fh);
        sqloseek(fh, 0, sqloFromStart, nullptr);
        int added = sqluhProveEntry(fh, &prover.entry, &prover.workArea, &proven, nullptr);
        if (added == 0)
            added = sqluhAddRow(&rows, &prover.entry, &prover.workArea, &proven);
        sqloclose(fh);
        ASSERT_EQ(rc == TABLESPACE_LIST_TRUNCATED ? 0 : rc, added) << record;
        if (added != 0)
            continue;
        ASSERT_EQ(rc, sqluhTakeRow(rows.rows[taken++], &row.entry, false)) << record;
        ASSERT_TRUE(holdTheSame(read, row)) << record;
    }
    EXPECT_GT(taken, 4000u);
    EXPECT_EQ(taken, rows.count);
    sqluhFreeRows(&rows);
}
