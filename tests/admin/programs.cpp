// zq3hist through its command line, on real directories.
#include <fcntl.h>
#include <random>
#include <sstream>
#include <sys/wait.h>

#include "tests/support.h"

namespace fs = std::filesystem;

static std::string replaced(std::string text, const std::string& what, const std::string& by)
{
    for (size_t at = 0; (at = text.find(what, at)) != std::string::npos; at += by.size())
        text.replace(at, what.size(), by);
    return text;
}

class ProgramTest : public HistoryTest
{
  protected:
    // Runs zq3hist with arguments separated by blanks, D/ and R/ standing for the history directory
    // and the scratch directory; returns standard output, standard error and the exit status.
    // Standard output goes to the file given instead, when there is one.
    std::string run(const std::string& arguments, const std::string& input = "",
                    const char* output = nullptr)
    {
        std::vector<std::string> words;
        std::istringstream in(arguments);
        for (std::string word; in >> word;)
            words.push_back(word.starts_with("D/")   ? directory + word.substr(2)
                            : word.starts_with("R/") ? root + word.substr(2)
                                                     : word);
        spill(root + "in", input);
        std::string out = root + "out", err = root + "err";
        pid_t child = fork();
        if (child == 0) {
            std::vector<char*> argv = {const_cast<char*>("zq3hist")};
            for (std::string& word : words)
                argv.push_back(word.data());
            argv.push_back(nullptr);
            dup2(::open((root + "in").c_str(), O_RDONLY), 0);
            dup2(::open(output ? output : out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), 1);
            dup2(::open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), 2);
            execv(ZQ3HIST, argv.data());
            _exit(99);
        }
        int status = 0;
        waitpid(child, &status, 0);
        std::string text = (output ? "" : slurp(out)) + slurp(err) + "[" +
                           std::to_string(WIFEXITED(status) ? WEXITSTATUS(status) : -1) + "]";
        if (size_t key = text.find("(key 0x"); key != std::string::npos)
            text.replace(key + 5, 10, "KEY");
        return replaced(replaced(text, directory, "D/"), root, "R/");
    }
};

static const char week[] = "# two images\n"
                           "Operation: backup\nTimestamp: 20250105010000\n"
                           "Tablespace: A\nTablespace: B\n\n"
                           "Operation: backup\nType: delta\nTimestamp: 20250106010000\n"
                           "Note: second\\n\\x07\nSQLCODE: 2\nTablespace: A\nTablespace: B\n";
static const char dumped[] = "Operation: backup\nTimestamp: 20250105010000\nNode: 0\nNumber: 1\n"
                             "Tablespace: A\nTablespace: B\n\n"
                             "Operation: backup\nType: delta\nTimestamp: 20250106010000\n"
                             "Note: second\\n\\x07\nNode: 0\nNumber: 2\n"
                             "Tablespace: A\nTablespace: B\nSQLCODE: 2\n\n[0]";
#define SOUND "zq3rhist.asc: sound, 2 entries\nzq3rhist.bak: sound, 2 entries\n[0]"
#define UNSOUND "zq3hist: the history is not sound, D/\n"

// A day of an administrator: each step's whole output.
TEST_F(ProgramTest, ATourOfTheSubcommands)
{
    fs::create_directory(root + "copy");
    const auto flipByte = [](const std::string& path, size_t at) {
        std::string file = slurp(path);
        file[at] ^= 1;
        spill(path, file);
    };
    const struct {
        const char* before; // what happens to the files first
        const char* arguments;
        const char* output;
    } steps[] = {
        {"", "dump D/",
         "zq3hist: cannot open the history: the directory holds no history file, D/\n"
         "zq3hist: hint: zq3hist load DIR FILE makes one\n[1]"},
        {"", "load D/", "2 entries appended\n[0]"},
        {"", "dump D/", dumped},
        {"", "verify D/", SOUND},
        {"", "status D/",
         "history   zq3rhist.asc: 2798 bytes, status ' ' (consistent), 2 entries, newest "
         "20250106010000 at offset 1814, node 0\n"
         "shadow    zq3rhist.bak: 2798 bytes, status 'C' (consistent since the last commit), 2 "
         "entries, newest 20250106010000 at offset 1814, node 0\n"
         "lock      free (key KEY)\n          usable; both files are in step\n[0]"},
        {"", "images D/",
         "20250105010000  full         database       2 tablespaces     1 image   complete\n"
         "20250106010000  delta        database       2 tablespaces     2 images  complete\n[0]"},
        {"", "plan D/ 20250106010000 b",
         "1/2  full         20250105010000  B  for 20250106010000\n"
         "2/2  delta        20250106010000  B  target\n[0]"},
        {"", "plan --json D/ 20250106010000",
         "{\"target\":\"20250106010000\",\"complete\":true,\"images\":["
         "{\"position\":1,\"kind\":\"full\",\"scope\":\"database\",\"timestamp\":"
         "\"20250105010000\",\"tablespaces\":[\"A\",\"B\"],\"whole\":true,\"neededBy\":["
         "\"20250106010000\"]},{\"position\":2,\"kind\":\"delta\",\"scope\":\"database\","
         "\"timestamp\":\"20250106010000\",\"tablespaces\":[\"A\",\"B\"],\"whole\":true,"
         "\"neededBy\":[]}],\"missing\":[]}\n[0]"},
        {"", "backup D/ R/image", "The history was backed up.\n[0]"},
        {"", "copy D/ R/copy", "The history was copied.\n[0]"},
        {"", "verify R/copy", SOUND},
        {"", "copy D/ D/", "zq3hist: source and target are the same directory, D/\n[1]"},
        {"shadow lost", "repair D/", "The shadow was made anew from the history file.\n[0]"},
        {"", "repair D/", "Nothing to repair: both files can be used and are in step.\n[0]"},
        {"entry flipped", "verify D/",
         "zq3rhist.asc: damaged at offset 1814: entry 2 cannot be read\n"
         "zq3rhist.bak: sound, 2 entries\n" UNSOUND
         "zq3hist: hint: zq3hist restore DIR DIR/zq3rhist.bak takes the entries of the "
         "shadow\n[1]"},
        {"", "load D/",
         "zq3hist: cannot append to the history: the history is damaged, D/\n"
         "zq3hist: hint: zq3hist verify DIR names the damage; zq3hist repair DIR and zq3hist "
         "restore DIR FILE mend it\n[1]"},
        {"", "verify D/", SOUND}, // undoing the batch has brought the shadow's entries back
        {"shadow spoiled", "restore D/ D/zq3rhist.bak",
         "zq3hist: cannot restore the history: the entry at offset 1814 is damaged, "
         "D/zq3rhist.bak\n[1]"},
        {"", "restore D/ D/zq3rhist.asc", "The history was restored.\n[0]"},
        {"", "verify D/", SOUND},
        {"both spoiled", "load D/",
         "zq3hist: cannot append to the history: the history is damaged, D/\n"
         "zq3hist: hint: zq3hist verify DIR names the damage; zq3hist repair DIR and zq3hist "
         "restore DIR FILE mend it\n[1]"},
        {"", "repair D/",
         "Neither file could be used. Both were moved aside, to zq3rhist.a and zq3rhist.b, and an "
         "empty history was made.\nzq3hist: the history is empty: restore a backup of it, or load "
         "it anew, D/\n[1]"},
        {"", "restore D/ R/image", "The history was restored.\n[0]"},
        {"", "dump D/", dumped},
        {"", "backup D/ R/none/image",
         "zq3hist: cannot write the backup: No such file or directory, R/none/image\n[1]"},
        {"", "verify", "zq3hist: usage: zq3hist verify DIR\nTry 'zq3hist --help'.\n[2]"},
        {"", "dump --xml D/", "zq3hist: dump: unknown option --xml\nTry 'zq3hist --help'.\n[2]"},
        {"", "plan D/ 20250107000000",
         "zq3hist: no image has the timestamp 20250107000000; zq3hist images DIR lists all, "
         "D/\n[1]"},
        {"", "--version", "zq3hist 1.0.0\n[0]"},
    };
    for (const auto& step : steps) {
        std::string before = step.before;
        if (before == "shadow lost")
            fs::remove(shadowPath);
        if (before == "entry flipped")
            flipByte(historyPath, 2400);
        if (before.ends_with("spoiled"))
            flipByte(shadowPath, before == "both spoiled" ? 10 : 2400);
        if (before == "both spoiled")
            flipByte(historyPath, 10);
        EXPECT_EQ(step.output, run(step.arguments, week)) << step.arguments;
    }
    EXPECT_EQ("zq3hist: cannot write: No space left on device, standard output\n[1]",
              run("dump D/", "", "/dev/full"));
    for (const fs::path& file : fs::directory_iterator(directory))
        EXPECT_NE(".tmp", file.extension());
}

TEST_F(ProgramTest, AMistakeNamesItsLineAndChangesNothing)
{
    const struct {
        const char* stanza; // behind a sound entry of three lines
        const char* output;
    } rows[] = {
        {"Operation: backup\nTimestamp: 2025", "\"2025\" but expected a timestamp of 14 digits, 5"},
        {"Operation: spin", "\"spin\" but expected one character, backup, restore, create "
                            "tablespace, rename tablespace, 4"},
        {"Operation: \\x20", "\" \" but expected a character that is no white space, 4"},
        {"Type: full\nNote: x", "\"\" but expected an Operation in the entry begun here, 4"},
        {"Operation: B\nTyp: full",
         "\"Typ\" but expected a field such as Operation, Timestamp or Tablespace, 5"},
        {"Operation: B\nno field", "\"no field\" but expected a line of the form Field: value, 5"},
        {"Operation: B\nId: a b", "\"a b\" but expected one word without white space, 5"},
        {"Operation: B\nFirst text: 1234567890123",
         "\"1234567890123\" but expected at most 12 characters, 5"},
        {"Operation: B\nNote: 1234567890123456789012345678901",
         "\"1234567890123456789012345678901\" but expected a note of at most 30 characters, 4"},
        {"Operation: B\nCommand: a\\x00", "\"a\\x00\" but expected a text without zero bytes, 5"},
        {"Operation: B\nCommand: \\q",
         "\"\\\\q\" but expected one of the escapes \\n, \\t, \\\\ and \\xHH, 5"},
        {"Operation: B\nNode: 65536", "\"65536\" but expected a number from 0 to 65535, 5"},
        {"Operation: B\nLog position: 12", "\"12\" but expected 12 hexadecimal digits, 5"},
        {"Operation: B\nOperation: B",
         "\"Operation\" but expected each field but Tablespace once in an entry, 5"},
    };
    for (const auto& row : rows) {
        std::string text = row.output;
        size_t line = text.rfind(", ");
        EXPECT_EQ("zq3hist: found " + text.substr(0, line) + ", standard input line " +
                      text.substr(line + 2) + "\n[1]",
                  run("load D/",
                      std::string("Operation: B\nTimestamp: 20250101000000\n\n") + row.stanza));
    }
    EXPECT_TRUE(fs::is_empty(directory));
}

// Entries with every kind of section and any bytes that an entry can hold.
TEST_F(ProgramTest, LoadingADumpGivesTheSameRecords)
{
    std::mt19937 random(7);
    const auto text = [&](size_t most, const char* never) {
        std::string bytes(random() % (most + 1), '\0');
        for (char& c : bytes)
            do
                c = static_cast<char>(random() % 3 == 0 ? 1 + random() % 255 : 'A' + random() % 26);
            while (strchr(never, c) != nullptr);
        return bytes;
    };
    SQLUH_HANDLE* handle = nullptr;
    ASSERT_EQ(0, sqluhCreate(directory.data()));
    ASSERT_EQ(0, sqluhBeginBatch(&handle, directory.data()));
    const char white[] = " \t\n\v\f\r";
    for (int i = 0; i < 400; i++) {
        entryBuilder entry;
        entry.data.operation = text(1, white).append("B")[0];
        entry.data.object = text(1, "").c_str()[0];
        entry.data.operationType = text(1, "").c_str()[0];
        entry.data.status = text(1, "").append("A")[0];
        entry.data.auxCode = text(1, "").c_str()[0];
        entry.data.entryNode = static_cast<uint16_t>(random());
        entry.data.entryNumber = static_cast<uint32_t>(random());
        entry.data.logPosition[random() % 6] = static_cast<uint8_t>(random());
        entry.objectPart = random() % 2 ? "20250101000000002" : text(17, white);
        entry.secondTimestamp = text(14, white), entry.idText = text(24, white);
        entry.firstText = text(12, white), entry.lastText = text(12, white);
        entry.qualifier = text(200, ""), entry.name = text(200, ""), entry.note = text(40, "");
        entry.longText = text(255, ""), entry.command = text(random() % 4 ? 9 : 3000, "");
        for (size_t n = random() % 5; n > 0; n--)
            entry.tablespaces.push_back(text(30, ""));
        entry.withSqlca = random() % 2;
        entry.ca.sqlcode = static_cast<int32_t>(random());
        entry.ca.sqlerrd[random() % 6] = static_cast<int32_t>(random());
        entry.ca.sqlwarn[random() % 11] = static_cast<char>(random());
        if (random() % 2) {
            entry.ca.sqlerrml = static_cast<int16_t>(random() % 70);
            memcpy(entry.ca.sqlerrmc, "to\xFFken", 6);
            memcpy(entry.ca.sqlerrp, "PRODUCT ", 8);
            memcpy(entry.ca.sqlstate, "58004", 5);
        }
        sqloseek(handle->fileHandle, 0, sqloFromEnd, nullptr);
        ASSERT_EQ(0, sqluhWriteEntry(handle, entry.build()));
    }
    ASSERT_EQ(0, sqluhEndBatch(&handle, sqluhCommit));
    std::string records = slurp(historyPath).substr(headerLength);
    std::string stanzas = run("dump D/");
    ASSERT_EQ("[0]", stanzas.substr(stanzas.size() - 3));
    EXPECT_EQ(
        std::string::npos,
        stanzas.find_first_not_of(
            "\n "
            "!\"#$%&'()*+,-./"
            "0123456789:;<=>?@ABCDEFGHIJKLMNOPQRSTUVWXYZ[\\]^_`abcdefghijklmnopqrstuvwxyz{|}~"));
    fs::remove(historyPath), fs::remove(shadowPath);
    EXPECT_EQ("400 entries appended\n[0]", run("load D/", stanzas.substr(0, stanzas.size() - 3)));
    EXPECT_TRUE(records == slurp(historyPath).substr(headerLength));
}

TEST_F(ProgramTest, JsonIsValidForAnyBytes)
{
    run("load D/", "Operation: B\nTimestamp: 20250101000000\nNote: \"\\\\\\n\nTablespace: \\xFF\n"
                   "SQLCA warnings: \\x01\n");
    EXPECT_EQ("{\"number\":1,\"node\":0,\"operation\":\"B\",\"object\":\"D\",\"type\":\"F\","
              "\"status\":\"A\",\"auxCode\":\"-\",\"timestamp\":\"20250101000000\",\"sequence\":"
              "\"001\",\"secondTimestamp\":\"\",\"firstText\":\"\",\"lastText\":\"\",\"id\":\"\","
              "\"qualifier\":\"\",\"name\":\"\",\"longText\":\"\",\"note\":\"\\\"\\\\\\u000A\","
              "\"command\":\"\",\"logPosition\":\"000000000000\",\"tablespaces\":[\"\\u00FF\"],"
              "\"sqlca\":{\"sqlcode\":0,\"sqlstate\":\"     \",\"id\":\"SQLCA   \",\"length\":136,"
              "\"tokens\":\"-" +
                  std::string(69, ' ') +
                  "\",\"product\":\"-       \",\"diagnostics\":[0,0,0,0,0,0],\"warnings\":"
                  "\"\\u0001          \",\"tokensLength\":0}}\n[0]",
              run("dump --json D/"));
}

TEST_F(ProgramTest, OnlyTheLocksOfTheDeadAreRemoved)
{
    run("load D/", week);
    SQLO_NLCK lock = {};
    ASSERT_EQ(0, sqloNLCKInit(historyPath.c_str(), &lock, sqloNLCKUseNodeNumber));
    const auto inChild = [](auto act) {
        pid_t child = fork();
        if (child == 0) {
            act();
            _exit(0);
        }
        waitpid(child, nullptr, 0);
    };
    EXPECT_EQ("The lock is free; nothing to remove.\n[0]", run("unlock D/"));
    inChild([&] { sqloNLCKLock(&lock, 0, 0); });
    EXPECT_EQ("zq3hist: cannot take the lock: a process died while it held the lock, D/\n"
              "zq3hist: hint: zq3hist unlock DIR removes the lock; the next open settles what the "
              "process left unfinished\n[1]",
              run("load D/", week));
    EXPECT_EQ("Removed the lock of a process that died while it held it.\n[0]", run("unlock D/"));
    inChild([&] { // a creator that died before the set was ready
        int id = semget(lock.key, 1, IPC_CREAT | IPC_EXCL | 0747);
        semctl(id, 0, SETVAL, 1);
    });
    EXPECT_EQ("Removed the lock of a process that died while it took it.\n[0]", run("unlock D/"));
    ASSERT_EQ(0, sqloNLCKLock(&lock, 0, 0));
    EXPECT_EQ("zq3hist: the lock is held by process " + std::to_string(getpid()) +
                  " and was left alone, D/\n[1]",
              run("unlock D/"));
    ASSERT_EQ(0, sqloNLCKUnlock(&lock));
    int foreign = semget(lock.key, 1, IPC_CREAT | 0600);
    EXPECT_TRUE(run("unlock D/")
                    .starts_with("zq3hist: cannot remove the lock: another program's "
                                 "semaphore set has the lock's key, D/\n"));
    EXPECT_EQ(0, semctl(foreign, 0, IPC_RMID)) << "it is still there";
}
