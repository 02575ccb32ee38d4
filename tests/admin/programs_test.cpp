// zq3hist through its command line, on real directories.
#include <algorithm>
#include <random>
#include <sys/wait.h>

#include <nlohmann/json.hpp>

#include "tests/admin/program.h"

static const char week[] = "# two images\n"
                           "Operation: backup\nTimestamp: 20250105010000\n"
                           "Tablespace: A  \nTablespace: B\n\n"
                           "Operation: backup\nType: delta\nTimestamp: 20250106010000\n"
                           "Note: second\\n\\x07\nSQLCODE: 2\nTablespace: A\nTablespace: B\n";
static const char dumped[] = "Operation: backup\nTimestamp: 20250105010000\nNode: 0\nNumber: 1\n"
                             "Tablespace: A\nTablespace: B\n\n"
                             "Operation: backup\nType: delta\nTimestamp: 20250106010000\n"
                             "Note: second\\n\\x07\nNode: 0\nNumber: 2\n"
                             "Tablespace: A\nTablespace: B\nSQLCODE: 2\n\n";
#define SOUND "zq3rhist.asc: sound, 2 entries\nzq3rhist.bak: sound, 2 entries\n[0]"

// A day of an administrator: each step's whole output.
TEST_F(ProgramTest, ATourOfTheSubcommands)
{
    fs::create_directory(root + "copy");
    fs::create_directory(root + "it's");
    const struct {
        const char* before;
        const char* arguments;
        std::string output;
    } steps[] = {
        {": >h/zq3rhist.asc; ", "load h/", "2 entries appended\n[0]"},
        {"", "status h/",
         "history   zq3rhist.asc: 2798 bytes, status ' ' (consistent), 2 entries, newest "
         "20250106010000 at offset 1814, node 0\n"
         "shadow    zq3rhist.bak: 2798 bytes, status 'C' (consistent since the last commit), 2 "
         "entries, newest 20250106010000 at offset 1814, node 0\n"
         "lock      free (key KEY)\n          usable; both files are in step\n[0]"},
        {"", "plan h/ 20250106010000 b",
         "1/2  full         20250105010000  B  for 20250106010000\n"
         "2/2  delta        20250106010000  B  target\n[0]"},
        {"", "backup h/ image", "2 entries backed up\n[0]"},
        {"", "copy h/ copy", "2 entries copied\n[0]"},
        {"", "verify copy/", SOUND},
        {"", "copy h/ h/", "zq3hist: source and target are the same directory, h/\n[1]"},
        {"rm h/zq3rhist.asc; ", "dump h/",
         dumped + std::string("zq3hist: warning: the history file cannot be used; the shadow was "
                              "read, h/\n[0]")},
        {"", "repair h/", "The history file was made anew from the shadow: 2 entries\n[0]"},
        {"", "backup h/ none/image",
         "zq3hist: cannot back up the history: No such file or directory, none/image\n[1]"},
        {"", "backup h/ h/zq3rhist.bak",
         "zq3hist: the backup would replace the history itself, h/zq3rhist.bak\n[1]"},
        {"mkdir ./-w; ", "status -- -w",
         "zq3hist: cannot show the history: the directory holds no history file, ./-w/\n"
         "zq3hist: hint: zq3hist restore ./-w/ FILE  # FILE: a backup; without one, zq3hist load "
         "./-w/ FILE begins anew\n[3]"},
        {"", "load h/ >/dev/full",
         "zq3hist: what was asked for is done, but cannot be told: No space left on device, "
         "standard output\n[1]"},
        {"mkdir 'tab\t'; ", "status 'tab\t'",
         "zq3hist: cannot show the history: the directory holds no history file, tab\\x09/\n"
         "zq3hist: hint: zq3hist restore $'tab\\x09/' FILE  # FILE: a backup; without one, "
         "zq3hist load $'tab\\x09/' FILE begins anew\n[3]"},
        {"", "status \"it's\"",
         "zq3hist: cannot show the history: the directory holds no history file, it's/\n"
         "zq3hist: hint: zq3hist restore $'it\\'s/' FILE  # FILE: a backup; without one, zq3hist "
         "load $'it\\'s/' FILE begins anew\n[3]"},
        {"", "--version", "zq3hist 1.0.0\n[0]"},
        {"", "dump h/ >/dev/full",
         "zq3hist: cannot write: No space left on device, standard output\n[1]"},
        {"", "backup h/ - >/dev/full",
         "zq3hist: cannot write: No space left on device, standard output\n[1]"},
    };
    for (const auto& step : steps)
        EXPECT_EQ(step.output, run(step.arguments, week, step.before)) << step.arguments;
    for (const fs::path& file : fs::recursive_directory_iterator(root))
        EXPECT_NE(".tmp", file.extension());
}

TEST_F(ProgramTest, AMistakeNamesItsLineAndChangesNothing)
{
    const struct {
        const char* stanza; // after a sound entry of three lines
        std::string report;
        int line;
    } rows[] = {
        {"Operation: backup\nTimestamp: 2025", "\"2025\" but expected a timestamp of 14 digits", 5},
        {"Operation: backup\nTimestamp: 20251301000000",
         "\"20251301000000\" but expected a date and a time that exist", 5},
        {"Operation: backup\nSecond timestamp: 20250229000000",
         "\"20250229000000\" but expected a date and a time that exist", 5},
        {"Operation: restore\nId: 20251301000000",
         "\"20251301000000\" but expected a date and a time that exist", 5},
        {"Operation: backup\nTablespace: ABCDEFGHIJKLMNOPQRS",
         "\"ABCDEFGHIJKLMNOPQRS\" but expected a name of at most 18 characters", 5},
        {"Operation: backuq",
         "\"backuq\" but expected one character, backup, restore, create "
         "tablespace, rename tablespace",
         4},
        {"Operation: \\x20", "\" \" but expected a character that is no white space", 4},
        {"Type: full\nNote: x", "\"\" but expected an Operation in the entry begun here", 4},
        {"Operation: B\nTyp: full",
         "\"Typ\" but expected a field such as Operation, Timestamp or Tablespace", 5},
        {"Operation: B\nno field", "\"no field\" but expected a line of the form Field: value", 5},
        {"Operation: B\nId: a b", "\"a b\" but expected one word without white space", 5},
        {"Operation: B\nFirst text: 1234567890123",
         "\"1234567890123\" but expected at most 12 characters", 5},
        {"Operation: B\nNote: 1234567890123456789012345678901",
         "\"1234567890123456789012345678901\" but expected a note of at most 30 characters", 5},
        {"Operation: B\nCommand: a\\x00", "\"a\\x00\" but expected a text without zero bytes", 5},
        {"Operation: B\nCommand: \\q",
         "\"\\\\q\" but expected one of the escapes \\n, \\t, \\\\ and \\xHH", 5},
        {"Operation: B\nNode: 65536", "\"65536\" but expected a number from 0 to 65535", 5},
        {"Operation: B\nLog position: 12", "\"12\" but expected 12 hexadecimal digits", 5},
        {"Operation: B\nOperation: B",
         "\"Operation\" but expected each field but Tablespace once in an entry", 5},
    };
    for (const auto& row : rows)
        EXPECT_EQ("zq3hist: found " + row.report + ", standard input line " +
                      std::to_string(row.line) + "\n[1]",
                  run("load h/",
                      std::string("Operation: B\nTimestamp: 20250101000000\n\n") + row.stanza));
    EXPECT_TRUE(fs::is_empty(directory));
}

TEST_F(ProgramTest, WrongCallsAreToldAndMakeNothing)
{
    const struct {
        const char* arguments;
        const char* report;
        int status = 2;
    } rows[] = {
        {"", "no subcommand given"},
        {"help nosuch", "no subcommand nosuch"},
        {"images", "usage: zq3hist images [OPTION...] DIR"},
        {"images h/ h/", "usage: zq3hist images [OPTION...] DIR"},
        {"plan h/", "usage: zq3hist plan [OPTION...] DIR TIMESTAMP [NAME...]"},
        {"images h/ --last", "--last needs a value: N"},
        {"images h/ --last=x", "--last takes a number, not x"},
        {"images h/ --since 20251301000000",
         "--since takes a date and a time that exist, not 20251301000000"},
        {"images h/ --json=1", "--json takes no value"},
        {"images h/ --nosuch", "images: unknown option --nosuch"},
        {"copy -d a -d b -d c", "-d takes an alias, once for each directory"},
        {"images -d a -d b", "-d takes an alias, once for each directory"},
        {"images h/ -d", "-d takes an alias, once for each directory"},
        {"chart h/ --json --svg -", "chart takes --svg or --json, not both"},
        {"chart h/ --color=blue", "--color takes always, never or auto, not blue"},
        {"needed-by h/ 1",
         "needed-by takes a timestamp such as 20250111010000 or '2025-01-11 01:00:00', not 1"},
        {"load nosuch", "cannot open the directory: No such file or directory, nosuch", 1},
        {"load in", "not a directory, in", 1},
        {"images h/ --have nosuch",
         "cannot read the history: the directory holds no history file, h/", 3},
    };
    for (const auto& row : rows) {
        const std::string said = run(row.arguments);
        EXPECT_EQ(std::string("zq3hist: ").append(row.report), said.substr(0, said.find('\n')));
        EXPECT_EQ(row.status, said[said.size() - 2] - '0') << said;
    }
    EXPECT_TRUE(fs::is_empty(directory));
    EXPECT_FALSE(fs::exists(root + "nosuch"));
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
    for (int i = 0; i < 800; i++) {
        entryBuilder entry;
        entry.data.operation = text(1, white).append("B")[0];
        for (char* letter : {&entry.data.object, &entry.data.operationType, &entry.data.auxCode})
            *letter = text(1, "").c_str()[0];
        entry.data.status = text(1, "").append("A")[0];
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
        entry.ca.sqlcode = random() % 2 ? static_cast<int32_t>(random()) : 0;
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
    EXPECT_EQ("800 entries backed up\n[0]", run("backup h/ image"));
    EXPECT_TRUE(slurp(historyPath) == slurp(root + "image"));
    run("dump h/");
    std::string stanzas = slurp(root + "out");
    for (char c : stanzas)
        ASSERT_TRUE(c == '\n' || (c >= ' ' && c <= '~'));
    EXPECT_EQ("800 entries appended\n[0]", run("load h/", stanzas, "rm h/*; "));
    EXPECT_TRUE(records == slurp(historyPath).substr(headerLength));
}

TEST_F(ProgramTest, JsonIsValidForAnyBytes)
{
    run("load h/", "Operation: rename tablespace\nTimestamp: 20250101000000\nNote: "
                   "\"\\\\\\n\nTablespace: \\x7F\\xFF\nTablespace: B\n"
                   "SQLCA warnings: \\x01\nCommand: abc\n");
    EXPECT_TRUE(run("dump --json h/").ends_with("}\n[0]"));
    const std::string text = slurp(root + "out");
    EXPECT_EQ(1, std::ranges::count(text, '\n'));
    nlohmann::json entry = nlohmann::json::parse(text);
    EXPECT_EQ("\"\\\n", entry["note"]);
    EXPECT_EQ("\u007F\u00FF", entry["tablespaces"][0]);
    EXPECT_EQ("\u0001          ", entry["sqlca"]["warnings"]);
    EXPECT_EQ(std::string("-").append(69, ' '), entry["sqlca"]["tokens"]);
    EXPECT_EQ(0, entry["sqlca"]["diagnostics"][5]);
    run("status --json h/");
    const nlohmann::json header = nlohmann::json::parse(slurp(root + "out"))["history"];
    EXPECT_EQ(2, header["maxTablespaceCount"]);
    EXPECT_EQ(3, header["maxCommandLength"]);
}

TEST_F(ProgramTest, OnlyTheLocksOfTheDeadAreRemoved)
{
    run("load h/", week);
    SQLO_NLCK lock = {};
    ASSERT_EQ(0, sqloNLCKInit(historyPath.c_str(), &lock, sqloNLCKUseNodeNumber));
    EXPECT_EQ("The lock is free; nothing to remove.\n[0]", run("unlock h/"));
    for (bool isReady : {true, false}) {
        pid_t child = fork();
        if (child == 0) {
            if (isReady)
                sqloNLCKLock(&lock, 0, 0);
            else
                semctl(semget(lock.key, 1, IPC_CREAT | IPC_EXCL | 0747), 0, SETVAL, 1);
            _exit(0);
        }
        waitpid(child, nullptr, 0);
        EXPECT_EQ("zq3hist: cannot take the lock: a process died while it held the lock, h/\n"
                  "zq3hist: hint: zq3hist unlock h/ && zq3hist repair h/  # removes the lock and "
                  "settles what is unfinished\n[4]",
                  run("load h/", week));
        EXPECT_EQ(std::string("Removed the lock of a process that died while it ") +
                      (isReady ? "held it.\n[0]" : "took it.\n[0]"),
                  run("unlock h/"));
    }
    ASSERT_EQ(0, sqloNLCKLock(&lock, 0, 0));
    EXPECT_EQ("zq3hist: the lock is held by process " + std::to_string(getpid()) +
                  "; it was left alone, h/\n[4]",
              run("unlock h/"));
    EXPECT_EQ("zq3hist: waiting: the lock is held by process " + std::to_string(getpid()) +
                  "\nzq3hist: the lock is held by process " + std::to_string(getpid()) +
                  ", h/\n[4]",
              run("load --wait 1 h/", week));
    sqloNLCKKeepFile(&lock, historyPath.c_str());
    sembuf step = {0, 1, 0};
    pid_t meddler = fork();
    if (meddler == 0)
        _exit(semop(lock.id, &step, 1));
    waitpid(meddler, nullptr, 0);
    EXPECT_EQ("zq3hist: the lock's holder lives, though process " + std::to_string(meddler) +
                  " freed the lock; it was left alone, h/\n[4]",
              run("unlock h/"));
    EXPECT_NE(std::string::npos, run("status --json h/").find("\"state\":\"freed\""));
    EXPECT_NE(std::string::npos, run("status h/").find("held, though another process freed it"));
    ASSERT_EQ(0, sqloNLCKUnlock(&lock));
    int foreign = semget(lock.key, 1, IPC_CREAT | 0600);
    EXPECT_TRUE(run("unlock h/")
                    .starts_with("zq3hist: cannot remove the lock: another program's "
                                 "semaphore set has the lock's key, h/\n"));
    EXPECT_EQ(0, semctl(foreign, 0, IPC_RMID)) << "it is still there";
}

// The image of a restore that was stopped is marked until it is whole; the shadow is the history.
TEST_F(ProgramTest, ARestoreThatWasStoppedIsRepaired)
{
    run("load h/", week);
    spill(historyPath, slurp(historyPath).substr(0, 2500));
    std::filesystem::permissions(historyPath, std::filesystem::perms::sticky_bit,
                                 std::filesystem::perm_options::add);
    EXPECT_NE(std::string::npos, run("status h/").find("the image was not restored to its end"));
    EXPECT_NE(std::string::npos, run("verify h/").find("zq3hist repair h/  # takes the entries"));
    EXPECT_EQ("The history file was made anew from the shadow: 2 entries\n[0]", run("repair h/"));
    EXPECT_EQ(slurp(historyPath).substr(1024), slurp(shadowPath).substr(1024));
    EXPECT_TRUE(run("verify h/").ends_with("[0]"));
}

// The locks of a node that no other test has: of a process that died, and of this one.
TEST_F(ProgramTest, LocksWithoutAFileAreRemovedWhereTheirOwnersDied)
{
    const uint32_t node = 245, place = static_cast<uint32_t>(getpid()) & 0x7FFFFF;
    SQLO_NLCK dead = {static_cast<int32_t>((node + 1) << 24 | place), -1}, alive = dead;
    alive.key ^= 1;
    if (fork() == 0) {
        sqloNLCKLock(&dead, 0, 0);
        _exit(0);
    }
    wait(nullptr);
    ASSERT_EQ(0, sqloNLCKLock(&alive, 0, 0));
    char removed[64];
    snprintf(removed, sizeof removed, "Removed the lock with the key 0x%08X\n",
             static_cast<unsigned int>(dead.key));
    EXPECT_EQ(removed + std::string("1 locks removed, 1 left alone\n[0]"),
              run("unlock --all", "", "export ZQ3NODE=245; "));
    EXPECT_EQ(0, sqloNLCKUnlock(&alive));
}
