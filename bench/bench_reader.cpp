// The reader and the writer of records, against reading and writing the bare bytes.

#include "bench/bench.h"

#include <fcntl.h>
#include <unistd.h>

#include <clocale>
#include <cstdarg>
#include <cstdio>
#include <cstring>

enum : uint32_t { fullEntries = 100000, fullTablespaces = 50 };

static void verifiedScan(benchmark::State& state, std::string file)
{
    SQLUH_WORKAREA area = {};
    check(sqluhInitWorkArea(&area, defaultWorkAreaSize), "sqluhInitWorkArea");
    for (auto _ : state)
        check(sqluhVerifyUnopenedHistoryFile(file.data(), &area), "verified scan");
    sqlofmblkEx(area.buffer);
}

static void scanIntoRecord(benchmark::State& state, const std::string& file, uint32_t entries,
                           uint32_t tablespaces)
{
    SQLUH_WORKAREA area = {};
    SQLUH_ENTRY entry = {};
    unsigned int flags = 0;
    check(sqluhInitWorkArea(&area, defaultWorkAreaSize), "sqluhInitWorkArea");
    check(sqluhAllocateHistoryData(&entry.data, nullptr, tablespaces, true, 255),
          "sqluhAllocateHistoryData");
    for (auto _ : state) {
        SQLO_FHANDLE fh = sqloNoFile;
        long long offset = 0;
        uint32_t count = 0;
        check(sqloopenp(file.c_str(), sqloOpenRead, 0, &fh), "sqloopenp");
        check(sqluhRewind(fh, &offset), "sqluhRewind");
        while (sqluhReadEntry(fh, &entry, &area, nullptr, nullptr, nullptr, nullptr, &flags) == 0)
            count++;
        check(count != entries, "scan with names");
        check(sqloclose(fh), "sqloclose");
    }
    sqluhFreeHistoryData(&entry.data);
    sqlofmblkEx(area.buffer);
}

// One file with its floor and its two scans. `scaled`: against the full file's scan, where the time
// should be this multiple of it.
static void addFile(const std::string& directory, uint32_t entries, uint32_t tablespaces,
                    const char* scaled, std::vector<ratioRow>* rows)
{
    std::string size = sizeName(entries, tablespaces);
    std::string file = historyFileOf(makeHistory(directory, entries, tablespaces));
    std::string full = sizeName(fullEntries, fullTablespaces);
    addBenchmark("floor/" + size, 1, benchmark::kMillisecond, [file](benchmark::State& state) {
        for (auto _ : state)
            benchmark::DoNotOptimize(readFloor(file));
    });
    addBenchmark("verify/" + size, 1, benchmark::kMillisecond,
                 [file](benchmark::State& state) { verifiedScan(state, file); });
    addBenchmark("names/" + size, 1, benchmark::kMillisecond, [=](benchmark::State& state) {
        scanIntoRecord(state, file, entries, tablespaces);
    });
    bool first = size == full;
    rows->push_back(
        {"verified scan, " + size, "verify/" + size, "floor/" + size, first ? "1.5" : ""});
    rows->push_back(
        {"scan with names, " + size, "names/" + size, "floor/" + size, first ? "3.5" : ""});
    if (!first) {
        rows->push_back({"verified scan, " + size, "verify/" + size, "verify/" + full, scaled});
        rows->push_back({"scan with names, " + size, "names/" + size, "names/" + full, scaled});
    }
}

// --- Writing, and the header ---------------------------------------------------------------------

static void writeEntry(benchmark::State& state, const std::string& path, const char* locale)
{
    std::string directory = path + "/";
    SQLUH_HANDLE* handle = nullptr;
    sampleEntry sample;
    initSample(&sample, fullTablespaces);
    nextSample(&sample, 1);
    check(sqluhHandleAllocAndInit(directory.data(), &handle), "sqluhHandleAllocAndInit");
    handle->replayArea.replayDisabled = 1;
    check(sqloopenp(path.c_str(), sqloOpenNew, 0600, &handle->fileHandle), "sqloopenp");
    setlocale(LC_ALL, locale);
    for (auto _ : state) {
        sqloseek(handle->fileHandle, headerLength, sqloFromStart, nullptr);
        check(sqluhWriteEntry(handle, &sample.entry), "sqluhWriteEntry");
    }
    setlocale(LC_ALL, "C");
    state.counters["bytes"] = sample.entry.size;
    sqloclose(handle->fileHandle);
    sqluhHandleFree(&handle);
}

static void writeHeader(benchmark::State& state, const std::string& path)
{
    SQLO_FHANDLE fh = sqloNoFile;
    SQLUH_HEADER header = {};
    header.status = statusConsistent;
    memset(header.timestamp, ' ', sizeof header.timestamp);
    check(sqloopenp(path.c_str(), sqloOpenNew, 0600, &fh), "sqloopenp");
    for (auto _ : state)
        check(sqluhWriteHeader(fh, &header), "sqluhWriteHeader");
    sqloclose(fh);
}

static void readHeader(benchmark::State& state, const std::string& file)
{
    for (auto _ : state) {
        SQLO_FHANDLE fh = sqloNoFile;
        SQLUH_HEADER header;
        check(sqloopenp(file.c_str(), sqloOpenRead, 0, &fh), "sqloopenp");
        check(sqluhReadHeader(fh, &header), "sqluhReadHeader");
        sqloclose(fh);
    }
}

static void bareWrite(benchmark::State& state, const std::string& path, size_t size)
{
    std::vector<char> bytes(size, ' ');
    int descriptor = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    for (auto _ : state)
        check(pwrite(descriptor, bytes.data(), size, 0) != static_cast<ssize_t>(size), "pwrite");
    close(descriptor);
}

static void bareRead(benchmark::State& state, const std::string& file)
{
    char bytes[headerLength];
    for (auto _ : state) {
        int descriptor = open(file.c_str(), O_RDONLY | O_CLOEXEC);
        check(pread(descriptor, bytes, sizeof bytes, 0) != sizeof bytes, "pread");
        close(descriptor);
    }
}

// --- Formatting ----------------------------------------------------------------------------------

enum : size_t { lineCapacity = 64 };

__attribute__((format(printf, 2, 3))) static int bareSprintf(char* buffer, const char* format, ...)
{
    va_list arguments;
    va_start(arguments, format);
    int length = vsnprintf(buffer, lineCapacity, format, arguments);
    va_end(arguments);
    return length;
}

static void formatLine(benchmark::State& state, int (*format)(char*, const char*, ...))
{
    char line[lineCapacity];
    for (auto _ : state) {
        format(line, tablespaceFormat, 10U, 10, 10, "TS00012G00");
        benchmark::DoNotOptimize(line);
    }
}

static void addSmall(const std::string& directory, std::vector<ratioRow>* rows)
{
    using benchmark::State;
    std::string small = historyFileOf(makeHistory(directory, 10, fullTablespaces));
    std::string scratch = directory + "scratch";
    auto add = [](const char* name, std::function<void(State&)> run) {
        addBenchmark(name, 0, benchmark::kNanosecond, run);
    };
    add("entry write", [=](State& state) { writeEntry(state, scratch, "C"); });
    add("entry write, C.UTF-8", [=](State& state) { writeEntry(state, scratch, "C.UTF-8"); });
    add("pwrite of 1962 bytes", [=](State& state) { bareWrite(state, scratch, 1962); });
    add("header write", [=](State& state) { writeHeader(state, scratch); });
    add("pwrite of 1 KiB", [=](State& state) { bareWrite(state, scratch, headerLength); });
    add("header read", [=](State& state) { readHeader(state, small); });
    add("open, pread of 1 KiB, close", [=](State& state) { bareRead(state, small); });
    add("sqluhSprintf", [](State& state) { formatLine(state, sqluhSprintf); });
    add("vsnprintf", [](State& state) { formatLine(state, bareSprintf); });
    rows->push_back({"entry write", "entry write", "pwrite of 1962 bytes", ""});
    rows->push_back({"entry write", "entry write", "vsnprintf", ""});
    rows->push_back(
        {"entry write, locale is C.UTF-8", "entry write, C.UTF-8", "entry write", "1.1"});
    rows->push_back({"header write", "header write", "pwrite of 1 KiB", ""});
    rows->push_back({"open, header read, close", "header read", "open, pread of 1 KiB, close", ""});
    rows->push_back({"format a line", "sqluhSprintf", "vsnprintf", "1.2"});
}

static void addSqlite(const std::string& directory, std::vector<ratioRow>* rows)
{
#ifdef BENCH_SQLITE
    std::string table = makeTable(directory, fullEntries, fullTablespaces);
    addBenchmark("SQLite", 1, benchmark::kMillisecond, [=](benchmark::State& state) {
        for (auto _ : state)
            check(scanTable(table) != fullEntries, "SQLite scan");
    });
    std::string floor = "floor/" + sizeName(fullEntries, fullTablespaces);
    rows->push_back({"SQLite scan with names, the same records", "SQLite", floor, ""});
#else
    (void)directory;
    (void)rows;
#endif
}

static void prepare(const std::string& directory, std::vector<ratioRow>* rows)
{
    addFile(directory, fullEntries, fullTablespaces, "", rows);
    addFile(directory, fullEntries / 2, fullTablespaces, "0.5", rows);
    addFile(directory, fullEntries / 2, 2 * fullTablespaces, "", rows);
    addFile(directory, fullEntries / 2, 4 * fullTablespaces, "", rows);
    addSqlite(directory, rows);
    addSmall(directory, rows);
}

int main(int argc, char** argv)
{
    return runBenchmarks(argc, argv, "Reading and writing records", memoryDirectory(), prepare);
}
