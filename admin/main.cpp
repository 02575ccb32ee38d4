// zq3hist: looks after history directories.
#include "admin/zq3hist.h"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

struct subcommand {
    const char* name;
    int (*run)(int argc, char** argv);
    const char* arguments;
    const char* help;
};
static constexpr subcommand subcommands[] = {
    {"load", loadMain, "DIR [FILE]", "append the entries of a stanza file, all or none"},
    {"dump", dumpMain, "[--json] DIR", "print all entries as stanzas, or one JSON object a line"},
    {"images", imagesMain, "[--json] DIR",
     "list the backup images and whether each can be restored"},
    {"plan", planMain, "[--json] DIR TIMESTAMP [NAME...]", "list the images that a restore needs"},
    {"status", statusMain, "[--json] DIR", "show both files and the lock; change nothing"},
    {"verify", verifyMain, "DIR", "read every entry of both files"},
    {"repair", repairMain, "DIR", "bring both files into step and say what was done"},
    {"copy", copyMain, "SRC DST", "replace the history in DST by that in SRC"},
    {"backup", backupMain, "DIR FILE", "write the history to FILE"},
    {"restore", restoreMain, "DIR FILE", "replace the history by that in FILE"},
    {"unlock", unlockMain, "DIR", "remove the lock that a dead process left"},
};

static int showHelp(void)
{
    puts("Usage: zq3hist SUBCOMMAND ARGUMENTS\n\n"
         "Looks after history directories: the history file zq3rhist.asc and its shadow.\n");
    for (const subcommand& command : subcommands)
        printf("  %-8s %-32s %s\n", command.name, command.arguments, command.help);
    puts("\n"
         "  --help     show this text\n"
         "  --version  show the version\n\n"
         "Without FILE, load reads standard input.\n"
         "Exit status: 0 done; 1 failed, or the history is not sound; 2 wrong use.");
    return exitDone;
}

static int runSubcommand(int argc, char** argv)
{
    if (strcmp(argv[1], "--help") == 0 || strcmp(argv[1], "-h") == 0 ||
        strcmp(argv[1], "help") == 0)
        return showHelp();
    if (strcmp(argv[1], "--version") == 0) {
        puts("zq3hist " ZQ3HIST_VERSION);
        return exitDone;
    }
    for (const subcommand& command : subcommands)
        if (strcmp(argv[1], command.name) == 0)
            return command.run(argc - 1, argv + 1);
    return failUsage("no subcommand %s", argv[1]);
}

// A standard stream that the program was started without must not become a file that it opens:
// messages would go into that file. What takes its place refuses to be read or written.
static void fillStandardStreams(void)
{
    for (int stream = STDIN_FILENO; stream <= STDERR_FILENO; stream++)
        if (fcntl(stream, F_GETFD) == -1)
            open("/dev/null", stream == STDIN_FILENO ? O_WRONLY : O_RDONLY);
}

int main(int argc, char** argv)
{
    fillStandardStreams();
    if (argc < 2)
        return failUsage("no subcommand given");
    // A reader that goes away is a failed write, never an end with the lock in hand.
    signal(SIGPIPE, SIG_IGN);
    int rc = runSubcommand(argc, argv);
    // A report that did not reach its reader must not end like one that did.
    bool written = ferror(stdout) == 0 && fflush(stdout) == 0;
    if (!written || (close(STDOUT_FILENO) != 0 && errno != EBADF)) {
        fail("standard output", "cannot write: %s", strerror(errno));
        rc = rc != exitDone ? rc : exitFailed;
    }
    return rc;
}
