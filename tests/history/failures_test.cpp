// What each function does when a call of the OS-services layer fails.

#include "directory/fixture.h"
#include "records.h"

namespace
{
// clang-format off
enum osCall {
    osNone, osOpen, osClose, osRead, osWrite, osSeek, osCopy, osAllocate, osReallocate, osCallCount
};
// clang-format on

constexpr int failed = -99, mappedCode = -4242;

struct faultPlan {
    osCall call = osNone;     // what fails
    int at = 1;               // at which of its calls, counted from 1
    int code = failed;        // what it returns
    uint32_t transferred = 0; // bytes that a failing read or write still moves
};

faultPlan fault;
int calls[osCallCount];
int lastMapped; // given to sqlzGetZRCInfo, which returns mappedCode while a fault is armed

void arm(const faultPlan& plan)
{
    static const char* const names[osCallCount] = {
        "",         "sqloopenp",   "sqloclose",
        "sqloread", "sqlowrite",   "sqloseek",
        "sqlocopy", "sqlogmblkEx", "sqloMemBlockReallocate"};
    fault = plan;
    memset(calls, 0, sizeof calls);
    lastMapped = 0;
    movedByFailure = plan.transferred;
    onCall = [](const std::string& call, int) {
        const int which = static_cast<int>(std::ranges::find(names, call) - names);
        const bool isDue =
            which != osCallCount && ++calls[which] == fault.at && fault.call == which;
        return !isDue ? 0 : fault.code == 0 ? onlyShort : fault.code;
    };
}
} // namespace

extern "C" int sqlzGetZRCInfo(int code)
{
    lastMapped = code;
    static const auto real = realOf(&sqlzGetZRCInfo, "sqlzGetZRCInfo");
    return fault.call != osNone ? mappedCode : real(code);
}

struct failure {
    std::vector<faultPlan> faults; // each of them leads to what follows
    int rc;
    std::string log, left;  // left: what the operation left behind, and the file's position
    std::string under = ""; // what the log names before the operation, or in its place
};

// clang-format off
static const std::string f = "rc = -99 (0xFFFFFF9D)", mapped = "-4242 (0xFFFFEF6E)", none,
    damaged = "-2161 (0xFFFFF78F)", end = "rc = -2029060087 (0x870F0009)",
    full = "rc = -2062614516 (0x850F000C) | Administration message 8501",
    header = " | Administration message 8500 | Failed to read from history file.",
    at1024 = " | Error reading history entry at file offset 1024. | Administration message 8500 | ",
    at1795 = " | Error reading history entry at file offset 1795. | Administration message 8500 | ",
    dump512 = " [History File Entry: 512 bytes]", dump771 = " [History File Entry: 771 bytes]",
    dumpAll = " [History File Entry: 2107648 bytes]",
    partial = "Error reading history entry: partial entry found. ",
    body = "Error reading history entry body. " + f + " Bytes read: ";
// clang-format on

class Failures : public HistoryTest
{
  protected:
    SQLO_FHANDLE fh = sqloNoFile; // at the first of two entries
    SQLUH_HANDLE* handle = nullptr;
    std::ostringstream left;

    int writeHeader()
    {
        SQLUH_HEADER written = {};
        return sqluhWriteHeader(fh, &written);
    }

    int readHeader()
    {
        SQLUH_HEADER read;
        return sqluhReadHeader(fh, &read);
    }

    // A header of version 5 million: field 17 is looked for in the entries, the timestamp at
    // offset3.
    int readOldHeader()
    {
        spill(historyPath,
              headerOf("006C4F41:0000000000000000:0000000000000000:0000000000000400:00000000:"
                       "00000000:00000000:00000001:00000000:00000000:00000000:00000000: :"
                       "05000000:") +
                  commandEntry(0));
        return readHeader();
    }

    int findMaxCommandLength()
    {
        uint32_t longest = 77;
        int rc = sqluhFindMaxCommandLen(fh, &longest);
        left << "longest " << longest << " ";
        return rc;
    }

    int readEntry()
    {
        entryReader r(16, 0, 512);
        int rc = r.read(fh);
        left << "area " << r.workArea.size << " ";
        return rc;
    }

    int writeEntry()
    {
        entryBuilder b;
        handle->header.entryCount = 10;
        int rc = sqluhWriteEntry(handle, b.build());
        left << handle->replayArea.numReplayEntries << " recorded, disabled "
             << +handle->replayArea.replayDisabled << " ";
        return rc;
    }

    int create()
    {
        unlink(historyPath.c_str());
        int rc = sqluhCreate(directory.data());
        left << slurp(historyPath).size() << " " << ossPathExists(handle->shadowPath) << " closed "
             << calls[osClose] << " ";
        return rc;
    }

    int verifyUnopened()
    {
        int rc = sqluhVerifyUnopenedHistoryFile(historyPath.data(), &handle->workArea);
        left << "closed " << calls[osClose] << " ";
        return rc;
    }

    int seekPastEnd()
    {
        left << sqluhVerifySeekOffsetNotPastEOF(fh, 2563) << " ";
        return sqluhVerifySeekOffsetNotPastEOF(fh, 2564);
    }

    int makeHandle()
    {
        sqluhHandleFree(&handle);
        int rc = sqluhHandleAllocAndInit(directory.data(), &handle);
        if (handle != nullptr)
            left << handle->workArea.size << ", fd " << handle->fileHandle.descriptor << ", room "
                 << handle->replayArea.maxReplayEntries << ", disabled "
                 << +handle->replayArea.replayDisabled << " ";
        return rc;
    }

    // Lets one call of the operation fail, on a directory made anew, and compares all that is seen.
    void check(const std::string& names, const std::function<int()>& run, const faultPlan& plan,
               const failure& expected)
    {
        SCOPED_TRACE(names + ": call " + std::to_string(plan.call) + " at " +
                     std::to_string(plan.at));
        spill(historyPath, newHeader() + commandEntry(2) + commandEntry(0));
        unlink(shadowPath.c_str());
        ASSERT_EQ(0, sqluhHandleAllocAndInit(directory.data(), &handle));
        handle->fileHandle = fh = open();
        ASSERT_EQ(0, sqloseek(fh, 1024, sqloFromStart, nullptr));
        left.str("");
        arm(plan);
        EXPECT_EQ(expected.rc, run());
        EXPECT_EQ(expected.rc == mappedCode ? plan.code : 0, lastMapped);
        arm({});
        left << "at " << positionOf(fh);
        EXPECT_EQ(expected.left, left.str());
        EXPECT_EQ(expected.log, joined(takeLog()));
        EXPECT_EQ(expected.log.empty()     ? ""
                  : expected.under.empty() ? names
                                           : expected.under,
                  joined(namedOperations));
        sqluhHandleFree(&handle);
        EXPECT_EQ(nullptr, handle);
        sqloclose(fh);
    }

    void expect(const std::string& names, const std::function<int()>& run,
                const std::vector<failure>& failures)
    {
        for (const failure& row : failures)
            for (const faultPlan& plan : row.faults)
                ASSERT_NO_FATAL_FAILURE(check(names, run, plan, row));
    }
};

// clang-format off
TEST_F(Failures, HeadersAreWrittenOrNot)
{
    expect("sqluhWriteHeader", [&] { return writeHeader(); }, {
        {{{osAllocate}, {osSeek}}, failed, f, "at 1024"},
        {{{osWrite, 1, failed, 9}}, mappedCode, f, "at 9"},
        {{{osWrite, 1, DISK_FULL}}, mappedCode, full, "at 0"},
        {{{osWrite, 1, 0, 1023}}, -2161, "rc = " + damaged, "at 1023"}});
}

TEST_F(Failures, HeadersAreReadOrNot)
{
    expect("sqluhReadHeader", [&] { return readHeader(); }, {
        {{{osAllocate}, {osSeek}}, failed, f + header, "at 1024"},
        {{{osRead, 1, failed, 7}}, mappedCode, "Error reading history header. " + f +
         " Bytes read: 7 [1024 bytes] | " + mapped + header, "at 7"},
        {{{osRead, 1, 0, 1023}}, -2161, "Error reading history header: partial header found. "
         "rc = 0 (0x00000000) Bytes read: 1023 [1024 bytes]" + header, "at 1023"},
        {{{osRead, 1, END_OF_FILE, 1024}}, END_OF_FILE, none, "at 1024"}});
}

TEST_F(Failures, OlderHeadersAreReadOrNot)
{
    // Rewind, a position query for each of two reads, rewind; then offset3.
    expect("sqluhReadHeader", [&] { return readOldHeader(); }, {
        {{{osSeek, 2}, {osAllocate, 2}}, -2161, f + " | " + damaged + header, "at 1024",
         "sqluhFindMaxCommandLen | sqluhReadHeader"},
        {{{osSeek, 6}, {osAllocate, 3}}, failed, f + header, "at 1024"},
        {{{osRead, 5, END_OF_FILE}}, END_OF_FILE, end, "at 1024"},
        {{{osSeek, 8}}, failed, f + header, "at 1792"}});
}

TEST_F(Failures, TheLongestCommandIsFoundOrNot)
{
    expect("sqluhFindMaxCommandLen", [&] { return findMaxCommandLength(); }, {
        {{{osSeek}, {osAllocate}}, failed, f, "longest 0 at 1024"},
        {{{osRead, 4, failed, 3}}, mappedCode, body + "3 [3 bytes] | " + mapped + at1795 +
         dumpAll, "longest 2 at 1024", "sqluhReadEntry"},
        {{{osSeek, 5}}, failed, f, "longest 2 at 2563"}});
}

TEST_F(Failures, EntriesAreReadOrNot)
{
    expect("sqluhReadEntry", [&] { return readEntry(); }, {
        {{{osRead, 1, failed, 5}}, mappedCode, "Error reading history entry. " + f +
         " Bytes read: 5 [512 bytes] | " + mapped + at1024 + dump512, "area 512 at 1029"},
        {{{osRead, 1, END_OF_FILE, 512}}, END_OF_FILE, none, "area 512 at 1536"},
        {{{osReallocate}}, failed, f + at1024 + dump512, "area 512 at 1536"},
        {{{osRead, 2, failed, 4}}, mappedCode, body + "4 [4 bytes] | " + mapped + at1024 +
         dump771, "area 771 at 1540"},
        {{{osRead, 2, END_OF_FILE, 259}}, END_OF_FILE, none, "area 771 at 1795"},
        {{{osRead, 2, 0, 258}}, -2161, "Error reading history entry body: partial body found. "
         "rc = 0 (0x00000000) Bytes read: 258 [258 bytes]" + at1024 + dump771,
         "area 771 at 1794"}});
}

TEST_F(Failures, EntriesAreWrittenOrNot)
{
    expect("sqluhWriteEntry", [&] { return writeEntry(); }, {
        {{{}}, 0, none, "1 recorded, disabled 0 at 1792"},
        {{{osAllocate}, {osSeek}}, failed, f, "0 recorded, disabled 0 at 1024"},
        {{{osWrite, 1, failed, 9}}, mappedCode, f, "0 recorded, disabled 0 at 1033"},
        {{{osWrite, 1, DISK_FULL}}, mappedCode, full, "0 recorded, disabled 0 at 1024"},
        {{{osWrite, 1, 0, 767}}, mappedCode, none, "0 recorded, disabled 0 at 1791"},
        {{{osAllocate, 2}}, 0, none, "0 recorded, disabled 1 at 1792"}});
}

TEST_F(Failures, PairsAreCreatedOrNot)
{
    expect("sqluhCreate", [&] { return create(); }, {
        {{{osOpen}}, failed, f, "0 0 closed 0 at 1024"},
        {{{osOpen, 1, sqloFileExisted}}, 0, none, "1024 1 closed 1 at 1024"},
        {{{osOpen, 1, 5}}, 5, "rc = 5 (0x00000005)", "0 0 closed 0 at 1024"},
        {{{osWrite, 1, failed}}, mappedCode, f + " | rc = " + mapped, "0 0 closed 1 at 1024",
         "sqluhWriteHeader | sqluhCreate"},
        {{{osClose}}, failed, f, "1024 1 closed 1 at 1024"},
        {{{osCopy}}, failed, f, "1024 0 closed 1 at 1024"}});
}

TEST_F(Failures, FilesAreVerifiedOrNot)
{
    expect("sqluhVerifyUnopenedHistoryFile", [&] { return verifyUnopened(); }, {
        {{{osOpen}}, failed, f, "closed 0 at 1024"},
        {{{osRead, 1, END_OF_FILE}}, END_OF_FILE, end, "closed 1 at 1024"},
        {{{osRead, 4, END_OF_FILE, 3}}, -2161, partial + end + " Bytes read: 3 [512 bytes]" +
         at1795 + dumpAll + " | " + damaged + " | Error encountered in verifying the file: " +
         historyPath + " " + damaged, "closed 1 at 1024",
         "sqluhReadEntry | sqluhVerifyOneEntry | sqluhVerifyUnopenedHistoryFile"},
        {{{osClose}}, failed, none, "closed 1 at 1024"}});
    expect("sqluh_verify_history_files", [&] { return sqluh_verify_history_files(handle); }, {
        {{{osRead, 2, failed}}, mappedCode, body + "0 [0 bytes] | " + mapped + at1024 +
         dumpAll + " | " + mapped + " | Error encountered in verifying the history file. " +
         mapped, "at 1536",
         "sqluhReadEntry | sqluhVerifyOneEntry | sqluh_verify_history_files"}});
    const auto verifyCurrent = [&] { return sqluhVerifyCurrentEntry(fh, &handle->workArea); };
    expect("sqluhVerifyCurrentEntry", verifyCurrent, {
        {{{osSeek}}, failed, f, "at 1024"},
        {{{osRead, 1, END_OF_FILE, 9}}, -2161, partial + end + " Bytes read: 9 [512 bytes]" +
         at1024 + dumpAll + " | " + damaged, "at 1024", "sqluhReadEntry | sqluhVerifyOneEntry"},
        {{{osRead, 1, END_OF_FILE}}, END_OF_FILE, none, "at 1024"},
        {{{osSeek, 3}}, failed, f, "at 1795"}});
}

TEST_F(Failures, PositionsAreVerifiedOrNot)
{
    expect("sqluhVerifySeekOffsetNotPastEOF", [&] { return seekPastEnd(); }, {
        {{{}, {osSeek, 2}}, END_OF_FILE, none, "0 at 1024"},
        {{{osSeek}}, END_OF_FILE, f, "-99 at 1024"},
        {{{osSeek, 6}}, failed, f, "0 at 2563"}});
}

TEST_F(Failures, HandlesAreMadeOrNot)
{
    expect("sqluhHandleAllocAndInit", [&] { return makeHandle(); }, {
        {{{}}, 0, none, "2107648, fd -1, room 10, disabled 0 at 1024"},
        {{{osAllocate}, {osAllocate, 2}}, failed, f, "at 1024"},
        {{{osAllocate, 3}}, 0, none, "2107648, fd -1, room 0, disabled 1 at 1024"}});
}
// clang-format on
