// The program through its command line: arguments and a scripted history in, both streams and the
// status out.
#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

static std::string takeFile(const std::string& path)
{
    std::ifstream in(path);
    std::string text{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
    unlink(path.c_str());
    return text;
}

static void expectRun(const std::string& program, const std::string& arguments,
                      const std::string& script, const std::string& out, const std::string& err,
                      int status)
{
    setenv("ZQ3SCRIPT", script.c_str(), 1);
    std::string base = testing::TempDir() + "zq3ckrst." + std::to_string(getpid());
    int ended = system(("LD_LIBRARY_PATH=" SCRIPTED_DIR " " + program + " " + arguments + " >" +
                        base + ".out 2>" + base + ".err")
                           .c_str());
    EXPECT_EQ(takeFile(base + ".out"), out);
    EXPECT_EQ(takeFile(base + ".err"), err);
    EXPECT_EQ(WEXITSTATUS(ended), status);
}

struct Case {
    const char *arguments, *script;
    std::string out, err = "";
    int status = 0;
};

static void runCases(const std::vector<Case>& cases)
{
    for (const Case& row : cases) {
        SCOPED_TRACE(std::string(row.arguments) + "\n" + row.script);
        expectRun(ZQ3CKRST, row.arguments, row.script, row.out, row.err, row.status);
    }
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
#define NO_CHAIN(name) \
    FAILED("Missing required full backup image for\ntablespace " name, "-10", "1642")
#define NAMES_WARNING \
    "\nWARNING:  zq3ckrst - Tablespace name(s) given with \"DATABASE\" restore\n" \
                      "                     type option; will continue as a tablespace restore\n" \
                      "                     using name(s) specified.\n\n"
#define UNKNOWN(name) "\nWARNING:  zq3ckrst - Tablespace name \"" name "\" is not in the\n" \
                      "                     image specified; will try to continue with\n" \
                      "                     remaining valid names.\n\n"

TEST(CommandLine, MistakesAndHelp)
{
    std::string alias = FAILED("Invalid database alias", "-1", "454") + help;
    std::string timestamp = FAILED("Invalid timestamp", "-2", "469") + help;
    std::string names = FAILED("Missing list of tablespace names", "-11", "524") + help;
    std::string missing = FAILED("Missing either database alias or timestamp", "-11", "554") + help;
    runCases({
        {"", "", "", help, 0},
        {TARGET "-h", "", "", help, 0},
        {"'-?' -d", "", "", help, 0},
        {"-d sample -xyz", "", "", help, 0},
        {"-d sample -", "", "", help, 0},
        {"-d ninechars -h", "", "", alias, 255},
        {"-t 20240104000000 -d", "", "", alias, 255},
        {"-t 2024010400000", "", "", timestamp, 254},
        {"-t 202401040000000", "", "", timestamp, 254},
        {"-d sample -t", "", "", timestamp, 254},
        {TARGET "-r databases", "", "", FAILED("Invalid restore type", "-12", "495") + help, 244},
        {TARGET "-r", "", "", FAILED("Invalid restore type", "-12", "502") + help, 244},
        {"-n -d sample", "", "", names, 245},
        {TARGET "-n", "", "", names, 245},
        {"-d sample", "", "", missing, 245},
        {"20240104000000 -t 20240104000000 sample", "", "", missing, 245},
    });
}

TEST(CommandLine, OptionsTakeEffect)
{
    const char* history = "BDFA 20240104000000 A B\n";
    std::string whole = PLAN(DB("04")), part = PART("B", TS("B", "04"));
    runCases({
        {TARGET, history, whole},
        // only the letter of an option counts, the last value wins, strays are skipped
        {"x -dat other -t 20240101000000 y -tt 20240104000000 -d sample -r tablespace -r dataBase",
         history, whole},
        {"-t 20240104000000 -d -h -d sample", history, whole},
        {"-d '' -t 20240104000000", "", "", NO_IMAGE, 248},
        {TARGET "-r TableSpace", history, PART("A, B", DB("04"))},
        {TARGET "-r tablespace -n b b", history, part},
        {"-n b -r database " TARGET, history, part, NAMES_WARNING, 0},
        {"-n b -r tablespace -n a " TARGET, history, part},
        {TARGET "-r tablespace -n c b abcdefghijklmnopqrs", history, part,
         UNKNOWN("C") UNKNOWN("ABCDEFGHIJKLMNOPQRS"), 0},
        {TARGET "-n c d", history, "", NAMES_WARNING UNKNOWN("C") UNKNOWN("D")
             FAILED("Invalid list of tablespace names specified", "-11", "748"), 245},
    });
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
        {TARGET, "@get 1 0 -2161\n" GOOD, "", SCAN_FAILED("GetEntry", "-2161", "1159"), 252},
        {TARGET, "@get 0 5 0\n@close 0 -5\n" GOOD, "", "", 252},
        {TARGET, "@get 0 0 2165\n" GOOD, plan},
        {TARGET, "@close 0 -99\n" GOOD, "", SCAN_FAILED("CloseScan", "-99", "1303"), 251},
        {TARGET, "@close 0 -99\n", "", SCAN_FAILED("CloseScan", "-99", "1303"), 251},
        {TARGET, "@close -1 0\n" GOOD, plan},
    });
}

TEST(Fetch, TargetsThatDoNotCount)
{
    for (const char* history :
         {"", "@max 0\nBDFA 20240104000000 A", "BDFA 20240104000000002 A",
          "BDFA 20240104000000 A !-1", "BDFX 20240104000000 A", "BDF_ 20240104000000 A",
          "RD_A 20240104000000 A =20240101000000", "NT_A 20240104000000 A B",
          "ODFA 20240104000000 A", "BDFA 20240104000001 A"})
        runCases({{TARGET, history, "", NO_IMAGE, 248}});
}

// Each allocation of a run failing in turn. The history fills the first 512 entries and one more.
TEST(Fetch, EachAllocationFailingInTurn)
{
#define NO_MEMORY(site) FAILED("Memory allocation", "-6", site)
    std::string history = "BDFA 20240101000000 OLD\nNT_A 20240102000000 OLD NEW\n";
    for (int i = 0; i < 510; i++)
        history += "OD_A 20240103000000\n";
    history += "BDIA 20240104000000 NEW\n";
    const std::vector<const char*> reports = {
        NO_MEMORY("1096"), NO_MEMORY("1111"), NO_MEMORY("1121"), // buffers of the scan
        NO_MEMORY("1196"), NO_MEMORY("1224"), NO_MEMORY("1224"), // entries, names of two of them
        NO_MEMORY("1196"), NO_MEMORY("1224"),                    // the 513th entry and its names
        NO_MEMORY("627"), "", "", "", "",                        // images; table of the renames
        NO_MEMORY("286"), "", "",                                // list; its index and the image's
        NO_MEMORY("782"), "", NO_MEMORY("892"), "",              // matrix; index; selected; no more
    };
    std::string begun = SUGGESTED TS("NEW", "04");
    for (size_t i = 0; i < reports.size(); i++) {
        SCOPED_TRACE(i + 1);
        bool fails = *reports[i] != '\0';
        std::string out = !fails ? begun + DB("01") DB("04") RULE "\n" : i == 18 ? begun : "";
        expectRun("ZQ3FAILAT=" + std::to_string(i + 1) + " " ZQ3CKRST_FAILING,
                  TARGET "-r tablespace -n new", history, out, reports[i], fails ? 250 : 0);
    }
}

TEST(Plan, Chains)
{
#define F1 "BDFA 20240101000000 A B\n"
#define I2 "BDIA 20240102000000 A B\n"
#define I4 "BDIA 20240104000000 A B\n"
#define D4 "BDDA 20240104000000 A B\n"
    runCases({
        {TARGET, F1 I2 "BDOA 20240104000000 A B", PLAN(DB("01") DB("04"))},
        {TARGET, F1 "BDEA 20240101120000 A B\n" I2 "BDDA 20240103000000 A B\n" D4,
         PLAN(DB("01") DB("02") DB("03") DB("04"))},
        // a full image of one tablespace among database images
        {TARGET, F1 I2 "BPFA 20240103000000 B\n" D4,
         PLAN(TS("A", "01") TS("A", "02") DB("03") DB("04"))},
        {TARGET "-r tablespace -n b", F1 I4, PART("B", TS("B", "01") TS("B", "04"))},
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
        {TARGET, F1 "AT_A 20240102000000 B\nBDIA 20240103000000 A\n" D4, "", NO_CHAIN("B"), 246},
        {TARGET, I4, "", NO_CHAIN("A"), 246},
        {TARGET, "BDFA 20240101000000 X B\nNT_A 20240102000000 X Y\nNT_A 20240103000000 Y A\n" I4,
         PLAN(DB("01") DB("04"))},
        // no rename acts when the first one is older than every image
        {TARGET, "NT_A 20231231000000 A C\nNT_A 20240102000000 B C\n" F1 "BDIA 20240104000000 C",
         "", NO_CHAIN("C"), 246},
        {TARGET, "BDFA 20240102000000 A\nBDIA 20240104000000", PLAN(DB("04"))},
        // no slot for B
        {TARGET "-r tablespace", "@max 1\nBDFA 20240104000000 A B", PART("A", DB("04"))},
        {TARGET "-n a", "BPFA 20240104000000 A", PART("A", DB("04")), NAMES_WARNING, 0},
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

#define FOUND(entries, target) "\n\nNumber of entries found: " entries "\n" \
                               "Index of backup entry specified: " target "\n"
#define BELOW "===== ENTRIES BELOW IGNORED =====\n\n"

// Two images of one timestamp, entries out of order, every letter of the keep rule, a rename with
// too few names, one that takes a name away from another tablespace, entries behind the target.
TEST(Plan, VerboseListsEverything)
{
    auto entries = [](const char* old, const char* taken) {
        return entry("1", "20240101000000", "BDF", {old, "SYS", taken}) +
               entry("3", "20240102000000", "NT_", {old, taken}) +
               entry("4", "20240102000000", "NT_", {"SYS"}) +
               entry("5", "20240103000000", "AT_", {"T"}) +
               entry("6", "20240103000000", "AT_", {"U"}) +
               entry("7", "20240103000001", "OX_", {}) +
               entry("0", "20240104000000", "BDI", {"NEW", "SYS"}) + BELOW +
               entry("2", "20240104000000", "BPE", {"LATE"}) +
               entry("8", "20240105000000", "RD_", {"SYS"}, "20240101000000");
    };
    std::string head = "Num Tablespaces: 2 Num Backups: 2\nName: NEW ID: 00000 Deleted: 0\n"
                       "Name: SYS ID: 00001 Deleted: 0\n";
    expectRun(ZQ3CKRST, "-v " TARGET,
              "BDIi 20240104000000 NEW SYS\nBDFA 20240101000000 OLD SYS NEW\n"
              "BDFA 20240101000000002 OLD SYS NEW\nBPEI 20240104000000 LATE\n"
              "NT_a 20240102000000 OLD NEW\nNT_A 20240102000000 SYS\n"
              "AT_A 20240103000000 \"create system_ TEMPORARY tablespace\nDX_A 20240103000001\n"
              "AT_A 20240103000000 T \"create system__ temporary tablespace t\n"
              "AT_A 20240103000000 U \" create user temporary tablespace t\n"
              "OX_A 20240103000001\nRD_A 20240105000000 SYS =20240101000000 \n",
              FOUND("9", "6") + entries("OLD", "NEW") +
                  "\n\nAfter update for rename tablespaces ...\n" + entries("NEW", "***") + head +
                  "\nBeginning Timeline:\n\n00000 00001 \n\n"
                  "  F     F   \t20240101000000\n  I     I   \t20240104000000\n\n" + head +
                  "\nNew Timeline:\n\n00000 00001 \n\n"
                  "  F     F   \t20240101000000 < 3\n  I     I   \t20240104000000 < 2\n\n"
                  PLAN(TS("NEW, SYS", "01") DB("04")), "", 0);
}
// clang-format on
