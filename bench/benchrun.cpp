// The runner: a child process measures, its parent waits and clears up.

#include "bench/bench.h"

#include <ftw.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <map>

void check(int rc, const char* what)
{
    if (rc == 0)
        return;
    fprintf(stderr, "%s failed: %d (0x%08X)\n", what, rc, static_cast<unsigned int>(rc));
    exit(1);
}

std::string memoryDirectory(void)
{
    return access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp";
}

std::string programDirectory(void)
{
    char path[4096] = {};
    if (readlink("/proc/self/exe", path, sizeof path - 1) <= 0)
        return ".";
    return std::string(path, static_cast<size_t>(strrchr(path, '/') - path));
}

static double smallest(const std::vector<double>& times)
{
    return *std::min_element(times.begin(), times.end());
}

void addBenchmark(const std::string& name, int iterations, benchmark::TimeUnit unit,
                  std::function<void(benchmark::State&)> run, int repetitions)
{
    benchmark::internal::Benchmark* added =
        benchmark::RegisterBenchmark(name.c_str(), run)->UseRealTime()->Unit(unit);
    added->ComputeStatistics("min", smallest);
    if (iterations != 0)
        added->Iterations(iterations);
    else
        added->MinTime(0.02);
    if (repetitions != 0)
        added->Repetitions(repetitions);
}

// Seconds of one iteration, by benchmark and statistic.
using statistics = std::map<std::string, std::map<std::string, double>>;

struct ratioReporter : benchmark::ConsoleReporter {
    statistics times;

    ratioReporter() : ConsoleReporter(OO_Tabular)
    {
    }

    void ReportRuns(const std::vector<Run>& runs) override
    {
        ConsoleReporter::ReportRuns(runs);
        for (const Run& run : runs)
            if (run.run_type == Run::RT_Aggregate)
                times[run.run_name.function_name][run.aggregate_name] =
                    run.GetAdjustedRealTime() / benchmark::GetTimeUnitMultiplier(run.time_unit);
    }
};

static std::string inUnits(double seconds)
{
    static const struct {
        double scale;
        const char* unit;
    } units[] = {{1, "s"}, {1e3, "ms"}, {1e6, "us"}, {1e9, "ns"}};
    size_t i = 0;
    while (i < 3 && seconds * units[i].scale < 1)
        i++;
    char text[32];
    snprintf(text, sizeof text, "%.3g %s", seconds * units[i].scale, units[i].unit);
    return text;
}

// "Best" sets the fastest repetitions against each other: what is left when others are busy on the
// machine.
static void printRatios(const char* title, statistics& times, const std::vector<ratioRow>& rows)
{
    printf("\n### %s\n\n| Measured | Time | Against | Ratio | Best | Aim |\n"
           "|---|---|---|---|---|---|\n",
           title);
    for (const ratioRow& row : rows) {
        if (times[row.measured].empty() || times[row.base].empty())
            continue; // left out by a filter
        double median = times[row.measured]["median"];
        printf("| %s | %s | `%s` | %.2f | %.2f | %s |\n", row.what.c_str(), inUnits(median).c_str(),
               row.base.c_str(), median / times[row.base]["median"],
               times[row.measured]["min"] / times[row.base]["min"], row.aim);
    }
}

static int measure(int argc, char** argv, const char* title, const std::vector<ratioRow>& rows)
{
    char repetitions[] = "--benchmark_repetitions=11";
    char interleaved[] = "--benchmark_enable_random_interleaving=true";
    char aggregates[] = "--benchmark_report_aggregates_only=true";
    std::vector<char*> arguments = {argv[0], repetitions, interleaved, aggregates};
    arguments.insert(arguments.end(), argv + 1, argv + argc);
    int count = static_cast<int>(arguments.size());
    arguments.push_back(nullptr);
    benchmark::Initialize(&count, arguments.data());
    if (benchmark::ReportUnrecognizedArguments(count, arguments.data()))
        return 1;
    ratioReporter reporter;
    reporter.SetOutputStream(&std::cerr);
    benchmark::RunSpecifiedBenchmarks(&reporter);
    printRatios(title, reporter.times, rows);
    return 0;
}

// A killed run may leave its lock behind: the set goes with the file that names it.
static int removeOne(const char* path, const struct stat*, int, struct FTW* place)
{
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    if (strcmp(path + place->base, SQLUH_HISTORY_NAME) == 0 &&
        sqloNLCKInit(path, &lock, sqloNLCKUseNodeNumber) == 0 &&
        sqloNLCKQuery(&lock, &state) == 0 && state.state != sqloNLCKAbsent)
        sqloNLCKRemoveDead(&lock, &state);
    return remove(path);
}

int runBenchmarks(int argc, char** argv, const char* title, const std::string& parent,
                  void (*prepare)(const std::string& directory, std::vector<ratioRow>* rows))
{
    std::string directory = parent + "/zq3bench-XXXXXX";
    if (mkdtemp(directory.data()) == nullptr) {
        perror(directory.c_str());
        return 1;
    }
    pid_t child = fork();
    if (child == 0) {
        std::vector<ratioRow> rows;
        prepare(directory + "/", &rows);
        exit(measure(argc, argv, title, rows));
    }
    // The child gets the terminal's signals too, and ends; what it made is removed here.
    signal(SIGINT, SIG_IGN);
    signal(SIGTERM, SIG_IGN);
    int status = -1;
    while (child != -1 && waitpid(child, &status, 0) == -1 && errno == EINTR)
        ;
    nftw(directory.c_str(), removeOne, 16, FTW_DEPTH | FTW_PHYS);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 1;
}
