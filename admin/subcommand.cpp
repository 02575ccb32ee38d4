// The subcommands and their command line.
#include "admin/zq3hist.h"

#include <cstring>

static constexpr subcommand subcommands[] = {
    {"load", loadMain, 1, 0, 1, 0, "DIR [FILE]",
     "append the entries of a stanza file, all or none"},
    {"dump", dumpMain, 1, 0, 0, optionJson, "[--json] DIR",
     "print all entries as stanzas, or one JSON object a line"},
    {"images", imagesMain, 1, 0, 0, optionJson, "[--json] DIR",
     "list the backup images and whether each can be restored"},
    {"plan", planMain, 1, 1, -1, optionJson, "[--json] DIR TIMESTAMP [NAME...]",
     "list the images that a restore needs"},
    {"status", statusMain, 1, 0, 0, optionJson, "[--json] DIR",
     "show both files and the lock; change nothing"},
    {"verify", verifyMain, 1, 0, 0, 0, "DIR", "read every entry of both files"},
    {"repair", repairMain, 1, 0, 0, 0, "DIR", "bring both files into step and say what was done"},
    {"copy", copyMain, 2, 0, 0, 0, "SRC DST", "replace the history in DST by that in SRC"},
    {"backup", backupMain, 1, 1, 1, 0, "DIR FILE", "write the history to FILE"},
    {"restore", restoreMain, 1, 1, 1, 0, "DIR FILE", "replace the history by that in FILE"},
    {"unlock", unlockMain, 1, 0, 0, 0, "DIR", "remove the lock that a dead process left"},
};

static int showHelp(void)
{
    puts("Usage: zq3hist SUBCOMMAND ARGUMENTS\n\n"
         "Looks after history directories: the history file zq3rhist.asc and its shadow.\n");
    for (const subcommand& command : subcommands)
        printf("  %-8s %-32s %s\n", command.name, command.form, command.help);
    puts("\n"
         "  --help     show this text\n"
         "  --version  show the version\n\n"
         "Without FILE, load reads standard input.\n"
         "Exit status: 0 done; 1 failed, or the history is not sound; 2 wrong use.");
    return exitDone;
}

// Takes the options and the directories out of the arguments; the others move to their front.
// Returns 0, or an exit status after a complaint.
static int takeArguments(const subcommand* command, int argc, char** argv, commandLine* line)
{
    int kept = 0;
    for (int i = 0; i < argc; i++) {
        if ((command->options & optionJson) != 0 && strcmp(argv[i], "--json") == 0)
            line->json = true;
        else if (argv[i][0] == '-' && argv[i][1] != '\0')
            return failUsage("%s: unknown option %s", command->name, argv[i]);
        else
            argv[kept++] = argv[i];
    }
    line->arguments = argv + command->numDirectories;
    line->numArguments = kept - command->numDirectories;
    if (line->numArguments < command->least ||
        (command->most >= 0 && line->numArguments > command->most))
        return failUsage("usage: zq3hist %s %s", command->name, command->form);
    if (kept < argc)
        argv[kept] = nullptr;
    int rc = takePlace(argv[0], &line->place);
    return rc != 0 || command->numDirectories == 1 ? rc : takePlace(argv[1], &line->target);
}

int runProgram(int argc, char** argv)
{
    if (argc < 2)
        return failUsage("no subcommand given");
    const char* name = argv[1];
    if (strcmp(name, "--help") == 0 || strcmp(name, "-h") == 0 || strcmp(name, "help") == 0)
        return showHelp();
    if (strcmp(name, "--version") == 0) {
        puts("zq3hist " ZQ3HIST_VERSION);
        return exitDone;
    }
    for (const subcommand& command : subcommands)
        if (strcmp(name, command.name) == 0) {
            commandLine line = {};
            int rc = takeArguments(&command, argc - 2, argv + 2, &line);
            return rc != 0 ? rc : command.run(&line);
        }
    return failUsage("no subcommand %s", name);
}
