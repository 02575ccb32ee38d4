// Headers of every version: what is read from them, and which are refused.

#include <map>
#include <sstream>

#include "records.h"

static std::string bytesOf(const SQLUH_HEADER& header)
{
    return {reinterpret_cast<const char*>(&header), 92};
}

// A header whose every field has a value of its own, as read.
static SQLUH_HEADER imageOf(uint32_t version, uint32_t number15, const std::string& timestamp,
                            uint32_t maxCommand, uint64_t offset3)
{
    // clang-format off
    SQLUH_HEADER header = {0, 0, 0x1111111122222222, UINT64_MAX, offset3, version, 0x80000005,
                           0xA0000006, 0xA0000007, number15, 0, 0xA0000009, 0xA000000A,
                           0xA000000B, 0xFEDC, 'C', 0, {}, {}, maxCommand};
    // clang-format on
    memcpy(header.timestamp, timestamp.data(), timestamp.size());
    return header;
}

// The text of such a header. tail: what follows the version.
static std::string textOf(const SQLUH_HEADER& h, const std::string& tail, unsigned int covered)
{
    char text[200];
    snprintf(text, sizeof text,
             "%s:1111111122222222:FFFFFFFFFFFFFFFF:%016llX:80000005:A0000006:A0000007:00000000:"
             "A0000009:A000000A:A000000B:0000FEDC:C:%08u:",
             hex8(byteSum(bytesOf(h).substr(0, covered))).c_str(),
             static_cast<unsigned long long>(h.offset3), h.version);
    return line(text + tail) + line("") + line("") + line("");
}

class Headers : public HistoryTest
{
  protected:
    SQLUH_HEADER header;

    // Reads the header of a file of these bytes; rewrites it, when asked, from what was read.
    int read(const std::string& bytes, bool rewriting = false)
    {
        spill(historyPath, bytes);
        memset(&header, 0xEE, sizeof header);
        SQLO_FHANDLE fh = open();
        int rc = sqluhReadHeader(fh, &header);
        EXPECT_TRUE(rc != 0 || positionOf(fh) == 1024);
        if (rewriting) {
            SQLUH_HEADER written = header;
            EXPECT_EQ(0, sqluhWriteHeader(fh, &written));
            EXPECT_EQ(1024, positionOf(fh));
            EXPECT_EQ(slurp(historyPath).substr(0, 8), hex8(written.checksum));
        }
        sqloclose(fh);
        return rc;
    }
};

TEST_F(Headers, EveryVersionIsReadByItsOwnRulesAndWrittenInTheCurrentForm)
{
    const std::string taken = "20260102030405", old = "00000101000000", blank(14, ' ');
    const struct {
        uint32_t version;
        unsigned int covered;
        std::string tail, timestamp;
        uint32_t maxCommand = 0xCAFE;
        uint64_t offset3 = 0;
    } rows[] = {
        // clang-format off
        {9010300, 92, "A0000015:20260102030405:0000CAFE:", taken},
        {10000000, 92, "A0000015:20260102030405:0000CAFE:", taken},
        {8010000, 92, "A0000015:20260102030405:0000CAFE:", taken},
        {8010000, 88, "A0000015:20260102030405:0000CAFE:", taken},
        {8009999, 72, "A0000015:20260102030405:0000CAFE:", taken},
        {7020200, 72, "A0000015:20260102030405:0000CAFE:", taken},
        {7020200, 88, "A0000015:20260102030405:0000CAFE:", taken},
        {7020200, 72, "A0000015:-0000CAFE:", blank},
        {7020200, 88, "A0000015:-        :", blank, 259},
        {9010300, 92, "A0000015:20260102030405:        :", taken, 259},
        {7020199, 92, "A0000015:0000CAFE:", old},
        {6010000, 88, "A0000015:        :", old, 259},
        {6010000, 92, "a0000015:0000cafe:", "20070101120000", 0xCAFE, 1024},
        {6009999, 92, "0000CAFE:", "20070101120000", 0xCAFE, 1024},
        {5000000, 92, "        :", blank, 259, 1024 + 768}, // of an entry without timestamp
        {5000000, 92, "0000CAFE:", "2007          ", 0xCAFE, 1024 + 768 + 768},
        {5000000, 92, "0000CAFE:", old},
        // clang-format on
    };
    const std::string entries = commandEntry(0, "20070101120000001") + commandEntry(0) +
                                commandEntry(0, "2007") + commandEntry(259, "2008");
    for (const auto& row : rows) {
        SCOPED_TRACE(std::to_string(row.version) + " " + row.tail);
        bool has15 = row.version >= 6010000, isOld = row.version < 7020200;
        SQLUH_HEADER image = imageOf(row.version, has15 ? 0xA0000015 : 0,
                                     isOld ? "" : row.timestamp, row.maxCommand, row.offset3);
        ASSERT_EQ(0, read(textOf(image, row.tail, row.covered) + entries, true));
        uint32_t number15 = has15 ? 0xA0000015 : 0xA0000007;
        image = imageOf(isOld ? 9010300 : row.version, number15, row.timestamp, row.maxCommand,
                        row.offset3);
        EXPECT_EQ(bytesOf(image), bytesOf(header));
        image.version = 9010300;
        std::string tail = hex8(number15) + ":" + row.timestamp + ":" + hex8(row.maxCommand) + ":";
        EXPECT_EQ(textOf(image, tail, 92) + entries, slurp(historyPath));
        ASSERT_EQ(0, read(slurp(historyPath)));
        EXPECT_EQ(bytesOf(image), bytesOf(header));
    }
    EXPECT_EQ("", joined(takeLog()));
}

TEST_F(Headers, DamageIsRefused)
{
    const std::string good = newHeader(),
                      failed = "Administration message 8500 | Failed to read from history file.",
                      damaged = "rc = -2161 (0xFFFFF78F) | " + failed;
    const auto with = [&](size_t at, const std::string& what) {
        return newHeader().replace(at, what.size(), what);
    };
    const std::string partial = "Error reading history header: partial header found. rc = "
                                "-2029060087 (0x870F0009) Bytes read: ";
    const struct {
        const char* name;
        std::string file;
        int rc;
        std::string log;
    } rows[] = {
        // clang-format off
        {"empty", "", END_OF_FILE, ""},
        {"1 byte", good.substr(0, 1), -2161, partial + "1 [1024 bytes] | " + failed},
        {"1023 bytes", good.substr(0, 1023), -2161, partial + "1023 [1024 bytes] | " + failed},
        {"checksum", with(0, "41997D7D"), -2161, damaged},
        {"entry count", with(67, "1"), -2161, damaged},
        {"status", with(132, "P"), -2161, damaged},
        {"version with another coverage", textOf(imageOf(7020200, 1, "20260102030405", 2, 0),
         "00000001:20260102030405:00000002:", 72).replace(134, 8, "08010000"), -2161, damaged},
        {"zero byte in field 1", with(3, std::string(1, '\0')), -2161, damaged},
        {"all zero bytes", std::string(1024, '\0'), 0, ""},
        {"behind field 17", with(176, "x"), 0, ""},
        {"scan meets damage", with(167, "        ") + "xyz", -2161,
         "Error reading history entry: partial entry found. rc = -2029060087 (0x870F0009) Bytes "
         "read: 3 [512 bytes] | Error reading history entry at file offset 1024. | Administration "
         "message 8500 |  [History File Entry: 2107648 bytes] | -2161 (0xFFFFF78F) | " + failed},
        // clang-format on
    };
    for (const auto& row : rows) {
        EXPECT_EQ(row.rc, read(row.file)) << row.name;
        EXPECT_EQ(row.log, joined(takeLog())) << row.name;
    }
}

// Runs this program's own failure tests under trace: whatever fails, each function that was entered
// is left.
TEST_F(Headers, TraceShowsEveryEntryAndExit)
{
    const std::string trace = root + "trace";
    ASSERT_EQ(0, system(("ZQ3TRACE=" + trace + " '" +
                         std::filesystem::read_symlink("/proc/self/exe").string() +
                         "' --gtest_filter='Failures.*:Headers.Dam*:Formats.New*' >/dev/null 2>&1")
                            .c_str()));
    std::map<std::string, int> entered, left;
    std::ifstream in(trace);
    for (std::string record, stamp, process, function, event; std::getline(in, record);) {
        std::istringstream(record) >> stamp >> process >> function >> event;
        entered[function] += event == "entry";
        left[function] += event == "exit";
    }
    EXPECT_EQ(entered, left);
    EXPECT_EQ(29u, entered.size());
}
