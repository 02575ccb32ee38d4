// Headers of every version: what is read from them, and which are refused.

#include <map>
#include <sstream>

#include "records.h"

// A header whose every field has a value of its own. tail: what follows the version.
static std::string textOf(const char* checksum, unsigned int version, unsigned int offset3,
                          const std::string& tail)
{
    char text[160];
    snprintf(text, sizeof text,
             "%s:1111111122222222:FFFFFFFFFFFFFFFF:%016X:80000005:A0000006:A0000007:00000000:"
             "A0000009:A000000A:A000000B:0000FEDC:C:%08u:",
             checksum, offset3, version);
    return headerOf(text + tail);
}

static const std::string current = "A0000015:20260102030405:0000CAFE:";

class Headers : public HistoryTest
{
  protected:
    SQLUH_HEADER header;

    // Reads the header of a file of these bytes, and rewrites it from what was read.
    int read(const std::string& bytes)
    {
        spill(historyPath, bytes);
        memset(&header, 0xEE, sizeof header);
        SQLO_FHANDLE fh = open();
        int rc = sqluhReadHeader(fh, &header);
        if (rc == 0) {
            EXPECT_EQ(1024, positionOf(fh));
            EXPECT_EQ(0u, header.checksum);
            SQLUH_HEADER written = header;
            EXPECT_EQ(0, sqluhWriteHeader(fh, &written));
            EXPECT_EQ(1024, positionOf(fh));
        }
        sqloclose(fh);
        return rc;
    }
};

TEST_F(Headers, EveryVersionIsReadByItsOwnRulesAndWrittenInTheCurrentForm)
{
    const struct {
        const char* checksum;
        unsigned int version, offset3;
        std::string tail;
        const char *writtenChecksum, *written; // after number 15
    } rows[] = {
        // clang-format off
        {"83CB7C76", 9010300, 0, current, "83CB7C76", "20260102030405:0000CAFE:"}, // of 92 bytes
        {"83CBB78B", 9010300, 0, "A0000015:20260102030405:        :", "83CBB78B",
         "20260102030405:00000103:"},
        {"83DA968A", 10000000, 0, current, "83CB7C76", "20260102030405:0000CAFE:"},
        {"8338391A", 8010000, 0, current, "83CB7C76", "20260102030405:0000CAFE:"},
        {"8338F3E4", 8010000, 0, current, "83CB7C76", "20260102030405:0000CAFE:"}, // of 88
        {"B30AF4F9", 8009999, 0, current, "83CB7C76", "20260102030405:0000CAFE:"}, // of 72
        {"B31BD35E", 7020200, 0, "A0000015:-0000CAFE:", "93D97B74", "              :0000CAFE:"},
        {"933BD35E", 7020200, 0, "A0000015:-        :", "93D9B089", // of 88
         "              :00000103:"},
        {"B31B19AF", 7020199, 0, "A0000015:0000CAFE:", "82C97A74", "00000101000000:0000CAFE:"},
        {"B32B7966", 6010000, 0, "A0000015:        :", "82C9B189", // of 88
         "00000101000000:00000103:"},
        {"B32BB798", 6010000, 1024, "a0000015:0000cafe:", "85C97C77", "20070101120000:0000CAFE:"},
        {"132BB792", 6009999, 1024, "0000CAFE:", "85C97C65", "20070101120000:0000CAFE:"},
        {"133C80A0", 5000000, 1792, "        :", "93D9B79B", "              :00000103:"},
        {"133C465D", 5000000, 2560, "0000CAFE:", "84C96174", "2007          :0000CAFE:"},
        // clang-format on
    };
    const std::string entries = commandEntry(0, "20070101120000001") + commandEntry(0) +
                                commandEntry(0, "2007") + commandEntry(259, "2008");
    for (const auto& row : rows) {
        SCOPED_TRACE(std::to_string(row.version) + " " + row.tail);
        const std::string text = textOf(row.checksum, row.version, row.offset3, row.tail);
        ASSERT_EQ(0, read(text + entries));
        EXPECT_EQ(row.version < 7020200 ? 9010300 : row.version, header.version);
        const std::string number15 = row.version < 6010000 ? "A0000007:" : "A0000015:";
        EXPECT_EQ(textOf(row.writtenChecksum, 9010300, row.offset3, number15 + row.written) +
                      entries,
                  slurp(historyPath));
    }
    EXPECT_EQ("", joined(takeLog()));
}

TEST_F(Headers, DamageIsRefused)
{
    const std::string failed = "Administration message 8500 | Failed to read from history file.",
                      damaged = "rc = -2161 (0xFFFFF78F) | " + failed,
                      end = "rc = -2029060087 (0x870F0009) Bytes read: ",
                      partial = "Error reading history header: partial header found. " + end;
    const auto with = [](size_t at, const std::string& what) {
        return newHeader().replace(at, what.size(), what);
    };
    const struct {
        const char* name;
        std::string file;
        int rc;
        std::string log;
    } rows[] = {
        // clang-format off
        {"empty", "", END_OF_FILE, ""},
        {"a part", newHeader().substr(0, 1023), -2161, partial + "1023 [1024 bytes] | " + failed},
        {"entry count", with(67, "1"), -2161, damaged},
        {"as of 72 bytes", textOf("B30AF4E6", 8010000, 0, current), -2161, damaged},
        {"as of 92 bytes", textOf("83291EA2", 7020200, 0, current), -2161, damaged},
        {"zero byte in field 1", with(3, std::string(1, '\0')), -2161, damaged},
        {"all zero bytes", std::string(1024, '\0'), 0, ""},
        {"behind field 17", with(176, "x"), 0, ""},
        {"scan meets damage", with(167, "        ") + "xyz", -2161,
         "Error reading history entry: partial entry found. " + end + "3 [512 bytes] | Error "
         "reading history entry at file offset 1024. | Administration message 8500 |  [History "
         "File Entry: 2107648 bytes] | -2161 (0xFFFFF78F) | " + failed},
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
    std::map<std::string, int> open;
    std::ifstream in(trace);
    for (std::string record, stamp, process, function, event; std::getline(in, record);) {
        std::istringstream(record) >> stamp >> process >> function >> event;
        open[function] += event == "entry" ? 1 : event == "exit" ? -1 : 0;
    }
    for (const auto& [function, times] : open)
        EXPECT_EQ(0, times) << function;
    EXPECT_EQ(22u, open.size());
}
