// The whole command: start, read, plan, report, on small and large histories and on their doubles;
// and the questions about images, on a year's history, against a plan. If BENCH_EARLIER names the
// planner of another build, also against that one.

#include "bench/bench.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <cstdio>
#include <cstdlib>

// Runs a program with its standard output discarded and returns its wait status. usage: null, or
// what it used.
static int run(std::vector<std::string> words, rusage* usage = nullptr)
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
    if (status == 0 && wait4(pid, &status, 0, usage) == -1)
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

// A history in the place where the planner finds it.
struct placedHistory {
    std::string size;                // as its benchmarks are called
    std::string file;                // the history file
    std::vector<std::string> planIt; // the planner's arguments
};

static placedHistory placeHistory(const std::string& directory, uint32_t entries,
                                  uint32_t tablespaces, bool different = false)
{
    static int made = 0;
    std::string alias = "BENCH" + std::to_string(++made);
    std::string placed = directory + alias;
    std::string history = makeHistory(directory, entries, tablespaces, different);
    check(rename(history.c_str(), placed.c_str()), "rename");
    return {sizeName(entries, tablespaces) + (different ? ", lists differ" : ""),
            historyFileOf(placed + "/"),
            {"-d", alias, "-t", sampleTimestamp(entries - 1)}};
}

static std::vector<std::string> commandOf(const char* planner, const placedHistory& history)
{
    std::vector<std::string> words = {planner};
    words.insert(words.end(), history.planIt.begin(), history.planIt.end());
    return words;
}

// The plan of the history's last image. aim: against the earlier planner.
static void addPlan(const placedHistory& history, const char* aim, std::vector<ratioRow>* rows)
{
    const char* earlier = getenv("BENCH_EARLIER");
    std::string plan = "plan/" + history.size, before = "earlier plan/" + history.size;
    addRun(plan, commandOf(BENCH_PLANNER, history));
    if (earlier == nullptr)
        return;
    addRun(before, commandOf(earlier, history));
    rows->push_back({"plan, " + history.size, plan, before, aim});
}

// A planner needs the same memory each time. aim: in MB.
static void showMemory(const placedHistory& history, int aim)
{
    rusage usage = {};
    struct stat file = {};
    check(run(commandOf(BENCH_PLANNER, history), &usage), BENCH_PLANNER);
    check(stat(history.file.c_str(), &file), "stat");
    printf("| %s | %ld MB | %ld MB | %d MB |\n", history.size.c_str(),
           static_cast<long>(usage.ru_maxrss / 1024), static_cast<long>(file.st_size >> 20), aim);
}

static void addLarge(const std::string& directory, uint32_t entries, uint32_t tablespaces,
                     std::vector<ratioRow>* rows)
{
    placedHistory history = placeHistory(directory, entries, tablespaces);
    placedHistory moreEntries = placeHistory(directory, 2 * entries, tablespaces);
    placedHistory moreNames = placeHistory(directory, entries, 2 * tablespaces);
    std::string size = history.size, file = history.file, plan = "plan/" + size;
    addPlan(history, "0.4", rows);
    addPlan(moreEntries, "0.4", rows);
    addPlan(moreNames, "0.4", rows);
    showMemory(history, 40);
    addBenchmark("floor/" + size, 1, benchmark::kMillisecond, [=](benchmark::State& state) {
        for (auto _ : state)
            benchmark::DoNotOptimize(readFloor(file));
    });
    addRun("cksum/" + size, {"cksum", file});
    rows->push_back({"plan, " + size, plan, "floor/" + size, "6"});
    rows->push_back({"plan, " + size, plan, "cksum/" + size, ""});
#ifdef BENCH_SQLITE
    std::string table = makeTable(directory, entries, tablespaces);
    addBenchmark("SQLite scan/" + size, 1, benchmark::kMillisecond, [=](benchmark::State& state) {
        for (auto _ : state)
            check(scanTable(table) != entries, "SQLite scan");
    });
    rows->push_back({"plan, " + size, plan, "SQLite scan/" + size, "0.5"});
#endif
    rows->push_back({"plan, twice the entries", "plan/" + moreEntries.size, plan, "2.2"});
    rows->push_back({"plan, twice the names", "plan/" + moreNames.size, plan, "2.2"});
}

// As many entries as hourly images make in a year. A plan of such a history takes a few
// milliseconds, so these aims are far below what anybody would notice.
static void addQuestions(const std::string& directory, std::vector<ratioRow>* rows)
{
    enum : uint32_t { entries = 8777, tablespaces = 12 };
    placedHistory year = placeHistory(directory, entries, tablespaces);
    std::string where = year.file.substr(0, year.file.rfind('/'));
    std::string plan = "plan/" + year.size;
    addRun(plan, commandOf(BENCH_PLANNER, year));
    const std::vector<std::string> questions[] = {
        {"images", where},
        {"plan", where, "latest"},
        {"chart", where},
        {"chart", where, "--svg", "-"},
        {"check", where},
        {"unneeded", where, "--keep", "30"},
        {"needed-by", where, sampleTimestamp(0)},
        {"dump", where},
        {"verify", where},
    };
    for (std::vector<std::string> words : questions) {
        std::string name = "zq3hist " + words[0] + (words.size() > 3 ? " " + words[2] : "");
        words.insert(words.begin(), BENCH_ASKER);
        addRun(name, words);
        rows->push_back({name + ", " + year.size, name, plan, "5"});
    }
}

static void prepare(const std::string& directory, std::vector<ratioRow>* rows)
{
    setenv("ZQ3DBPATH", directory.c_str(), 1);
    printf("\n### Memory of the whole command\n\n| History | Peak | File | Aim "
           "|\n|---|---|---|---|\n");
    addLarge(directory, 100000, 50, rows);
    addLarge(directory, 5000, 1000, rows);
    placedHistory different = placeHistory(directory, 100000, 50, true);
    showMemory(different, 250);
    addPlan(different, "1", rows);
    addPlan(placeHistory(directory, 1000, 50), "0.6", rows);
    addPlan(placeHistory(directory, 20, 50), "0.9", rows);
    addQuestions(directory, rows);
}

int main(int argc, char** argv)
{
    return runBenchmarks(argc, argv, "The whole command", memoryDirectory(), prepare);
}
