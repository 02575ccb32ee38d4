// zq3ckrst: the command line and the sequence of a run.
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <unistd.h>

#include "tool/zq3ckrst.h"

char VERBOSE = 0; // listings wanted

// What the command line asks for.
struct planOptions {
    char alias[aliasLength + 1];
    char timestamp[timestampLength + 1];
    restoreKind kind;
    bool namesGiven;
    int firstName; // index of the argument
    int numNames;
    unsigned int seen; // seenAlias, seenTimestamp
    bool helpGiven;    // nothing else is to be done
};
enum : unsigned int { seenAlias = 1, seenTimestamp = 2 };

static void getHelp()
{
    fputs("\n"
          "zq3ckrst: This utility allows the user to query the databse history\n"
          "          in order to generate a suggested sequence of backup image\n"
          "          timestamps and also gives a simplified restore syntax needed\n"
          "          for a manual restore.\n"
          "\n"
          "   -d <db name>     - Specify the database you wish to be restored.\n"
          "   -t <timestamp>   - Specify the incremental (delta) timestamp\n"
          "                      you wish to restore from.\n"
          "   -r <restoreType> - Specify DATABASE or TABLESPACE restore type.\n"
          "   -n <list of tablespace names>\n"
          "                    - If TABLESPACE restore type chosen, specify a\n"
          "                      list of tablespace names you wish to be restored\n"
          "                      separated by spaces.\n"
          "   -hu?             - Displays help/usage.\n"
          "\n"
          "\n"
          "Usage: zq3ckrst [-hu?] -d <db name> -t <timestamp>\n"
          "                [-r <restoreType> [-n <list of tablespace names>]]\n"
          "\n"
          "NOTES:\n"
          "      (1) The database history must exist in order for this utility \n"
          "          to be used. If the database history does not exist, first \n"
          "          use the HISTORY FILE option on the RESTORE command before \n"
          "          using this utility.\n"
          "      (2) It is highly recommended that you not use the FORCE option \n"
          "          on the PRUNE HISTORY command. The default operation of this \n"
          "          command prevents you from deleting history entries that may \n"
          "          be required for recovery from the most recent, full database \n"
          "          backup image, but with the FORCE option, it is possible to \n"
          "          delete entries that are required, which will affect the \n"
          "          output of this utility.\n"
          "      (3) It is recommended that you keep good records of your \n"
          "          backups and use this utility as a guide.\n"
          "\n"
          "Examples:\n"
          "\n"
          "   zq3ckrst -d sample -t 20001015193455 -r database\n"
          "   zq3ckrst -d sample -t 20001015193455 -r tablespace\n"
          "   zq3ckrst -d sample -t 20001015193455 -r tablespace -n tbsp1 tbsp2\n"
          "\n",
          stderr);
}

// --- The error report ----------------------------------------------------------------------------

const char errorString[] = "Error: zq3ckrst -";

// Writes the error report of a failure and returns its code.
static int reportFailure(const planFailure& failure)
{
    const planMessage& message = *failure.message;
    char text[512];
    snprintf(text, sizeof text, message.text, failure.argument);

    fflush(stdout); // what was listed before the failure stands before it on a terminal, too
    fprintf(stderr, "\n%s %s", errorString, text);
    fprintf(stderr, "\nReturn code of %d seen at line %u\n\n", message.code, message.site);
    return message.code;
}

static int reportError(const planMessage& message)
{
    return reportFailure({&message, "", 0});
}

// Reports a failed scan call, which has nothing to report when it failed without an SQLCODE.
static void reportScanFailure(const planFailure& failure)
{
    if (failure.sqlcode == 0)
        return;
    fprintf(stderr, "\n%s ", errorString);
    fprintf(stderr, "%s returned SQLCA Code %d at line %u\n\n", failure.message->text,
            failure.sqlcode, failure.message->site);
}

// Reports the failure of a stage.
static void reportStage(const planFailure& failure)
{
    switch (failure.message->code) {
    case scanOpenFailed:
    case scanGetFailed:
    case scanCloseFailed:
        reportScanFailure(failure);
        break;
    default:
        reportFailure(failure);
        break;
    }
}

// --- The command line ----------------------------------------------------------------------------
//
// Each option's function takes the option's value at argv[*at + 1] and leaves *at at the last
// argument that it used.

static int takeAliasOption(planOptions* options, int argc, char** argv, int* at)
{
    if (++*at >= argc || strlen(argv[*at]) > aliasLength)
        return reportError(msgAlias);
    strcpy(options->alias, argv[*at]);
    options->seen |= seenAlias;
    return 0;
}

static int takeTimestampOption(planOptions* options, int argc, char** argv, int* at)
{
    if (++*at >= argc || strlen(argv[*at]) != timestampLength)
        return reportError(msgTimestamp);
    strcpy(options->timestamp, argv[*at]);
    options->seen |= seenTimestamp;
    return 0;
}

static int takeRestoreType(planOptions* options, int argc, char** argv, int* at)
{
    if (++*at >= argc)
        return reportError(msgNoRestoreType);
    str2upper(argv[*at]);
    if (strcmp(argv[*at], "DATABASE") == 0)
        options->kind = restoreDatabase;
    else if (strcmp(argv[*at], "TABLESPACE") == 0)
        options->kind = restoreTablespace;
    else
        return reportError(msgRestoreType);
    return 0;
}

static int takeNames(planOptions* options, int argc, char** argv, int* at)
{
    if (options->namesGiven)
        return 0; // only the first list counts; the names of this one are skipped
    options->namesGiven = true;
    options->firstName = *at + 1;
    while (*at + 1 < argc && argv[*at + 1][0] != '-') {
        ++*at;
        options->numNames++;
    }
    return options->numNames == 0 ? reportError(msgNoNames) : 0;
}

static int takeOptionAt(planOptions* options, int argc, char** argv, int* at)
{
    switch (argv[*at][1]) {
    case 'd':
        return takeAliasOption(options, argc, argv, at);
    case 't':
        return takeTimestampOption(options, argc, argv, at);
    case 'r':
        return takeRestoreType(options, argc, argv, at);
    case 'n':
        return takeNames(options, argc, argv, at);
    case 'v':
        VERBOSE = 1;
        return 0;
    default:
        getHelp();
        options->helpGiven = true;
        return 0;
    }
}

// Returns 0 or the code of the first mistake, which was reported and followed by the help text.
static int parseCommandLine(planOptions* options, int argc, char** argv)
{
    int rc = 0;
    if (argc < 2) {
        getHelp();
        options->helpGiven = true;
    }
    for (int at = 1; at < argc && rc == 0 && !options->helpGiven; at++)
        if (argv[at][0] == '-')
            rc = takeOptionAt(options, argc, argv, &at);

    if (rc == 0 && !options->helpGiven && options->seen != (seenAlias | seenTimestamp))
        rc = reportError(msgNoAliasOrTimestamp);
    if (rc != 0)
        getHelp();
    return rc;
}

static void settleRestoreKind(planOptions* options)
{
    if (options->kind == restoreTablespace || !options->namesGiven)
        return;
    fprintf(stderr, "\nWARNING:  zq3ckrst - Tablespace name(s) given with \"DATABASE\" restore\n");
    fprintf(stderr, "                     type option; will continue as a tablespace restore\n");
    fprintf(stderr, "                     using name(s) specified.\n\n");
    options->kind = restoreTablespace;
}

// --- The run -------------------------------------------------------------------------------------

static int refuseTablespaceImage(const restorePlan* plan, restoreKind kind)
{
    bool tablespaceImage =
        plan->histData.entries[plan->histData.backupIndex].object == zq3ObjectTablespace;
    return kind == restoreDatabase && tablespaceImage ? failStage(msgTablespaceImage) : 0;
}

static void listEntriesFound(restorePlan* plan)
{
    if (!VERBOSE)
        return;
    printf("\n\nNumber of entries found: %d\n", plan->histData.numEntries);
    printf("Index of backup entry specified: %d\n", plan->histData.backupIndex);
    showEntries(&plan->histData);
}

static int renameTablespaces(restorePlan* plan)
{
    if (!isRenamePassDue(plan))
        return 0;
    int rc = updateHistoryEntriesforRename(&plan->histData);
    if (rc == 0 && VERBOSE) {
        printf("\n\nAfter update for rename tablespaces ...\n");
        showEntries(&plan->histData);
    }
    return rc;
}

static void warnNotInImage(const char* name)
{
    fflush(stdout);
    fprintf(stderr, "\nWARNING:  zq3ckrst - Tablespace name \"%s\" is not in the\n", name);
    fprintf(stderr, "                     image specified; will try to continue with\n");
    fprintf(stderr, "                     remaining valid names.\n\n");
}

static int listTablespaces(restorePlan* plan, const planOptions* options, char** argv)
{
    if (options->kind == restoreDatabase || !options->namesGiven)
        return listTargetTablespaces(plan);

    char** names = argv + options->firstName;
    int rc = listNamedTablespaces(plan, names, options->numNames);
    for (int i = 0; i < options->numNames && rc != outOfMemory; i++)
        if (!isNameListed(plan, names[i]))
            warnNotInImage(names[i]);
    return rc;
}

// Fills and prunes the matrix. Without tablespaces only the listings remain.
static int traceTimeline(restorePlan* plan)
{
    int rc = allocateTimelineMatrix(plan);
    if (rc == 0)
        rc = fillTimelineMatrix(plan->matrix, &plan->histData, plan->list, plan->numTablespaces,
                                plan->numBackups);
    if (rc == 0 && VERBOSE)
        showBeginningTimeline(plan);
    if (rc == 0)
        rc = scanAndUpdateTimelineMatrix(plan->matrix, plan->list, plan->numTablespaces,
                                         plan->numBackups);
    if (rc == 0 && VERBOSE)
        showNewTimeline(plan);
    return rc;
}

static int planRestore(restorePlan* plan, planOptions* options, char** argv)
{
    plan->histData.backupIndex = -1;
    plan->histData.renameIndex = -1;
    int rc =
        fetchHistoryEntries(options->alias, options->timestamp, &plan->histData, &plan->numBackups);
    if (rc == 0)
        rc = refuseTablespaceImage(plan, options->kind);
    if (rc != 0)
        return rc;

    listEntriesFound(plan);
    rc = listBackupImages(plan);
    if (rc == 0)
        rc = renameTablespaces(plan);
    if (rc == 0)
        rc = listTablespaces(plan, options, argv);
    if (rc == 0)
        rc = traceTimeline(plan);
    if (rc == 0)
        rc = printRestoreOrder(plan, options->alias, options->timestamp, options->kind);
    return rc;
}

// A plan that did not reach its reader must not end like one that did; no code of a stage says so.
static int checkReport(int rc)
{
    bool written = ferror(stdout) == 0 && fflush(stdout) == 0;
    if (written && (close(STDOUT_FILENO) == 0 || errno == EBADF))
        return rc;
    fprintf(stderr, "\n%s Cannot write the report: %s\n\n", errorString, strerror(errno));
    return rc != 0 ? rc : reportNotWritten;
}

int main(int argc, char** argv)
{
    // A plan for a large history is printed in large pieces, to a terminal too.
    static char outputBuffer[65536];
    setvbuf(stdout, outputBuffer, _IOFBF, sizeof outputBuffer);

    planOptions options = {};
    int rc = parseCommandLine(&options, argc, argv);
    if (rc != 0 || options.helpGiven)
        return rc;

    settleRestoreKind(&options);
    restorePlan plan = {};
    rc = planRestore(&plan, &options, argv);
    if (rc != 0)
        reportStage(lastFailure);
    freePlan(&plan);
    return checkReport(rc);
}
