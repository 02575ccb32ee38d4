// The whole cycle of a batch of one entry, opens and locks, at several sizes of the history, beside
// SQLite inserting the same record.
//
// The library's cycle takes the lock, examines and opens the files, formats, commits and closes, so
// SQLite's cycle opens the database too; what it takes on a connection that stays open is shown
// beside it. Every repetition starts from the same size.

#include "bench/bench.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#ifdef BENCH_SQLITE
#include <sqlite3.h>
#endif

enum : uint32_t { tablespaces = 50 };
static const uint32_t sizes[] = {100, 10000, 100000};
// A device's barriers come out fast or slow by turns: many short repetitions, so that both sides of
// a ratio meet the same mixture.
enum : int { cyclesUnsynced = 40, cyclesSynced = 2, repetitionsSynced = 41 };

static void setBarriers(bool on)
{
    if (on)
        unsetenv("ZQ3SYNC");
    else
        setenv("ZQ3SYNC", "off", 1);
}

// What other benchmarks left to be written must not be waited for in the next one's barriers.
static void settle(const std::string& path)
{
    int descriptor = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    check(syncfs(descriptor), "syncfs");
    close(descriptor);
}

// --- The library ---------------------------------------------------------------------------------

// What a repetition starts from: the files' length and header.
struct pristine {
    std::string directory;
    off_t size;
    char header[headerLength];
};

static void cutBack(const pristine* start, const char* name)
{
    std::string path = start->directory + name;
    int descriptor = open(path.c_str(), O_RDWR | O_CLOEXEC);
    check(ftruncate(descriptor, start->size), "ftruncate");
    check(pwrite(descriptor, start->header, headerLength, 0) != headerLength, "pwrite");
    close(descriptor);
}

static pristine* makePristine(const std::string& parent, uint32_t entries)
{
    pristine* start = new pristine{makeHistory(parent, entries, tablespaces), 0, {}};
    int descriptor = open(historyFileOf(start->directory).c_str(), O_RDONLY | O_CLOEXEC);
    start->size = lseek(descriptor, 0, SEEK_END);
    check(pread(descriptor, start->header, headerLength, 0) != headerLength, "pread");
    close(descriptor);
    return start;
}

static void appendAndCommit(char* directory, sampleEntry* sample)
{
    SQLUH_HANDLE* handle = nullptr;
    check(sqluhBeginBatch(&handle, directory), "sqluhBeginBatch");
    check(sqloseek(handle->fileHandle, 0, sqloFromEnd, nullptr), "sqloseek");
    check(sqluhWriteEntry(handle, &sample->entry), "sqluhWriteEntry");
    handle->header.entryCount++;
    check(sqluhEndBatch(&handle, sqluhCommit), "sqluhEndBatch");
}

static void batchCycle(benchmark::State& state, const pristine* start, bool barriers)
{
    std::string directory = start->directory;
    sampleEntry sample;
    initSample(&sample, tablespaces);
    nextSample(&sample, 1);
    cutBack(start, SQLUH_HISTORY_NAME);
    cutBack(start, SQLUH_SHADOW_NAME);
    settle(directory);
    setBarriers(barriers);
    for (auto _ : state)
        appendAndCommit(directory.data(), &sample);
    setBarriers(true);
}

static void openAndClose(benchmark::State& state, const pristine* start)
{
    std::string directory = start->directory;
    for (auto _ : state) {
        SQLUH_HANDLE* handle = nullptr;
        check(sqluhOpen(&handle, directory.data(), SQLUH_OPEN_READ), "sqluhOpen");
        check(sqluhClose(&handle), "sqluhClose");
    }
}

// The batch's writes and barriers with nothing around them: what the device alone costs.
static void bareBarriers(benchmark::State& state, const std::string& path)
{
    std::vector<char> bytes(2 * headerLength, ' ');
    int descriptor = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    settle(path);
    for (auto _ : state) {
        for (int i = 0; i < 4; i++) {
            off_t at = i == 1 ? lseek(descriptor, 0, SEEK_END) : 0;
            check(pwrite(descriptor, bytes.data(), bytes.size(), at) < 0, "pwrite");
            check(fdatasync(descriptor), "fdatasync");
        }
    }
    close(descriptor);
}

// --- SQLite --------------------------------------------------------------------------------------

#ifdef BENCH_SQLITE
static void insertCycle(benchmark::State& state, const std::string& path, uint32_t entries,
                        const char* synchronous, bool keepOpen)
{
    sampleEntry sample;
    initSample(&sample, tablespaces);
    nextSample(&sample, 1);
    sqlite3* database = openTable(path, "FULL");
    std::string cut = "DELETE FROM history WHERE rowid > " + std::to_string(entries);
    check(sqlite3_exec(database, cut.c_str(), nullptr, nullptr, nullptr), "DELETE");
    sqlite3_close(database);
    settle(path);
    database = nullptr;
    sqlite3_stmt* insert = nullptr;
    for (auto _ : state) {
        if (database == nullptr) {
            database = openTable(path, synchronous);
            insert = prepareInsert(database);
        }
        insertSample(insert, &sample);
        if (!keepOpen) {
            sqlite3_finalize(insert);
            sqlite3_close(database);
            database = nullptr;
        }
    }
    if (keepOpen) {
        sqlite3_finalize(insert);
        sqlite3_close(database);
    }
}

static void addInserts(const std::string& directory, uint32_t entries)
{
    std::string size = std::to_string(entries);
    std::string path = makeTable(directory, entries, tablespaces);
    struct kind {
        const char* name;
        const char* synchronous;
        bool keepOpen;
    };
    for (const kind& k : {kind{"SQLite OFF, opened each time/", "OFF", false},
                          kind{"SQLite OFF, kept open/", "OFF", true},
                          kind{"SQLite FULL, opened each time/", "FULL", false},
                          kind{"SQLite FULL, kept open/", "FULL", true}}) {
        bool synced = strcmp(k.synchronous, "FULL") == 0;
        addBenchmark(
            k.name + size, synced ? cyclesSynced : cyclesUnsynced, benchmark::kMicrosecond,
            [=](benchmark::State& state) {
                insertCycle(state, path, entries, k.synchronous, k.keepOpen);
            },
            synced ? repetitionsSynced : 0);
    }
}
#else
static void addInserts(const std::string&, uint32_t)
{
}
#endif

static void addSize(const std::string& directory, uint32_t entries, std::vector<ratioRow>* rows)
{
    using benchmark::State;
    std::string size = std::to_string(entries);
    const pristine* start = makePristine(directory, entries);
    std::string off = "batch, ZQ3SYNC=off/" + size;
    std::string on = "batch/" + size;
    std::string opening = "open and close/" + size;
    addBenchmark(off, cyclesUnsynced, benchmark::kMicrosecond,
                 [start](State& state) { batchCycle(state, start, false); });
    addBenchmark(
        on, cyclesSynced, benchmark::kMicrosecond,
        [start](State& state) { batchCycle(state, start, true); }, repetitionsSynced);
    addBenchmark(opening, 0, benchmark::kMicrosecond,
                 [start](State& state) { openAndClose(state, start); });
    addInserts(directory, entries);
    rows->push_back({off, off, "SQLite OFF, opened each time/" + size, "0.8"});
    rows->push_back({off, off, "SQLite OFF, kept open/" + size, ""});
    rows->push_back({on, on, "SQLite FULL, opened each time/" + size, "0.95"});
    rows->push_back({on, on, "SQLite FULL, kept open/" + size, ""});
    rows->push_back({on, on, "four bare writes with barriers", ""});
    if (entries != sizes[0]) {
        std::string first = std::to_string(sizes[0]);
        rows->push_back({off, off, "batch, ZQ3SYNC=off/" + first, "1"});
        rows->push_back({on, on, "batch/" + first, "1"});
        rows->push_back({opening, opening, "open and close/" + first, "1"});
    }
}

// --- Locks ---------------------------------------------------------------------------------------

static void namedLock(benchmark::State& state, const std::string& path)
{
    SQLO_NLCK lock = {};
    check(sqloNLCKInit(path.c_str(), &lock, 0), "sqloNLCKInit");
    for (auto _ : state) {
        check(sqloNLCKLock(&lock, 0, -1), "sqloNLCKLock");
        check(sqloNLCKUnlock(&lock), "sqloNLCKUnlock");
    }
}

// The same system calls and nothing else.
static void bareSemaphore(benchmark::State& state, const std::string& path)
{
    union {
        int val;
        semid_ds* buf;
    } argument;
    semid_ds info;
    key_t key = ftok(path.c_str(), 'n');
    for (auto _ : state) {
        sembuf take = {0, -1, SEM_UNDO};
        int id = semget(key, 1, IPC_CREAT | IPC_EXCL | 0747);
        argument.val = 1;
        check(semctl(id, 0, SETVAL, argument), "SETVAL");
        check(semop(id, &take, 1), "semop");
        argument.buf = &info;
        check(semctl(id, 0, IPC_STAT, argument), "IPC_STAT");
        info.sem_perm.mode |= 020;
        check(semctl(id, 0, IPC_SET, argument), "IPC_SET");
        check(semctl(id, 0, IPC_RMID, argument), "IPC_RMID");
    }
}

static void fileLock(benchmark::State& state, const std::string& path, bool record)
{
    for (auto _ : state) {
        int descriptor = open(path.c_str(), O_RDWR | O_CLOEXEC);
        struct flock whole = {};
        whole.l_type = F_WRLCK;
        check(record ? fcntl(descriptor, F_SETLKW, &whole) : flock(descriptor, LOCK_EX), "lock");
        whole.l_type = F_UNLCK;
        check(record ? fcntl(descriptor, F_SETLK, &whole) : flock(descriptor, LOCK_UN), "unlock");
        close(descriptor);
    }
}

static void addLocks(const std::string& directory, std::vector<ratioRow>* rows)
{
    using benchmark::State;
    std::string path = directory + "lock";
    close(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    auto add = [rows](const char* name, const char* aim, std::function<void(State&)> run) {
        addBenchmark(name, 0, benchmark::kNanosecond, run);
        if (strcmp(name, "bare semaphore calls") != 0)
            rows->push_back({name, name, "bare semaphore calls", aim});
    };
    add("named lock cycle", "1.25", [=](State& state) { namedLock(state, path); });
    add("bare semaphore calls", "", [=](State& state) { bareSemaphore(state, path); });
    add("open, flock, close", "", [=](State& state) { fileLock(state, path, false); });
    add("open, fcntl, close", "", [=](State& state) { fileLock(state, path, true); });
}

static void prepare(const std::string& directory, std::vector<ratioRow>* rows)
{
    for (uint32_t entries : sizes)
        addSize(directory, entries, rows);
    addBenchmark(
        "four bare writes with barriers", cyclesSynced, benchmark::kMicrosecond,
        [=](benchmark::State& state) { bareBarriers(state, directory + "bare"); },
        repetitionsSynced);
    addLocks(directory, rows);
}

int main(int argc, char** argv)
{
    return runBenchmarks(argc, argv, "Batches, opens and locks", programDirectory(), prepare);
}
