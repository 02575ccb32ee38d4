// The program through its command line: arguments and a scripted history in, both streams and the
// status out.
#include <sys/wait.h>

#include "tests/support.h"

struct Case {
    std::string arguments, script, out, err = "";
    int status = 0;
    std::string program = ZQ3CKRST;
};

static void runCases(const std::vector<Case>& cases)
{
    std::string base = testing::TempDir() + "zq3ckrst." + std::to_string(getpid());
    std::string out = base + ".out", err = base + ".err";
    for (const Case& row : cases) {
        SCOPED_TRACE(row.program + " " + row.arguments + "\n" + row.script.substr(0, 500));
        setenv("ZQ3SCRIPT", row.script.c_str(), 1);
        int ended = system(("LD_LIBRARY_PATH=" SCRIPTED_DIR " " + row.program + " " +
                            row.arguments + " >" + out + " 2>" + err)
                               .c_str());
        EXPECT_EQ(slurp(out), row.out);
        EXPECT_EQ(slurp(err), row.err);
        EXPECT_EQ(WEXITSTATUS(ended), row.status);
    }
    unlink(out.c_str());
    unlink(err.c_str());
}

static const std::string help = R"(
zq3ckrst: This utility allows the user to query the databse history
          in order to generate a suggested sequence of backup image
          timestamps and also gives a simplified restore syntax needed
          for a manual restore.

   -d <db name>     - Specify the database you wish to be restored.
   -t <timestamp>   - Specify the incremental (delta) timestamp
                      you wish to restore from.
   -r <restoreType> - Specify DATABASE or TABLESPACE restore type.
   -n <list of tablespace names>
                    - If TABLESPACE restore type chosen, specify a
                      list of tablespace names you wish to be restored
                      separated by spaces.
   -hu?             - Displays help/usage.


Usage: zq3ckrst [-hu?] -d <db name> -t <timestamp>
                [-r <restoreType> [-n <list of tablespace names>]]

NOTES:
      (1) The database history must exist in order for this utility 
          to be used. If the database history does not exist, first 
          use the HISTORY FILE option on the RESTORE command before 
          using this utility.
      (2) It is highly recommended that you not use the FORCE option 
          on the PRUNE HISTORY command. The default operation of this 
          command prevents you from deleting history entries that may 
          be required for recovery from the most recent, full database 
          backup image, but with the FORCE option, it is possible to 
          delete entries that are required, which will affect the 
          output of this utility.
      (3) It is recommended that you keep good records of your 
          backups and use this utility as a guide.

Examples:

   zq3ckrst -d sample -t 20001015193455 -r database
   zq3ckrst -d sample -t 20001015193455 -r tablespace
   zq3ckrst -d sample -t 20001015193455 -r tablespace -n tbsp1 tbsp2

)";

// clang-format off
#define RULE "====================================================================\n"
#define TARGET "-d sample -t 20240104000000 "
#define SUGGESTED "\nSuggested restore order of images using timestamp 20240104000000 for\n" \
                  "database sample.\n" RULE
#define DB(day) " restore db sample incremental taken at 202401" day "000000\n"
#define TS(names, day) " restore db sample tablespace ( " names " ) incremental taken at 202401" \
                       day "000000\n"
#define PART(names, rows) SUGGESTED TS(names, "04") rows RULE "\n"
#define PLAN(rows) SUGGESTED DB("04") rows RULE "\n"
#define ERROR "\nError: zq3ckrst - "
#define FAILED(text, code, site) ERROR text "\nReturn code of " code " seen at line " site "\n\n"
#define SCAN_FAILED(call, code, site) \
    ERROR call " returned SQLCA Code " code " at line " site "\n\n"
#define NO_IMAGE FAILED("No image found for timestamp 20240104000000", "-8", "1316")
#define NAMES_WARNING \
    "\nWARNING:  zq3ckrst - Tablespace name(s) given with \"DATABASE\" restore\n" \
                      "                     type option; will continue as a tablespace restore\n" \
                      "                     using name(s) specified.\n\n"
#define UNKNOWN(name) "\nWARNING:  zq3ckrst - Tablespace name \"" name "\" is not in the\n" \
                      "                     image specified; will try to continue with\n" \
                      "                     remaining valid names.\n\n"

TEST(CommandLine, MistakesAndHelp)
{
    std::string timestamp = FAILED("Invalid timestamp", "-2", "469") + help;
    std::string missing = FAILED("Missing either database alias or timestamp", "-11", "554") + help;
    runCases({
        {"", "", "", help, 0},
        {"'-?' -d", "", "", help, 0},
        {TARGET "-", "", "", help, 0},
        {"-d ninechars -h", "", "", FAILED("Invalid database alias", "-1", "454") + help, 255},
        {"-d", "", "", FAILED("Invalid database alias", "-1", "454") + help, 255},
        {"-t 2024010400000", "", "", timestamp, 254},
        {"-t 202401040000000", "", "", timestamp, 254},
        {"-d sample -t", "", "", timestamp, 254},
        {"-r databases", "", "", FAILED("Invalid restore type", "-12", "495") + help, 244},
        {"-r", "", "", FAILED("Invalid restore type", "-12", "502") + help, 244},
        {"-n -d sample", "", "", FAILED("Missing list of tablespace names", "-11", "524") + help, 245},
        {"-d sample", "", "", missing, 245},
        {"20240104000000 -t 20240104000000 sample", "", "", missing, 245},
    });
}

TEST(CommandLine, OptionsTakeEffect)
{
    const char* history = "BDFA 20240104000000 A ABCDEFGHIJKLMNOPQR B\n";
    std::string whole = PLAN(DB("04")), part = PART("B", TS("B", "04"));
    runCases({
        // only the letter of an option counts, the last value wins, strays are skipped
        {"x -dat other -t 20240101000000 y -tt 20240104000000 -d sample -r tablespace -r dataBase",
         history, whole},
        {"-t 20240104000000 -d -h -d sample", history, whole},
        {"-d '' -t 20240104000000", "", "", NO_IMAGE, 248},
        {TARGET "-r TableSpace", history, PART("A, ABCDEFGHIJKLMNOPQR, B", DB("04"))},
        {TARGET "-r tablespace -n b b", history, part},
        {"-n b -r tablespace -n a " TARGET, history, part},
        {"-n b -r database " TARGET, "BPFA 20240104000000 B", PART("B", DB("04")), NAMES_WARNING, 0},
        {TARGET "-r tablespace -n c b abcdefghijklmnopqrs", history, part,
         UNKNOWN("C") UNKNOWN("ABCDEFGHIJKLMNOPQRS"), 0},
        {TARGET "-n c d", history, "", NAMES_WARNING UNKNOWN("C") UNKNOWN("D")
             FAILED("Invalid list of tablespace names specified", "-11", "748"), 245},
    });
}

TEST(CommandLine, AReportThatCannotBeWrittenIsNoSuccess)
{
    const std::string err = testing::TempDir() + "zq3ckrst." + std::to_string(getpid());
    setenv("ZQ3SCRIPT", "BDFA 20240104000000 A\n", 1);
    int ended = system(("LD_LIBRARY_PATH=" SCRIPTED_DIR " " ZQ3CKRST " " TARGET ">/dev/full 2>" +
                        err).c_str());
    EXPECT_EQ(1, WEXITSTATUS(ended));
    EXPECT_EQ(ERROR "Cannot write the report: No space left on device\n\n", slurp(err));
    unlink(err.c_str());
}

TEST(Fetch, ScanFailures)
{
#define GOOD "BDFA 20240104000000 A\nBDFA 20240105000000 A\n"
    std::string plan = PLAN(DB("04"));
    runCases({
        {TARGET, "@open 0 -1024\n" GOOD, "", SCAN_FAILED("OpenScan", "-1024", "1064"), 253},
        {TARGET, "@open 1 77\n@close 0 -5\n" GOOD, "", SCAN_FAILED("OpenScan", "77", "1064"), 253},
        {TARGET, "@open -1 0\n" GOOD, "", "", 253},
        {TARGET, "@open 0 2160\n" GOOD, plan},
        {TARGET, "@get1 0 -2161\n" GOOD, "", SCAN_FAILED("GetEntry", "-2161", "1159"), 252},
        {TARGET, "@get0 5 0\n@close 0 -5\n" GOOD, "", "", 252},
        {TARGET, "@get0 0 2165\n" GOOD, plan},
        {TARGET, "@close 0 -99\n", "", SCAN_FAILED("CloseScan", "-99", "1303"), 251},
        {TARGET, "@close -1 5\n" GOOD, plan},
    });
}

TEST(Fetch, TargetsThatDoNotCount)
{
    for (const char* history :
         {"", "@max 0\nBDFA 20240104000000 A", "BDFA 20240104000000002 A",
          "BDFA 20240104000000 A !-1", "BDFX 20240104000000 A", "RD_A 20240104000000 A",
          "NT_A 20240104000000 A B", "BDFA 20240104000001 A"})
        runCases({{TARGET, history, "", NO_IMAGE, 248}});
}

// Each allocation of a run failing in turn. The history fills the first 512 entries and one more.
TEST(Fetch, EachAllocationFailingInTurn)
{
#define NO_MEMORY ERROR "Memory allocation\nReturn code of -6 seen at line "
    std::string history = "BDFA 20240101000000 OLD\nOD_A 20240101000000 OLD\n"
                          "NT_A 20240102000000 OLD NEW\n";
    for (int i = 0; i < 509; i++)
        history += "OD_A 20240103000000\n";
    history += "BDIA 20240104000000 NEW\n";
    const char* const sites[] = {
        "1096", "1111", "1121", "1196", "1224", "1224", // buffers of the scan; entries, two lists
        "1196", "1224", "627", "627", "1224",           // the 513th entry; images; renames, a list
        "286", "782", "892", "",                        // tablespaces; matrix; selected
    };
    std::string begun = SUGGESTED TS("NEW", "04"), plan = begun + DB("01") DB("04") RULE "\n";
    int request = 0;
    for (const std::string site : sites) {
        Case row = {TARGET "-r tablespace -n new", history, plan};
        if (!site.empty())
            row = {row.arguments, history, site == "892" ? begun : "", NO_MEMORY + site + "\n\n", 250};
        row.program = "ZQ3FAILAT=";
        row.program += std::to_string(++request) + " " ZQ3CKRST_FAILING;
        runCases({row});
    }
}

TEST(Plan, Chains)
{
#define F1 "BDFA 20240101000000 A B\n"
#define I4 "BDIA 20240104000000 A B\n"
#define D4 "BDDA 20240104000000 A B\n"
    runCases({
        {TARGET, F1 "BDEA 20240101120000 A B\nBDOA 20240102000000 A B\n"
         "BDDA 20240103000000 A B\n" D4, PLAN(DB("01") DB("02") DB("03") DB("04"))},
        // a full image of one tablespace among database images
        {TARGET, F1 "BDIA 20240102000000 A B\nBPFA 20240103000000 B\n" D4,
         PLAN(TS("A", "01") TS("A", "02") DB("03") DB("04"))},
        // an image that holds nothing is restored, one of other tablespaces is not
        {TARGET, F1 "BDFA 20240102000000\nBPFA 20240103000000 C\n" I4,
         PLAN(DB("01") DB("02") DB("04"))},
        // a restore discards the images after the one it used
        {TARGET, F1 "BDFA 20240102000000 A B\nRD_A 20240103000000 A B =20240101000000\n" I4,
         PLAN(DB("01") DB("04"))},
        // B fails at a newer entry than A, but A stands first in the list
        {TARGET, F1 "RD_A 20240101120000 A =20240101110000\nBDDA 20240102000000 B\n"
         "RD_A 20240103000000 B =20240102120000\n" I4, "",
         FAILED("Missing required backup image for\ntablespace A", "-10", "1487"), 246},
        {TARGET, F1 "AT_A 20240102000000 B\nBDIA 20240103000000 A\n" D4, "",
         FAILED("Missing required full backup image for\ntablespace B", "-10", "1642"), 246},
        {TARGET, "BDFA 20240102000000 A\nBDIA 20240104000000", PLAN(DB("04"))},
        // no slot for B
        {TARGET "-r tablespace", "@max 1\nBDFA 20240104000000 A B", PART("A", DB("04"))},
        {TARGET "-v", "BPFA 20240104000000 A", "",
         FAILED("Database restore from a tablespace image detected.\n"
                "Can only restore such an image either at a tablespace level\n"
                "or with REBUILD WITH option. But please be aware that\n"
                "currently this utility is not supported for rebuild.\n"
                "Please re-issue utility with \"TABLESPACE\" option.\n", "-13", "597"), 243},
    });
}

// A printed entry; letters are its operation, object and type.
static std::string entry(const std::string& index, const std::string& timestamp,
                         const char* letters, const std::vector<const char*>& names,
                         const std::string& id = "")
{
    std::string text = "                Index: " + index + "\n            Timestamp: " + timestamp +
                       "\n            Operation: " + letters[0] +
                       "\n               Object: " + letters[1] +
                       "\n       Operation Type: " + letters[2] +
                       "\n            Backup ID: " + id +
                       "\nNumber of Tablespaces: " + std::to_string(names.size()) + "\n";
    for (size_t i = 0; i < names.size(); i++)
        text += "        Tablespace[" + std::to_string(i) + "]: " + names[i] + "\n";
    return text + "\n";
}

// Two images of one timestamp, entries out of order, every letter of the keep rule, a rename that
// takes a name away from another tablespace, entries after the target.
TEST(Plan, VerboseListsEverything)
{
    auto entries = [](const char* old, const char* taken) {
        return entry("1", "20240101000000", "BDF", {old, "SYS", taken}) +
               entry("3", "20240102000000", "NT_", {old, taken}) +
               entry("4", "20240103000000", "AT_", {"T"}) +
               entry("5", "20240103000000", "AT_", {"U"}) +
               entry("0", "20240104000000", "BDI", {"NEW", "SYS"}) +
               "===== ENTRIES BELOW IGNORED =====\n\n" +
               entry("2", "20240104000000", "BPE", {"LATE"}) +
               entry("6", "20240105000000", "RD_", {"SYS"}, "20240101000000");
    };
    std::string head = "Num Tablespaces: 2 Num Backups: 2\nName: NEW ID: 00000 Deleted: 0\n"
                       "Name: SYS ID: 00001 Deleted: 0\n";
    runCases({{
        "-v " TARGET,
        "BDIi 20240104000000 NEW SYS\nBDFA 20240101000000 OLD SYS NEW\n"
        "BDFA 20240101000000002 OLD SYS NEW\nBPEI 20240104000000 LATE\n"
        "NT_a 20240102000000 OLD NEW\nDX_A 20240103000001\n"
        "AT_A 20240103000000 \"create system_ TEMPORARY tablespace\n"
        "AT_A 20240103000000 T \"create system__ temporary tablespace t\n"
        "AT_A 20240103000000 U \" create user temporary tablespace t\n"
        "RD_A 20240105000000 SYS =20240101000000001\n",
        "\n\nNumber of entries found: 7\nIndex of backup entry specified: 4\n" +
        entries("OLD", "NEW") +
        "\n\nAfter update for rename tablespaces ...\n" + entries("NEW", "***") +
        head + "\nBeginning Timeline:\n\n00000 00001 \n\n"
        "  F     F   \t20240101000000\n  I     I   \t20240104000000\n\n" +
        head + "\nNew Timeline:\n\n00000 00001 \n\n"
        "  F     F   \t20240101000000 < 3\n  I     I   \t20240104000000 < 2\n\n"
        PLAN(TS("NEW, SYS", "01") DB("04"))}});
}
// clang-format on
