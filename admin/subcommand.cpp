// The subcommands and their command line.
#include "admin/zq3hist.h"

#include <cctype>
#include <cstddef>
#include <cstdlib>
#include <cstring>

static constexpr subcommand subcommands[] = {
    {"images", imagesMain, 1, 0, 0,
     optionJson | optionLast | optionSince | optionIncomplete | optionAll | optionHave, "DIR",
     "list the backup images and whether each can be restored"},
    {"plan", planMain, 1, 0, -1, optionJson | optionBefore | optionHave, "DIR TIMESTAMP [NAME...]",
     "list the images that a restore needs; TIMESTAMP may be latest"},
    {"chart", chartMain, 1, 0, 1, optionJson | optionColor | optionSvg, "DIR [TIMESTAMP]",
     "draw the images of each tablespace, and which ones are needed"},
    {"check", checkMain, 1, 0, 0, optionJson | optionMaxAge | optionHave, "DIR",
     "say in one line whether everything is well"},
    {"unneeded", unneededMain, 1, 0, 0, optionJson | optionNeededSince | optionKeep, "DIR",
     "list the images that no restore needs from a time on; delete nothing"},
    {"needed-by", neededByMain, 1, 1, 1, optionJson, "DIR TIMESTAMP",
     "list the restores that break without this image"},
    {"load", loadMain, 1, 0, 1, optionJson | optionWait | optionDryRun | optionSkipExisting,
     "DIR [FILE]", "append the entries of a stanza file, all or none"},
    {"dump", dumpMain, 1, 0, 0, optionJson, "DIR",
     "print all entries as stanzas, or one JSON object a line"},
    {"status", statusMain, 1, 0, 0, optionJson, "DIR",
     "show both files and the lock; change nothing"},
    {"verify", verifyMain, 1, 0, 0, optionJson, "DIR", "read every entry of both files"},
    {"repair", repairMain, 1, 0, 0, optionJson | optionWait | optionDryRun | optionSalvage, "DIR",
     "bring both files into step and say what was done"},
    {"copy", copyMain, 2, 0, 0, optionWait | optionDryRun, "SRC DST",
     "replace the history in DST by that in SRC"},
    {"backup", backupMain, 1, 1, 1, optionWait | optionDryRun | optionForce, "DIR FILE",
     "write the history to FILE"},
    {"restore", restoreMain, 1, 1, 1, optionWait | optionDryRun, "DIR FILE",
     "replace the history by that in FILE"},
    {"prune", pruneMain, 1, 0, 0, optionPruneBefore | optionWait | optionDryRun, "DIR",
     "remove the oldest entries that no image needs which stays"},
    {"unlock", unlockMain, 1, 0, 0, optionAllLocks, "DIR | --all",
     "remove the lock that a dead process left"},
};

// --- Options -------------------------------------------------------------------------------------

// What an option takes: nothing, a text that may be left out, or a value.
enum optionKind { takesNothing, takesChoice, takesText, takesNumber, takesTimestamp };

struct option {
    const char* name;
    unsigned int bit;
    optionKind kind;
    size_t at; // its member of commandLine
    const char* value;
    const char* help;
};
static constexpr option options[] = {
    {"--json", optionJson, takesNothing, offsetof(commandLine, json), "",
     "print JSON: see zq3hist-json(5)"},
    {"--last", optionLast, takesNumber, offsetof(commandLine, last), " N", "only the newest N"},
    {"--since", optionSince, takesTimestamp, offsetof(commandLine, since), " TIMESTAMP",
     "only from this time on"},
    {"--keep", optionKeep, takesNumber, offsetof(commandLine, keep), " N",
     "from the oldest of the newest N images that can be restored"},
    {"--before", optionBefore, takesTimestamp, offsetof(commandLine, before), " TIMESTAMP",
     "the newest image at or before this time"},
    {"--incomplete", optionIncomplete, takesNothing, offsetof(commandLine, incomplete), "",
     "only those that cannot be restored"},
    {"--all", optionAll, takesNothing, offsetof(commandLine, all), "",
     "also those that failed or are not active, marked"},
    {"--have", optionHave, takesText, offsetof(commandLine, have), " FILE",
     "a list of the images on hand: those not in it count as missing"},
    {"--max-age", optionMaxAge, takesNumber, offsetof(commandLine, maxAge), " HOURS",
     "how old the newest image that can be restored may be"},
    {"--color", optionColor, takesChoice, offsetof(commandLine, color), "[=WHEN]",
     "always, never, or auto: on a terminal unless NO_COLOR is set"},
    {"--svg", optionSvg, takesText, offsetof(commandLine, svg), " FILE",
     "draw into an SVG file; - is standard output"},
    {"--wait", optionWait, takesNumber, offsetof(commandLine, wait), " SECONDS",
     "how long to wait for the lock; 0: not at all"},
    {"--dry-run", optionDryRun, takesNothing, offsetof(commandLine, dryRun), "",
     "say what would be done, and do nothing"},
    {"--force", optionForce, takesNothing, offsetof(commandLine, force), "",
     "replace a file that is there"},
    {"--skip-existing", optionSkipExisting, takesNothing, offsetof(commandLine, skipExisting), "",
     "leave out entries that the history holds already"},
    {"--since", optionNeededSince, takesTimestamp, offsetof(commandLine, since), " TIMESTAMP",
     "what restores to images from this time on need stays"},
    {"--before", optionPruneBefore, takesTimestamp, offsetof(commandLine, before), " TIMESTAMP",
     "remove the entries before this time"},
    {"--force", optionSalvage, takesNothing, offsetof(commandLine, force), "",
     "where neither file is whole, go on with what can be read"},
    {"--all", optionAllLocks, takesNothing, offsetof(commandLine, all), "",
     "the locks of all dead processes, also where the directory is gone"},
};

static bool parseNumber(const char* text, long* number)
{
    size_t length = strlen(text);
    *number = strtol(text, nullptr, 10);
    return length != 0 && length < 10 && strspn(text, "0123456789") == length;
}

static int takeOptionValue(const option* taken, const char* value, commandLine* line)
{
    char* member = reinterpret_cast<char*>(line) + taken->at;
    if (taken->kind == takesNothing)
        *reinterpret_cast<bool*>(member) = true;
    else if (taken->kind == takesText || taken->kind == takesChoice)
        *reinterpret_cast<const char**>(member) = value;
    else if (taken->kind == takesNumber && !parseNumber(value, reinterpret_cast<long*>(member)))
        return failUsage("%s takes a number, not %s", taken->name, value);
    int rc = taken->kind == takesTimestamp ? takeInstant(taken->name, value, member) : 0;
    return rc == 0 && taken->kind == takesTimestamp && !isTime(member)
               ? failUsage("%s takes a date and a time that exist, not %s", taken->name, value)
               : rc;
}

// Takes the option at argv[*at], and its value if that is the next argument.
static int takeOption(int argc, char** argv, int* at, commandLine* line)
{
    const char* argument = argv[*at];
    size_t length = strcspn(argument, "=");
    const char* value = argument[length] == '=' ? argument + length + 1 : nullptr;
    for (const option& known : options) {
        if ((line->command->options & known.bit) == 0 || strlen(known.name) != length ||
            strncmp(known.name, argument, length) != 0)
            continue;
        if (known.kind == takesNothing && value != nullptr)
            return failUsage("%s takes no value", known.name);
        if (known.kind == takesChoice && value == nullptr)
            value = "always";
        if (known.kind != takesNothing && value == nullptr && ++*at < argc)
            value = argv[*at];
        if (known.kind != takesNothing && value == nullptr)
            return failUsage("%s needs a value:%s", known.name, known.value);
        return takeOptionValue(&known, value, line);
    }
    return failUsage("%s: unknown option %s", line->command->name, argument);
}

// --- Help ----------------------------------------------------------------------------------------

static void showOptions(unsigned int bits)
{
    for (const option& known : options)
        if ((bits & known.bit) != 0)
            printf("  %s%-*s %s\n", known.name, 24 - static_cast<int>(strlen(known.name)),
                   known.value, known.help);
    puts("  -d ALIAS                 in place of DIR: the database's directory in $ZQ3DBPATH");
}

static int showHelpOf(const subcommand* command)
{
    printf("Usage: zq3hist %s [OPTION...] %s\n\n%c%s.\n\n", command->name, command->form,
           toupper(command->help[0]), command->help + 1);
    showOptions(command->options);
    return exitDone;
}

static int showHelp(void)
{
    puts("Usage: zq3hist SUBCOMMAND [OPTION...] DIR [ARGUMENT...]\n\n"
         "Looks after history directories: the history file zq3rhist.asc and its shadow.\n");
    for (const subcommand& command : subcommands)
        printf("  %-9s %-30s %s\n", command.name, command.form, command.help);
    puts("\nOptions of several subcommands; zq3hist help SUBCOMMAND shows all of one:\n");
    showOptions(optionJson | optionHave | optionWait);
    puts("  --                       what follows is no option\n"
         "  --help, --version        show this text, or the version\n\n"
         "A TIMESTAMP is written 20250111010000 or '2025-01-11 01:00:00'.\n\n"
         "Exit status:");
    for (int status = exitDone; status <= exitIncomplete; status++)
        printf("  %d  %s\n", status, wordsForStatus(status));
    return exitDone;
}

// --- Arguments -----------------------------------------------------------------------------------

// The directory of a database, as the planner finds it.
static int takeAlias(const char* alias, commandLine* line)
{
    const char* folder = getenv("ZQ3DBPATH");
    bool here = folder == nullptr || folder[0] == '\0';
    int count = line->numAliases++;
    if (alias == nullptr || alias[0] == '\0' || count >= line->command->numDirectories)
        return failUsage("-d takes an alias, once for each directory");
    char* path = line->aliasPaths[count];
    line->aliasAfter[count] = line->numArguments;
    int length = snprintf(path, pathCapacity, "%s%s%s", here ? "" : folder, here ? "" : "/", alias);
    if (length >= static_cast<int>(pathCapacity))
        return fail(alias, "the directory's name has more than %u bytes", maxDirectoryLength);
    for (char* c = path + length - strlen(alias); *c != '\0'; c++)
        *c = static_cast<char>(toupper(static_cast<unsigned char>(*c)));
    return 0;
}

// Takes options and aliases out; the other arguments move to the front.
static int takeOptions(int argc, char** argv, commandLine* line, bool* helpGiven)
{
    bool ended = false;
    int rc = 0;
    for (int i = 0; rc == 0 && i < argc && !*helpGiven; i++) {
        if (ended || argv[i][0] != '-' || argv[i][1] == '\0')
            argv[line->numArguments++] = argv[i];
        else if (strcmp(argv[i], "--") == 0)
            ended = true;
        else if (strcmp(argv[i], "--help") == 0 || strcmp(argv[i], "-h") == 0)
            *helpGiven = true;
        else if (strcmp(argv[i], "-d") == 0)
            rc = takeAlias(argv[++i], line);
        else
            rc = takeOption(argc, argv, &i, line);
    }
    argv[line->numArguments] = nullptr;
    line->arguments = argv;
    return rc;
}

// Takes the directories: the aliases, and the first arguments for those that are left, in the order
// in which they were given.
static int takeDirectories(commandLine* line)
{
    const subcommand* command = line->command;
    enum : int { mostDirectories = 2 };
    historyPlace* places[mostDirectories] = {&line->place, &line->target};
    bool noneTaken = (command->options & optionAllLocks) != 0 && line->all;
    int taken = noneTaken ? 0 : command->numDirectories;
    if (line->numAliases > taken)
        return failUsage("-d takes an alias, once for each directory");
    int given = taken - line->numAliases;
    line->arguments += given;
    line->numArguments -= given;
    if (line->numArguments < command->least ||
        (command->most >= 0 && line->numArguments > command->most))
        return failForm(line);
    int rc = 0, alias = 0;
    for (int i = 0; rc == 0 && i < taken && i < mostDirectories; i++) {
        int argument = i - alias;
        bool isAlias =
            alias < line->numAliases && (argument == given || line->aliasAfter[alias] <= argument);
        rc = takePlace(isAlias ? line->aliasPaths[alias] : line->arguments[argument - given],
                       places[i]);
        alias += isAlias;
        places[i]->wait = line->wait;
    }
    return rc;
}

static bool changed;

bool hasChanged(void)
{
    return changed;
}

static int runSubcommand(const subcommand* command, int argc, char** argv)
{
    commandLine line = {};
    bool helpGiven = false;
    line.command = command;
    line.last = line.keep = line.maxAge = line.wait = -1;
    int rc = takeOptions(argc, argv, &line, &helpGiven);
    if (helpGiven)
        return showHelpOf(command);
    if (rc == 0)
        rc = takeDirectories(&line);
    if (rc == 0)
        rc = command->run(&line);
    fflush(stdout); // what was done is told, whatever signal comes now
    releaseSignals();
    changed = rc == exitDone && (command->options & optionDryRun) != 0 && !line.dryRun;
    return rc;
}

static const subcommand* findSubcommand(const char* name)
{
    for (const subcommand& command : subcommands)
        if (strcmp(name, command.name) == 0)
            return &command;
    return nullptr;
}

int runProgram(int argc, char** argv)
{
    if (argc < 2)
        return failUsage("no subcommand given");
    const char* name = argv[1];
    bool help = strcmp(name, "help") == 0;
    if ((help && (argc == 2 || argv[2][0] == '-')) || strcmp(name, "--help") == 0 ||
        strcmp(name, "-h") == 0)
        return showHelp();
    if (strcmp(name, "--version") == 0) {
        puts("zq3hist " ZQ3HIST_VERSION);
        return exitDone;
    }
    const subcommand* command = findSubcommand(help ? argv[2] : name);
    if (command == nullptr)
        return failUsage("no subcommand %s", help ? argv[2] : name);
    return help ? showHelpOf(command) : runSubcommand(command, argc - 2, argv + 2);
}
