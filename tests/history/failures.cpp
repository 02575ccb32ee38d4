// What each function does when a call of the OS-services layer fails.

#include <functional>
#include <sstream>

#include "faults.h"
#include "records.h"

namespace
{
struct target {
    char* directory;
    char* path;      // of the history file, which has two entries
    SQLO_FHANDLE fh; // at its first entry
    SQLUH_HANDLE* handle;
    std::ostringstream left; // what the function left behind
};

struct failure {
    std::vector<faultPlan> faults; // each of them leads to what follows
    int rc;
    std::string log, left;
};

struct failingFunction {
    std::function<int(target&)> run;
    std::vector<failure> failures;
};

// clang-format off
const std::string f = "rc = -99 (0xFFFFFF9D)", mapped = "-4242 (0xFFFFEF6E)", none,
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

int readHeader(target& t)
{
    SQLUH_HEADER read;
    return sqluhReadHeader(t.fh, &read);
}

// A header of version 5 million: field 17 is looked for in the entries, the timestamp at offset3.
int readOldHeader(target& t)
{
    std::string text = "4F4C4F40:0000000000000000:0000000000000000:0000000000000400:00000000:"
                       "00000000:00000000:00000001:00000000:00000000:00000000:00000000: :05000000:";
    std::string image(92, '\0');
    image.replace(24, 2, std::string("\0\4", 2)).replace(52, 1, "\1").replace(70, 1, " ");
    image.replace(32, 3, "\x40\x4B\x4C");
    spill(t.path, padded(text.replace(0, 8, hex8(byteSum(image))), 1024) + commandEntry(0));
    return readHeader(t);
}

const failingFunction functions[] = {
    // clang-format off
    {[](target& t) { SQLUH_HEADER written = {}; return sqluhWriteHeader(t.fh, &written); }, {
        {{{osAllocate}, {osSeek}}, failed, f, "at 1024"},
        {{{osWrite, 1, failed, 9}}, mappedCode, f, "at 9"},
        {{{osWrite, 1, DISK_FULL}}, mappedCode, full, "at 0"},
        {{{osWrite, 1, 0, 1023}}, -2161, "rc = " + damaged, "at 1023"}}},
    {readHeader, {
        {{{osAllocate}, {osSeek}}, failed, f + header, "at 1024"},
        {{{osRead, 1, failed, 7}}, mappedCode, "Error reading history header. " + f +
         " Bytes read: 7 [1024 bytes] | " + mapped + header, "at 7"},
        {{{osRead, 1, 0, 1023}}, -2161, "Error reading history header: partial header found. "
         "rc = 0 (0x00000000) Bytes read: 1023 [1024 bytes]" + header, "at 1023"},
        {{{osRead, 1, END_OF_FILE, 1024}}, END_OF_FILE, none, "at 1024"}}},
    // The scan for field 17: rewind, a position query for each of two reads, rewind; then offset3.
    {readOldHeader, {
        {{{osSeek, 2}, {osAllocate, 2}}, -2161, f + " | " + damaged + header, "at 1024"},
        {{{osSeek, 6}, {osAllocate, 3}}, failed, f + header, "at 1024"},
        {{{osRead, 5, END_OF_FILE}}, END_OF_FILE, end, "at 1024"},
        {{{osSeek, 11}}, failed, f + header, "at 1792"}}},
    {[](target& t) { uint32_t longest = 77; int rc = sqluhFindMaxCommandLen(t.fh, &longest);
                     t.left << "longest " << longest << " "; return rc; }, {
        {{{osSeek}, {osAllocate}}, failed, f, "longest 0 at 1024"},
        {{{osRead, 4, failed, 3}}, mappedCode, body + "3 [3 bytes] | " + mapped + at1795 + dumpAll,
         "longest 2 at 1024"},
        {{{osSeek, 5}}, failed, f, "longest 2 at 2563"}}},
    {[](target& t) { entryReader r(16, 0, 512); int rc = r.read(t.fh);
                     t.left << "area " << r.workArea.size << " "; return rc; }, {
        {{{osRead, 1, failed, 5}}, mappedCode, "Error reading history entry. " + f +
         " Bytes read: 5 [512 bytes] | " + mapped + at1024 + dump512, "area 512 at 1029"},
        {{{osRead, 1, END_OF_FILE, 512}}, END_OF_FILE, none, "area 512 at 1536"},
        {{{osRead, 1, 0, 511}}, -2161, partial + "rc = 0 (0x00000000) Bytes read: 511 [512 bytes]"
         + at1024 + dump512, "area 512 at 1535"},
        {{{osReallocate}}, failed, f + at1024 + dump512, "area 512 at 1536"},
        {{{osRead, 2, failed, 4}}, mappedCode, body + "4 [4 bytes] | " + mapped + at1024 + dump771,
         "area 771 at 1540"},
        {{{osRead, 2, END_OF_FILE, 259}}, END_OF_FILE, none, "area 771 at 1795"},
        {{{osRead, 2, 0, 258}}, -2161, "Error reading history entry body: partial body found. "
         "rc = 0 (0x00000000) Bytes read: 258 [258 bytes]" + at1024 + dump771,
         "area 771 at 1794"}}},
    {[](target& t) { entryBuilder b; t.handle->header.entryCount = 10;
                     int rc = sqluhWriteEntry(t.handle, b.build());
                     t.left << t.handle->replayArea.numReplayEntries << " recorded, disabled "
                            << +t.handle->replayArea.replayDisabled << " "; return rc; }, {
        {{{}}, 0, none, "1 recorded, disabled 0 at 1792"},
        {{{osAllocate}, {osSeek}}, failed, f, "0 recorded, disabled 0 at 1024"},
        {{{osWrite, 1, failed, 9}}, mappedCode, f, "0 recorded, disabled 0 at 1033"},
        {{{osWrite, 1, DISK_FULL}}, mappedCode, full, "0 recorded, disabled 0 at 1024"},
        {{{osWrite, 1, 0, 767}}, mappedCode, none, "0 recorded, disabled 0 at 1791"},
        {{{osAllocate, 2}}, 0, none, "0 recorded, disabled 1 at 1792"}}}, // no memory for replay
    {[](target& t) {
        unlink(t.path); int rc = sqluhCreate(t.directory);
        t.left << slurp(t.path).size() << " " << ossPathExists(t.handle->shadowPath) << " closed "
               << faults.calls[osClose] << " "; return rc; }, {
        {{{osOpen}}, failed, f, "0 0 closed 0 at 1024"},
        {{{osOpen, 1, sqloFileExisted}}, 0, none, "1024 1 closed 1 at 1024"},
        {{{osOpen, 1, 5}}, 5, "rc = 5 (0x00000005)", "0 0 closed 0 at 1024"},
        {{{osWrite, 1, failed, 3}}, mappedCode, f + " | rc = " + mapped, "3 0 closed 1 at 1024"},
        {{{osClose}}, failed, f, "1024 1 closed 1 at 1024"},
        {{{osCopy}}, failed, f, "1024 0 closed 1 at 1024"}}},
    {[](target& t) { int rc = sqluhVerifyUnopenedHistoryFile(t.path, &t.handle->workArea);
                     t.left << "closed " << faults.calls[osClose] << " "; return rc; }, {
        {{{osOpen}}, failed, f, "closed 0 at 1024"},
        {{{osRead, 1, END_OF_FILE}}, END_OF_FILE, end, "closed 1 at 1024"},
        {{{osRead, 4, END_OF_FILE, 3}}, -2161, partial + end + " Bytes read: 3 [512 bytes]" +
         at1795 + dumpAll + " | " + damaged + " | Error encountered in verifying the file: PATH " +
         damaged, "closed 1 at 1024"},
        {{{osClose}}, failed, none, "closed 1 at 1024"}}},
    {[](target& t) { return sqluh_verify_history_files(t.handle); }, {
        {{{}}, 0, none, "at 2563"},
        {{{osRead, 2, failed}}, mappedCode, body + "0 [0 bytes] | " + mapped + at1024 + dumpAll +
         " | " + mapped + " | Error encountered in verifying the history file. " + mapped,
         "at 1536"}}},
    {[](target& t) { return sqluhVerifyCurrentEntry(t.fh, &t.handle->workArea); }, {
        {{{}}, 0, none, "at 1024"},
        {{{osSeek}}, failed, f, "at 1024"},
        {{{osRead, 1, END_OF_FILE, 9}}, -2161, partial + end + " Bytes read: 9 [512 bytes]" +
         at1024 + dumpAll + " | " + damaged, "at 1024"},
        {{{osRead, 1, END_OF_FILE}}, END_OF_FILE, none, "at 1024"},
        {{{osSeek, 3}}, failed, f, "at 1795"}}},
    {[](target& t) { return sqluhVerifySeekOffsetNotPastEOF(t.fh, 2563); }, {
        {{{}, {osSeek, 2}}, 0, none, "at 1024"},
        {{{osSeek}}, failed, f, "at 1024"},
        {{{osSeek, 3}}, failed, f, "at 2563"}}},
    {[](target& t) { return sqluhVerifySeekOffsetNotPastEOF(t.fh, 2564); }, {
        {{{}}, END_OF_FILE, none, "at 1024"}}},
    {[](target& t) {
        SQLUH_HANDLE* made = t.handle; int rc = sqluhHandleAllocAndInit(t.directory, &made);
        if (made != nullptr)
            t.left << made->workArea.size << ", fd " << made->fileHandle.descriptor << ", room "
                   << made->replayArea.maxReplayEntries << ", disabled "
                   << +made->replayArea.replayDisabled << " ";
        sqluhHandleFree(&made); return rc; }, {
        {{{}}, 0, none, "2107648, fd -1, room 10, disabled 0 at 1024"},
        {{{osAllocate}, {osAllocate, 2}}, failed, f, "at 1024"},
        {{{osAllocate, 3}}, 0, none, "2107648, fd -1, room 0, disabled 1 at 1024"}}},
    // clang-format on
};
} // namespace

class Failures : public HistoryTest
{
  protected:
    void run(const failingFunction& function, const failure& row, const faultPlan& fault)
    {
        spill(historyPath, newHeader() + commandEntry(2) + commandEntry(0));
        unlink(shadowPath.c_str());
        target t = {directory.data(), historyPath.data(), open(), nullptr, {}};
        ASSERT_EQ(0, sqluhHandleAllocAndInit(t.directory, &t.handle));
        t.handle->fileHandle = t.fh;
        ASSERT_EQ(0, sqloseek(t.fh, 1024, sqloFromStart, nullptr));
        armFault(fault);
        EXPECT_EQ(row.rc, function.run(t));
        EXPECT_EQ(row.rc == mappedCode ? fault.code : 0, faults.lastMapped);
        armFault({});
        t.left << "at " << positionOf(t.fh);
        EXPECT_EQ(row.left, t.left.str());
        std::string log = row.log;
        if (size_t at = log.find("PATH"); at != std::string::npos)
            log.replace(at, 4, historyPath);
        EXPECT_EQ(log, joined(takeLog()));
        sqluhHandleFree(&t.handle);
        EXPECT_EQ(nullptr, t.handle);
        sqloclose(t.fh);
    }
};

TEST_F(Failures, EachIsReportedOnceAndLeavesWhatItShould)
{
    for (const failingFunction& function : functions)
        for (const failure& row : function.failures)
            for (const faultPlan& fault : row.faults) {
                SCOPED_TRACE(std::to_string(&function - functions) + ": call " +
                             std::to_string(fault.call) + " at " + std::to_string(fault.at));
                run(function, row, fault);
            }
}

TEST_F(Failures, PathsOfAHandleAreWhollyKeptOrRefused)
{
    SQLUH_HANDLE* handle = nullptr;
    std::string longest = std::string(1010, 'd') + "/";
    ASSERT_EQ(0, sqluhHandleAllocAndInit(longest.data(), &handle));
    EXPECT_EQ(longest, handle->directory);
    EXPECT_EQ(longest + "zq3rhist.asc", handle->historyPath);
    EXPECT_EQ(longest + "zq3rhist.bak", handle->shadowPath);
    sqluhHandleFree(&handle);
    longest += "/";
    EXPECT_EQ(sqluhPathTooLong, sqluhHandleAllocAndInit(longest.data(), &handle));
    EXPECT_EQ(nullptr, handle);
}
