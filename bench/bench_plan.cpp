// The whole command: start, scan, plan, report, on large histories and on their doubles.

#include "bench/bench.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>

#include <cstdio>
#include <cstdlib>

// Runs a program with its standard output discarded and returns its wait status.
static int run(std::vector<std::string> words)
{
    std::vector<char*> arguments;
    for (std::string& word : words)
        arguments.push_back(word.data());
    arguments.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
    pid_t pid = 0;
    int status = posix_spawnp(&pid, arguments[0], &actions, nullptr, arguments.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (status == 0 && waitpid(pid, &status, 0) == -1)
        status = -1;
    return status;
}

static void addRun(const std::string& name, const std::vector<std::string>& words)
{
    addBenchmark(name, 1, benchmark::kMillisecond, [=](benchmark::State& state) {
        for (auto _ : state)
            check(run(words), words[0].c_str());
    });
}

// A history in the place where the planner finds it, and the plan of its last image.
static std::string addPlan(const std::string& directory, uint32_t entries, uint32_t tablespaces)
{
    static int made = 0;
    std::string alias = "BENCH" + std::to_string(++made);
    std::string placed = directory + alias;
    check(rename(makeHistory(directory, entries, tablespaces).c_str(), placed.c_str()), "rename");
    addRun("plan/" + sizeName(entries, tablespaces),
           {BENCH_PLANNER, "-d", alias, "-t", sampleTimestamp(entries - 1)});
    return historyFileOf(placed + "/");
}

static void addSize(const std::string& directory, uint32_t entries, uint32_t tablespaces,
                    std::vector<ratioRow>* rows)
{
    std::string size = sizeName(entries, tablespaces);
    std::string moreEntries = sizeName(2 * entries, tablespaces);
    std::string moreNames = sizeName(entries, 2 * tablespaces);
    std::string file = addPlan(directory, entries, tablespaces);
    addPlan(directory, 2 * entries, tablespaces);
    addPlan(directory, entries, 2 * tablespaces);
    addBenchmark("floor/" + size, 1, benchmark::kMillisecond, [=](benchmark::State& state) {
        for (auto _ : state)
            benchmark::DoNotOptimize(readFloor(file));
    });
    addRun("cksum/" + size, {"cksum", file});
    rows->push_back({"plan, " + size, "plan/" + size, "floor/" + size, "6"});
    rows->push_back({"plan, " + size, "plan/" + size, "cksum/" + size, ""});
#ifdef BENCH_SQLITE
    std::string table = makeTable(directory, entries, tablespaces);
    addBenchmark("SQLite scan/" + size, 1, benchmark::kMillisecond, [=](benchmark::State& state) {
        for (auto _ : state)
            check(scanTable(table) != entries, "SQLite scan");
    });
    rows->push_back({"plan, " + size, "plan/" + size, "SQLite scan/" + size, "0.8"});
#endif
    rows->push_back({"plan, twice the entries", "plan/" + moreEntries, "plan/" + size, "2.2"});
    rows->push_back({"plan, twice the names", "plan/" + moreNames, "plan/" + size, "2.2"});
}

static void prepare(const std::string& directory, std::vector<ratioRow>* rows)
{
    setenv("ZQ3DBPATH", directory.c_str(), 1);
    addSize(directory, 100000, 50, rows);
    addSize(directory, 5000, 1000, rows);
}

int main(int argc, char** argv)
{
    return runBenchmarks(argc, argv, "The whole command", memoryDirectory(), prepare);
}
