// The OS-services layer: files against a naive model, copies and moves under a log of the system
// calls, memory, records. Every test has a directory of its own.
#include "directory/fixture.h"

#include <cstdarg>
#include <random>

#include <fcntl.h>
#include <sys/resource.h>
#include <syslog.h>

#include "sqo/sqlpd.h"

static constexpr int failed = sqloSystemError; // or-ed with an errno

// Bytes without a short period, so that a piece at the wrong offset shows.
static std::string pattern(size_t length, unsigned int seed)
{
    std::string bytes(length, '\0');
    for (char& byte : bytes)
        byte = static_cast<char>((seed = seed * 1103515245 + 12345) >> 16);
    return bytes;
}

struct osse : HistoryTest {
    const std::string file = directory + "file", source = directory + "source";
    SQLO_FHANDLE fh = sqloNoFile;
    char byte = 0;
    uint32_t done = 0; // bytes of the last read or write
    // The system calls made that change a file or wait for it, and the one of them to fail. Errors
    // of the others.
    std::string calls;
    int untilFailure = -1, failure = 0, untilReadError = -1;
    std::map<std::string, int> errors = {{"open", 0},   {"close", 0},  {"status", 0},
                                         {"rename", 0}, {"unlink", 0}, {"mark", 0}};

    // Writes come out short, so that whoever calls must finish them.
    osse()
    {
        unsetenv("ZQ3SYNC");
        longestWrite = 2000;
        onSystemCall = [this](const std::string& call) {
            if (call == "read")
                return untilReadError-- == 0 ? EIO : 0;
            if (errors.contains(call))
                return errors[call];
            calls += call + "; ";
            return untilFailure-- == 0 ? failure : 0;
        };
    }
    ~osse() override
    {
        onSystemCall = nullptr;
    }
};

TEST_F(osse, OpenWordsCreateTruncateAndRefuse)
{
    const struct {
        unsigned int word;
        int onMissing;
        const char* keeps; // what is left of an existing "old"
        int read, write;
    } rows[] = {{0x14, failed | ENOENT, "old", 0, failed | EBADF},
                {0x0C, failed | ENOENT, "old", 0, 0},
                {0x4C, failed | ENOENT, "old", 0, 0},
                {0x19, 0, "old", failed | EBADF, 0},
                {0x5A, 0, "", END_OF_FILE, 0},
                {0x0F, 0, "old", 0, 0}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.word);
        std::filesystem::remove(file);
        calls.clear();
        EXPECT_EQ(sqloopenp(file.c_str(), row.word, 0640, &fh), row.onMissing);
        EXPECT_EQ(calls.ends_with("sync directory; "), row.onMissing == 0);
        EXPECT_EQ(sqloclose(fh), row.onMissing == 0 ? 0 : failed | EBADF);
        spill(file, "old");
        EXPECT_EQ(sqloopenp(file.c_str(), row.word, 0640, &fh), 0);
        EXPECT_TRUE(fcntl(fh.descriptor, F_GETFD) & FD_CLOEXEC);
        EXPECT_EQ(slurp(file), row.keeps);
        EXPECT_EQ(sqloread(fh, &byte, 1, &done), row.read);
        EXPECT_EQ(sqlowrite(fh, "x", 1, &done), row.write);
        EXPECT_EQ(sqloclose(fh), 0);
        const int closed[] = {sqloread(fh, &byte, 1, &done), sqlowrite(fh, "x", 1, &done),
                              sqloseek(fh, 0, sqloFromCurrent, nullptr), sqlosync(fh)};
        for (const int rc : closed)
            EXPECT_EQ(rc, failed | EBADF);
    }
    for (const int error : {EIO, EINTR}) {
        EXPECT_EQ(sqloopenp(file.c_str(), 0x14, 0640, &fh), 0);
        EXPECT_EQ(sqloseek(fh, 0, 3, nullptr), failed | EINVAL);
        errors["close"] = error;
        EXPECT_EQ(sqloclose(fh), error == EINTR ? 0 : failed | error);
        errors["close"] = 0;
    }
    ASSERT_EQ(mkfifo(source.c_str(), 0600), 0);
    EXPECT_EQ(sqloopenp(file.c_str(), 0x15, 0640, &fh), failed | EINVAL);
    EXPECT_EQ(sqloopenp(source.c_str(), 0x14, 0640, &fh), failed | EINVAL);
    EXPECT_EQ(sqloopenp(directory.c_str(), 0x14, 0640, &fh), failed | EISDIR);
}

TEST_F(osse, ReadAheadIsInvisible)
{
    std::mt19937 random(1);
    const size_t sizes[] = {1, 512, 1400, 5000, 70000, 262144, 300000};
    std::string model = pattern(700000, 1);
    size_t at = 0;
    spill(file, model);
    ASSERT_EQ(sqloopenp(file.c_str(), 0x4C, 0640, &fh), 0);
    for (unsigned int step = 0; step < 5000; step++) {
        SCOPED_TRACE(step);
        const size_t kind = random() % 16, origin = random() % 3;
        std::string bytes(sizes[random() % 7], '\0');
        if (kind < 10) {
            const std::string expected = at < model.size() ? model.substr(at, bytes.size()) : "";
            ASSERT_EQ(sqloread(fh, bytes.data(), static_cast<uint32_t>(bytes.size()), &done),
                      expected.size() == bytes.size() ? 0 : END_OF_FILE);
            ASSERT_TRUE(bytes.substr(0, done) == expected);
            at += done;
        } else if (kind < 12) {
            bytes = pattern(1 + random() % 3000, step);
            ASSERT_EQ(sqlowrite(fh, bytes.data(), static_cast<uint32_t>(bytes.size()), &done), 0);
            model.resize(std::max(model.size(), at + bytes.size()));
            model.replace(at, bytes.size(), bytes);
            at += bytes.size();
        } else {
            const long long from[] = {0, static_cast<long long>(at),
                                      static_cast<long long>(model.size())};
            at = kind < 14 ? random() % (model.size() + 2000) : at / 4096 * 4096;
            const long long offset = static_cast<long long>(at) - from[origin];
            ASSERT_EQ(sqloseek(fh, offset, static_cast<unsigned int>(origin), nullptr), 0);
        }
    }
    // Leaving the buffer drops it: what another writer did in the meantime is seen on return.
    ASSERT_EQ(sqlochgfileptr(fh, 0, 0, nullptr) + sqloread(fh, &byte, 1, &done), 0);
    spill(file, model = pattern(700000, 2));
    for (long long offset : {650000, 0})
        ASSERT_EQ(sqlochgfileptr(fh, offset, 0, nullptr), 0);
    ASSERT_EQ(sqloread(fh, &byte, 1, &done), 0);
    EXPECT_EQ(byte, model[0]);
    EXPECT_EQ(sqlochgfileptr(fh, -1, 0, nullptr), failed | EINVAL);
    EXPECT_EQ(sqlochgfileptr(fh, INT64_MAX, 2, nullptr), failed | EINVAL);
    EXPECT_EQ(sqloclose(fh), 0);
    EXPECT_TRUE(slurp(file) == model);
}

TEST_F(osse, ResizedBlockKeepsItsBytesAndGainsZeros)
{
    void* block = nullptr;
    std::string model;
    // Across the border between small and large blocks, and inside a page that was used before.
    for (unsigned int size :
         {0u, 100u, 5000u, 1u << 20, 3u << 20, 1500001u, 1500100u, 200u, 2u << 20}) {
        ASSERT_EQ(sqloMemBlockReallocate(&block, size, sqloZeroFilled, "", 0), 0);
        model.resize(size, '\0');
        ASSERT_EQ(memcmp(block, model.data(), size), 0) << size;
        memset(block, 'x', size);
        model.assign(size, 'x');
    }
    EXPECT_EQ(sqloMemBlockReallocate(&block, SIZE_MAX, 0, "", 0), failed | ENOMEM);
    EXPECT_EQ(memcmp(block, model.data(), model.size()), 0);
    sqlofmblkEx(block);
}

static const std::string empty = "sync; sync directory; reserve ",
                         end = "sync all; write and wait for 8; ";

TEST_F(osse, CopyWritesTheFirstBytesLastAndAFailedOneLeavesNone)
{
    // And how each may fail: before the first write the target is kept, then nothing of it is left.
    const std::pair<std::string, std::vector<int>> steps[] = {
        {"sync; ", {EIO}},
        {"sync directory; ", {EIO}},
        {"reserve 2000; ", {ENOSPC, EOPNOTSUPP, EINTR}},
        {"truncate; ", {EIO}},
        {"write 1992 at 8; ", {EINTR, ENOSPC, EDQUOT, onlyShort}},
        {"sync all; ", {EIO}},
        {"write and wait for 8; ", {EINTR, onlyShort, EIO}}};
    const std::map<int, int> codes = {{EIO, failed | EIO}, {onlyShort, failed | EIO},
                                      {ENOSPC, DISK_FULL}, {EDQUOT, DISK_FULL},
                                      {EINTR, 0},          {EOPNOTSUPP, 0}};
    const std::string link = directory + "link", bytes = pattern(2000, 1);
    spill(file, "");
    std::filesystem::create_hard_link(file, link);
    for (size_t step = 0; step < std::size(steps); step++)
        for (const int error : steps[step].second) {
            const int rc = codes.at(error);
            std::string expected;
            for (size_t i = 0; i < std::size(steps) && (rc == 0 || i <= step); i++)
                expected += steps[i].first + (i == step && error == EINTR ? steps[i].first : "");
            expected += rc != 0 && step >= 4 ? "truncate; " : "";
            SCOPED_TRACE(expected);
            spill(source, bytes);
            spill(file, pattern(5000, 2));
            calls.clear();
            untilFailure = static_cast<int>(step);
            failure = error;
            EXPECT_EQ(sqlocopy(source.c_str(), file.c_str(), 0), rc);
            EXPECT_EQ(calls, expected);
            EXPECT_TRUE(slurp(file) == (rc == 0 ? bytes : step < 4 ? pattern(5000, 2) : ""));
            EXPECT_TRUE(slurp(link) == slurp(file)) << "the target's inode has changed";
            EXPECT_EQ(sqlocopy(link.c_str(), file.c_str(), 0), failed | EINVAL);
            EXPECT_EQ(sqlocopy(source.c_str(), file.c_str(), 1), failed | EINVAL);
        }
    for (const size_t size : {4000u, 8u}) {
        const std::string writes = size == 8 ? "" : "write 3992 at 8; write 1992 at 2008; ";
        spill(source, pattern(size, 1));
        calls.clear();
        EXPECT_EQ(sqlocopy(source.c_str(), file.c_str(), 0), 0);
        EXPECT_EQ(calls, empty + std::to_string(size) + "; truncate; " + writes + end);
        EXPECT_TRUE(slurp(file) == slurp(source));
    }
    // Nor does a source that cannot be read to its end cost the target anything.
    spill(source, pattern(600000, 3));
    spill(file, "kept");
    for (int read = 0; read < 3; read++) {
        untilReadError = read;
        EXPECT_EQ(sqlocopy(source.c_str(), file.c_str(), 0), failed | EIO);
        EXPECT_EQ(slurp(file), "kept");
    }
    for (const int error : {EIO, EINTR, ENOSPC}) {
        errors["close"] = error;
        EXPECT_EQ(sqlocopy(source.c_str(), file.c_str(), 0), error == EIO     ? failed | EIO
                                                             : error == EINTR ? 0
                                                                              : int{DISK_FULL});
        errors["close"] = 0;
        EXPECT_TRUE(slurp(file) == slurp(source));
    }
}

// A marked file can be written, moved, emptied and replaced, but is nobody's source.
TEST_F(osse, AMarkedFileIsRefusedUntilItIsWhole)
{
    const std::string bytes = pattern(5000, 1);
    for (const bool whole : {true, false}) {
        std::filesystem::remove(file);
        EXPECT_EQ(sqloopenp(file.c_str(), 0x5A, 0640, &fh), 0);
        EXPECT_EQ(sqlomark(fh), 0);
        EXPECT_EQ(sqlowrite(fh, bytes.data(), 5000, &done), 0);
        SQLO_FHANDLE second = sqloNoFile;
        for (const unsigned int word : {0x14u, 0x4Cu, 0x0Cu})
            EXPECT_EQ(sqloopenp(file.c_str(), word, 0640, &second), sqloFileIncomplete);
        EXPECT_EQ(sqlocopy(file.c_str(), source.c_str(), 0), sqloFileIncomplete);
        EXPECT_TRUE(slurp(file) == bytes);
        spill(source, "source of a copy");
        calls.clear();
        EXPECT_EQ(whole ? sqlounmark(fh) : sqlocopy(source.c_str(), file.c_str(), 0), 0);
        EXPECT_EQ(calls, whole ? "write 8 at 0; sync; sync all; write 8 at 0; "
                               : empty + "16; truncate; write 8 at 8; " + end);
        EXPECT_TRUE(slurp(file) == (whole ? bytes : "source of a copy"));
        EXPECT_EQ(sqloopenp(file.c_str(), 0x14, 0640, &second), 0);
        EXPECT_EQ(sqloclose(second) + sqloclose(fh), 0);
        EXPECT_EQ(sqlomark(fh), failed | EBADF);
        EXPECT_EQ(sqlounmark(fh), failed | EBADF);
    }
    // Nor is one that is made anew marked any more, or one that was refused while it was.
    EXPECT_EQ(sqloopenp(file.c_str(), 0x4C, 0640, &fh) + sqlomark(fh) + sqloclose(fh), 0);
    errors["open"] = EACCES;
    EXPECT_EQ(sqloopenp(file.c_str(), 0x14, 0640, &fh), failed | EACCES);
    errors["open"] = 0;
    EXPECT_EQ(sqloopenp(file.c_str(), 0x14, 0640, &fh), sqloFileIncomplete);
    calls.clear();
    EXPECT_EQ(sqloopenp(file.c_str(), 0x5A, 0640, &fh) + sqloclose(fh), 0);
    EXPECT_EQ(calls, "truncate; sync all; sync directory; ");
    EXPECT_EQ(sqloopenp(file.c_str(), 0x14, 0640, &fh) + sqloclose(fh), 0);
    EXPECT_EQ(slurp(file), "");
}

// What cannot be opened may be sound: it is neither moved nor, because of that, emptied.
TEST_F(osse, AFileThatCannotBeOpenedIsNotMovedNorEmptied)
{
    spill(file, "sound");
    spill(source, "new");
    errors["open"] = EMFILE;
    EXPECT_EQ(sqlomove(file.c_str(), (file + ".a").c_str()), failed | EMFILE);
    errors["open"] = 0;
    EXPECT_EQ(sqloopenp(file.c_str(), 0x5A, 0640, &fh), failed | EMFILE);
    EXPECT_EQ(sqlocopy(source.c_str(), file.c_str(), 0), failed | EMFILE);
    EXPECT_EQ(slurp(file), "sound");
    EXPECT_EQ(sqloopenp(file.c_str(), 0x14, 0640, &fh) + sqloclose(fh), 0);
    EXPECT_EQ(sqloreserve(source.c_str(), file.c_str()), 0);
    EXPECT_EQ(sqloreserve((source + "-").c_str(), file.c_str()), failed | ENOENT);
    EXPECT_EQ(sqloreserve(source.c_str(), (file + "-").c_str()), 0);
    EXPECT_EQ(slurp(file), "sound");
    EXPECT_EQ(sqloopenp(file.c_str(), 0x5A, 0640, &fh) + sqloclose(fh), 0);
    EXPECT_EQ(slurp(file), "");
}

TEST_F(osse, MoveKeepsAnOccupiedTargetUnderANumber)
{
    spill(file, "");
    for (const char* bytes : {"one", "two", "three"}) {
        spill(source, bytes);
        calls.clear();
        EXPECT_EQ(sqlomove(source.c_str(), file.c_str()), 0);
        EXPECT_EQ(calls, "sync directory; ");
    }
    EXPECT_EQ(sqlomove(source.c_str(), file.c_str()), failed | ENOENT);
    EXPECT_EQ(sqlomove(file.c_str(), file.c_str()), failed | EINVAL);
    EXPECT_EQ(slurp(file) + slurp(file + ".1") + slurp(file + ".2"), "threeonetwo");
    EXPECT_FALSE(ossPathExists((file + ".3").c_str()));
    // A name too long for a number stays; a directory is moved, and a file into it.
    const std::string longName = directory + std::string(254, 'n'), folder = directory + "folder";
    spill(longName, "kept");
    EXPECT_EQ(sqlomove(file.c_str(), longName.c_str()), failed | ENAMETOOLONG);
    EXPECT_EQ(slurp(longName) + slurp(file), "keptthree");
    EXPECT_EQ(sqlomove(file.c_str(), source.c_str()), failed | ENAMETOOLONG);
    EXPECT_EQ(sqloopenp(file.c_str(), 0x14, 0640, &fh) + sqloclose(fh), 0);
    std::filesystem::create_directory(source);
    EXPECT_EQ(sqlomove(source.c_str(), folder.c_str()), 0);
    calls.clear();
    EXPECT_EQ(sqlomove(file.c_str(), (folder + "/file").c_str()), 0);
    EXPECT_EQ(slurp(folder + "/file"), "three");
    EXPECT_EQ(sqlodelete((folder + "/file").c_str(), 1), failed | EINVAL);
    EXPECT_EQ(sqlodelete((folder + "/file").c_str(), 0), 0);
    EXPECT_EQ(calls, "sync directory; sync directory; sync directory; ");
    EXPECT_EQ(sqlodelete((folder + "/file").c_str(), 0), failed | ENOENT);
}

// In processes of their own, whose limits they reach.
TEST_F(osse, LimitsOfTheProcessAreTold)
{
    spill(file, "sound");
    // Without the three standard files nothing that is opened takes their numbers.
    EXPECT_EQ(0, waitFor(inChild([&] {
                  close(0);
                  close(2);
                  return sqloopenp(file.c_str(), 0x14, 0640, &fh) != 0 || fh.descriptor <= 2;
              })));
    EXPECT_EQ(0, waitFor(inChild([&] {
                  int rc = 0, opened = 0;
                  while (rc == 0 && opened++ < 5000)
                      rc = sqloopenp(file.c_str(), 0x14, 0640, &fh);
                  return rc != (failed | EMFILE);
              })));
    // A log that may not grow ends nobody.
    EXPECT_EQ(0, waitFor(inChild([&] {
                  const rlimit none = {0, RLIM_INFINITY};
                  const pdItem item = {pdKindText, "text", 0, nullptr, 0};
                  setrlimit(RLIMIT_FSIZE, &none);
                  pdLog("f", pdLevelError, &item, 1);
                  return 0;
              })));
#ifndef __SANITIZE_ADDRESS__
    // What may only not have been looked at for want of memory stays where it is.
    EXPECT_EQ(0, waitFor(inChild([&] {
                  rlimit before, none;
                  getrlimit(RLIMIT_AS, &before);
                  none = {0, before.rlim_max};
                  const std::string target = file + ".a";
                  const int noMemory = failed | ENOMEM;
                  void *small = nullptr, *large = nullptr, *never = nullptr;
                  int rc = sqloopenp(file.c_str(), 0x14, 0640, &fh);
                  rc |= sqlogmblkEx(nullptr, 1000, 0, &small, "", 0, 0);
                  rc |= sqlogmblkEx(nullptr, 2000000, 0, &large, "", 0, 0);
                  setrlimit(RLIMIT_AS, &none);
                  // Byte by byte, as freed blocks are kept by their size.
                  for (size_t size = 65536; size != 0; size -= size > 2048 ? size / 2 : 1) {
                      void* volatile block = &fh;
                      while (block != nullptr)
                          block = malloc(size);
                  }
                  const bool told =
                      rc == 0 && sqloread(fh, &byte, 1, &done) == 0 && byte == 's' &&
                      sqloopenp(file.c_str(), 0x14, 0640, &fh) == noMemory &&
                      sqlogmblkEx(nullptr, 1000, 0, &never, "", 0, 0) == noMemory &&
                      sqlogmblkEx(nullptr, 2000000, 0, &never, "", 0, 0) == noMemory &&
                      sqloMemBlockReallocate(&small, 2000000, 0, "", 0) == noMemory &&
                      sqloMemBlockReallocate(&large, 4000000, 0, "", 0) == noMemory &&
                      sqlomove(file.c_str(), target.c_str()) == noMemory &&
                      sqlocopy(file.c_str(), target.c_str(), 0) == noMemory;
                  setrlimit(RLIMIT_AS, &before);
                  return !told;
              })));
#endif
    EXPECT_EQ(slurp(file), "sound");
}

TEST_F(osse, SmallCallsRefuseWhatTheyDoNotKnow)
{
    ossFileInfo info = {};
    spill(file, "12345");
    for (const uint32_t version : {uint32_t{ossFileVersion}, 0u})
        for (const uint32_t level : {1u, 2u}) {
            const ossFileRequest request = {version, file.c_str(), 0, 0, level};
            EXPECT_EQ(ossFileGetInfoV9(&request, &info),
                      version != 0 && level == 1 ? 0 : failed | EINVAL);
        }
    EXPECT_EQ(info.size, 5u);
    EXPECT_EQ(sqlzGetZRCInfo(0), failed | EIO);
    EXPECT_EQ(sqlzGetZRCInfo(DISK_FULL), int{DISK_FULL});
}

// Takes the time and the process, which change, out of every record.
static std::string stable(const std::string& path)
{
    std::ifstream in(path);
    std::string log;
    for (std::string line; std::getline(in, line);) {
        int length = 0;
        sscanf(line.c_str(), "%*4d-%*2d-%*2d-%*2d.%*2d.%*2d.%*6d pid=%*d%n", &length);
        log.append(length == 0 ? "" : "*").append(line, static_cast<size_t>(length)).append("\n");
    }
    return log;
}

TEST_F(osse, RecordsOfSeveralProcessesNeverMix)
{
    const std::string bytes = "0123456789abcdef" + std::string(4990, '\x80');
    const pdItem items[] = {{pdKindText, "It failed:\nbadly.\x1B\n", 0, nullptr, 0},
                            {pdKindData, "Bytes", 0, bytes.data(), bytes.size()},
                            {pdKindCode, "rc = ", -2161, nullptr, 0},
                            {pdKindNumber, "", 1LL << 40, nullptr, 0}};
    for (int child = 0; child < 4; child++)
        inChild([&] {
            for (int i = 0; i < 50; i++)
                pdLog("f", pdLevelError, items, 4);
            return 0;
        });
    while (wait(nullptr) > 0) {
    }
    std::string record =
        "* level=Error function=f: It failed:\n    badly.\\x1B rc = -2161 (0xFFFFF78F) "
        "1099511627776\n    Bytes: 5006 bytes\n"
        "    0000  30 31 32 33 34 35 36 37 38 39 61 62 63 64 65 66  |0123456789abcdef|\n";
    for (unsigned int offset = 16; offset < 4096; offset += 16) {
        char dump[100];
        snprintf(dump, sizeof dump, "    %04X  80 80 80 80 80 80 80 80 80 80 80 80 80 80 80 80  ",
                 offset);
        record += dump + std::string("|................|\n");
    }
    record += "    (4096 of 5006 bytes shown)\n";
    std::string expected;
    for (int i = 0; i < 200; i++)
        expected += record;
    EXPECT_TRUE(stable(logPath) == expected);
}

// Where the file cannot be written the system log takes the record; what does not fit is cut.
static std::string sysLog;

static void takeRecord(int priority, va_list rest)
{
    sysLog += std::to_string(priority & LOG_PRIMASK) + va_arg(rest, const char*);
}

extern "C" void syslog(int priority, const char* format, ...)
{
    va_list rest;
    va_start(rest, format);
    takeRecord(priority, rest);
    va_end(rest);
}

// What becomes of the call in a build with the flags of packages.
extern "C" void __syslog_chk(int priority, int, const char* format, ...)
{
    va_list rest;
    va_start(rest, format);
    takeRecord(priority, rest);
    va_end(rest);
}

TEST_F(osse, WhatCannotBeLoggedInTheFileGoesToTheSystemLog)
{
    const std::string text(70000, 'x');
    const pdItem item = {pdKindText, text.c_str(), 0, nullptr, 0};
    for (const std::string& path : {std::string(), directory}) {
        setenv("ZQ3DIAGLOG", path.c_str(), 1);
        sysLog.clear();
        pdLog(nullptr, pdLevelWarning, &item, 1);
        EXPECT_EQ(sysLog.substr(0, 1), std::to_string(LOG_WARNING));
        EXPECT_TRUE(sysLog.ends_with("xxx ... (cut)\n"));
        EXPECT_NE(sysLog.find(" level=Warning function=: xxx"), std::string::npos);
    }
    sysLog.clear();
    sqlt_logadmin("f", 8499);
    EXPECT_TRUE(sysLog.ends_with("function=f: Administration message 8499\n"));
}

// Both are read when the library is loaded: the test runs itself once more with them set.
TEST_F(osse, TraceAndNodeNumberComeFromTheEnvironment)
{
    if (getenv("ZQ3TRACE") != nullptr) {
        pdtEntry1("a\tb\n", 4, "f");
        pdtEntry1((std::string(127, 'x') + "\u00E9" + std::string(71, 'x')).data(), 200, "f");
        sqltData("f", "checksum", "\xEF\xBE\xAD\x42", 4);
        sqltData("f", "bytes", std::string(200, '\xA9').data(), 200);
        sqltData("f", "removed", nullptr, 0);
        void* block = nullptr;
        sqlogmblkEx(nullptr, SIZE_MAX, 0, &block, "here.cpp", 7, 0);
        pdtExit1(1, "\1", 1, "f");
        pdtExit(-2161, "f");
        std::filesystem::remove_all(root); // _exit runs no destructor
        _exit(sqltGetCompTraceFlag() != 0 ? sqlz_krcbp->nodeNumber : 99);
    }
    const std::string command = "ZQ3TRACE=" + directory + "trace" + " ZQ3NODE=7 " +
                                std::filesystem::read_symlink("/proc/self/exe").string() +
                                " --gtest_filter=osse.Trace*";
    EXPECT_EQ(WEXITSTATUS(system(command.c_str())), 7);
    for (const char* noNode : {"ZQ3NODE= ", "ZQ3NODE=x ", "ZQ3NODE=65536 ", "ZQ3NODE=-32769 "})
        EXPECT_EQ(WEXITSTATUS(system(
                      (noNode + command.substr(command.find(" /")).insert(0, "ZQ3TRACE=/dev/null"))
                          .c_str())),
                  0)
            << noNode;
    std::string digits;
    for (int i = 0; i < 128; i++)
        digits += "A9";
    EXPECT_TRUE(stable(directory + "trace")
                    .ends_with("* f entry \"a\\x09b\\x0A\"\n* f entry \"" + std::string(127, 'x') +
                               "\" (127 of 200 bytes shown)\n* f checksum 0x42ADBEEF\n* f bytes " +
                               digits + " (128 of 200 bytes shown)\n* f removed\n" +
                               "* memory refused \"" + std::to_string(SIZE_MAX) +
                               " bytes for here.cpp:7\"\n* f exit 1 (0x00000001) 0x01\n" +
                               "* f exit -2161 (0xFFFFF78F)\n"))
        << stable(directory + "trace");
}
