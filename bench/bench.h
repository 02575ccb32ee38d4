// What the benchmark programs share: sample histories, SQLite tables of the same records, the floor
// to measure against, and the runner that turns medians into a table of ratios.
//
// Machines are noisy: times of two runs say little about each other. So everything that is compared
// runs in one process with its repetitions interleaved at random, and only ratios are stated.
#pragma once

#include <benchmark/benchmark.h>

#include <functional>
#include <string>
#include <vector>

#include "history/sqluhist.h"

// One line of the closing table: the time of `measured` as a multiple of the time of `base`.
struct ratioRow {
    std::string what;
    std::string measured;
    std::string base;
    const char* aim; // empty: none is set
};

// Adds a benchmark: wall-clock times, iterations a repetition (0: the library chooses), repetitions
// (0: those of the command line).
void addBenchmark(const std::string& name, int iterations, benchmark::TimeUnit unit,
                  std::function<void(benchmark::State&)> run, int repetitions = 0);

// Runs what `prepare` adds and prints the ratios as Markdown on standard output, everything else on
// standard error. prepare gets a new directory under parent; it and every lock made in it are
// removed afterwards, however the run ends.
int runBenchmarks(int argc, char** argv, const char* title, const std::string& parent,
                  void (*prepare)(const std::string& directory, std::vector<ratioRow>* rows));

// Where files stay in memory; where the program itself lies, a real file system.
std::string memoryDirectory(void);
std::string programDirectory(void);

// Ends the program when rc is not 0: a benchmark of something that fails measures nothing.
void check(int rc, const char* what);

// --- Sample histories ----------------------------------------------------------------------------

enum : uint32_t { slotSize = 19 }; // of a name, with its terminator

// One entry of the sample with everything it points to; names beyond its count are kept too.
struct sampleEntry {
    zq3HistoryData data;
    SQLUH_ENTRY entry;
    sqlca event;
    char timestamp[18];
    char idText[15];
    std::vector<textBuffer> names;
    std::vector<char> slots; // slotSize bytes each
};

void initSample(sampleEntry* sample, uint32_t tablespaces);

// Makes the sample the index-th entry of a history: a full image each week, an incremental one each
// day, three deltas after it; now and then a restore and a rename, once a creation. To be called
// with index 0, 1, 2, ...
void nextSample(sampleEntry* sample, uint32_t index);

// The timestamp of the index-th entry.
std::string sampleTimestamp(uint32_t index);

// Makes a directory with a sound pair of files. different: no two entries list the same
// tablespaces. Returns the directory, with its separator.
std::string makeHistory(const std::string& parent, uint32_t entries, uint32_t tablespaces,
                        bool different = false);

std::string sizeName(uint32_t entries, uint32_t tablespaces); // as 100000x50
std::string historyFileOf(const std::string& directory);

// Reads the file in pieces of 1 MiB and folds them with exclusive-or in wide words: no reader of
// every byte can be faster.
uint64_t readFloor(const std::string& path);

// --- SQLite --------------------------------------------------------------------------------------

#ifdef BENCH_SQLITE
struct sqlite3;
struct sqlite3_stmt;

// Opens or creates a database whose one table has a column for each field, the names in one text.
sqlite3* openTable(const std::string& path, const char* synchronous);
sqlite3_stmt* prepareInsert(sqlite3* database);
void insertSample(sqlite3_stmt* insert, const sampleEntry* sample);

// Makes a database of the records that makeHistory puts into a file. Returns its path.
std::string makeTable(const std::string& directory, uint32_t entries, uint32_t tablespaces);

// Steps through all rows, takes every column, and the names apart. Returns the number of rows.
uint64_t scanTable(const std::string& path);
#endif
