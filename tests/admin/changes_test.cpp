// The subcommands that change a history, on sound pairs and on broken ones.
#include <algorithm>
#include <regex>

#include "tests/admin/program.h"

static const char week[] = "Operation: backup\nTimestamp: 20250105010000\nTablespace: A\n\n"
                           "Operation: backup\nType: delta\nTimestamp: 20250106010000\n"
                           "Tablespace: A\n\n"
                           "Operation: backup\nTimestamp: 20250107010000\nTablespace: A\n";
static const char more[] = "Operation: backup\nTimestamp: 20250108010000\nTablespace: A\n";

// Each entry of the week takes 779 bytes, after a header of 1024.
#define SPOIL(file, at)                                                                            \
    "printf '\\377' | dd of=h/zq3rhist." file " seek=" at " bs=1 conv=notrunc status=none; "
#define CUT(file, size) "truncate -s " size " h/zq3rhist." file "; "
#define OTHER                                                                                      \
    "mkdir x; zq3hist dump h | sed s/20250107/20250109/ | zq3hist load x >new; "                   \
    "cp x/zq3rhist.asc h/zq3rhist.bak; rm -r x; "
#define KILLED "killed"       // a batch of a process that was killed; its lock is there
#define BEGUN "begun"         // a batch of this process, which holds the lock
#define COMMITTED "committed" // the shadow was not made anew after a commit

class ChangeTest : public ProgramTest
{
  protected:
    std::string history, shadow;
    int followed = 0; // hints
    SQLUH_HANDLE* begun = nullptr;

    void follow(const std::string& arguments, std::string* trace);

    ChangeTest()
    {
        fs::create_directory(root + "bin");
        fs::create_symlink(ZQ3HIST, root + "bin/zq3hist");
        setenv("PATH", (root + "bin:" + getenv("PATH")).c_str(), 1);
        EXPECT_EQ("3 entries appended\n[0]", run("load h/", week));
        EXPECT_EQ("3 entries backed up\n[0]", run("backup h/ image"));
        history = slurp(historyPath);
        shadow = slurp(shadowPath);
        spill(root + "more", more);
        spill(root + "odd", "Operation: O\n");
    }

    // Half a batch of a process that ends with the lock in its hands.
    void killWriter()
    {
        pid_t child = fork();
        if (child == 0) {
            SQLUH_HANDLE* handle = nullptr;
            entryBuilder entry;
            sqluhBeginBatch(&handle, directory.data());
            sqloseek(handle->fileHandle, 0, sqloFromEnd, nullptr);
            sqluhWriteEntry(handle, entry.build());
            _exit(0);
        }
        waitpid(child, nullptr, 0);
    }

    // Puts the pair of the week there and does to it what state says.
    void prepare(const std::string& state)
    {
        sqluhEndBatch(&begun, sqluhAbandon);
        removeLockSet(historyPath);
        for (const fs::path& file : fs::directory_iterator(directory))
            fs::remove(file);
        fs::remove(root + "new");
        spill(historyPath, history);
        spill(shadowPath, shadow);
        if (state == KILLED)
            killWriter();
        else if (state == BEGUN)
            EXPECT_EQ(0, sqluhBeginBatch(&begun, directory.data()));
        else if (state == COMMITTED)
            EXPECT_EQ(0, sqluhUpdateHeaderStatus(historyPath.data(), statusCommitted));
        else
            EXPECT_EQ(0, system(("cd " + root + "; :; " + state).c_str()));
    }

    // How many entries of a file can be read; x: not even its header; -: there is no file.
    static std::string entriesIn(const std::string& path)
    {
        SQLO_FHANDLE file = sqloNoFile;
        SQLUH_HEADER header;
        SQLUH_WORKAREA workArea = {};
        int count = 0;
        if (sqloopenp(path.c_str(), sqloOpenRead, 0, &file) != 0)
            return "-";
        bool readable = sqluhReadHeader(file, &header) == 0;
        EXPECT_EQ(0, sqluhInitWorkArea(&workArea, defaultWorkAreaSize));
        while (readable && sqluhVerifyOneEntry(file, &workArea) == 0)
            count++;
        sqlofmblkEx(workArea.buffer);
        sqloclose(file);
        return readable ? std::to_string(count) : "x";
    }

    // Entries in history file, shadow and other files of the directory.
    std::string entriesThere()
    {
        std::string there = entriesIn(historyPath) + " " + entriesIn(shadowPath);
        std::vector<std::string> kept;
        for (const fs::path& file : fs::directory_iterator(directory))
            if (file != historyPath && file != shadowPath)
                kept.push_back(file);
        std::sort(kept.begin(), kept.end());
        for (const std::string& file : kept)
            there.append(" ").append(entriesIn(file));
        return there;
    }

    std::string runStamped(const std::string& arguments)
    {
        std::string text =
            std::regex_replace(run(arguments), std::regex("[0-9]+ hours old"), "HOURS old");
        std::string process = "process ";
        for (size_t at = 0; (at = text.find(process, at)) != std::string::npos; at++)
            if (size_t digits =
                    text.find_first_not_of("0123456789", at + process.size()) - at - process.size();
                digits != 0)
                text.replace(at + process.size(), digits, "PID");
        for (size_t at = 0; (at = text.find("h/zq3rhist.", at)) != std::string::npos;) {
            at += strlen("h/zq3rhist.asc");
            if (text[at] == '.')
                text.replace(at + 1, text.find_first_of("\n\"", at) - at - 1, "STAMP");
        }
        return text;
    }
};

#define KEPT(file) "The old file is kept as h/zq3rhist." file ".STAMP\n"
#define RESTORABLE                                                                                 \
    ", 3 images, 0 incomplete; newest that can be restored: 20250107010000, HOURS old\n"
#define NEITHER                                                                                    \
    "zq3hist: hint: zq3hist restore h/ FILE  # FILE: a backup; without one, zq3hist repair "       \
    "--force h/ goes on with what can be read\n[3]"
#define UNLOCK                                                                                     \
    "zq3hist: hint: zq3hist unlock h/ && zq3hist repair h/  # removes the lock and settles what "  \
    "is unfinished\n"
#define ENDS_EARLY                                                                                 \
    "zq3hist: warning: the history ends after 1 of 3 entries, h/\n"                                \
    "zq3hist: hint: zq3hist verify h/  # reads both files and tells what mends them\n"
#define AGAIN "zq3hist: hint: zq3hist verify h/  # again, once the reason that is given is gone\n"
#define FROM_SHADOW "zq3hist: hint: zq3hist repair h/  # takes the entries of the shadow\n[3]"

TEST_F(ChangeTest, WhatIsSaidAndWhatIsThereAfterwards)
{
    const struct {
        const char* state;
        const char* arguments;
        const char* output;
        const char* there; // entries in history file, shadow, and files that are kept
    } rows[] = {
        {"", "load --dry-run h/ more", "1 entry would be appended\n[0]", "3 3"},
        {"", "load h/ more", "1 entry appended\n[0]", "4 4"},
        {"cat more >>in; ", "load --skip-existing h/ more",
         "1 entry appended, 0 that were there left out\n[0]", "4 4"},
        {"zq3hist dump h >all; ", "load --skip-existing h/ all",
         "0 entries appended, 3 that were there left out\n[0]", "3 3"},
        {SPOIL("asc", "2000"), "load h/ more",
         "zq3hist: cannot append to the history: the entry at offset 1803 is damaged, "
         "h/zq3rhist.asc\n" FROM_SHADOW,
         "1 3"},
        {SPOIL("asc", "2000"), "load --dry-run h/ more",
         "zq3hist: cannot append to the history: the entry at offset 1803 is damaged, "
         "h/zq3rhist.asc\n" FROM_SHADOW,
         "1 3"},
        {CUT("asc", "1803") CUT("bak", "1803"), "status h/",
         "history   zq3rhist.asc: 1803 bytes, status ' ' (consistent), 3 entries, newest "
         "20250107010000 at offset 2582, node 0\n"
         "shadow    zq3rhist.bak: 1803 bytes, status 'C' (consistent since the last commit), 3 "
         "entries, newest 20250107010000 at offset 2582, node 0\n"
         "lock      free (key KEY)\n          cut short: the newest entry is not there\n"
         "zq3hist: hint: zq3hist verify h/  # reads both files and tells what mends them\n[3]",
         "1 1"},
        {"mkdir y; cp h/* y; ", "copy --dry-run -d sample y",
         "3 entries would be copied\nWhat is there would be kept: 3 entries\n[0]", "3 3"},
        {"rm y/*; ", "copy --dry-run y -d sample",
         "zq3hist: cannot open the history: the directory holds no history file, y/\n"
         "zq3hist: hint: zq3hist restore y/ FILE  # FILE: a backup; without one, zq3hist load y/ "
         "FILE begins anew\n[3]",
         "3 3"},
        {"", "chart h/ --svg h/zq3rhist.bak",
         "zq3hist: the picture would replace the history itself, h/zq3rhist.bak\n[1]", "3 3"},
        {KILLED, "repair --dry-run h/",
         "zq3hist: cannot take the lock: a process died while it held the lock, h/\n" UNLOCK "[4]",
         "4 3"},
        {KILLED, "restore --dry-run h/ image",
         "zq3hist: cannot take the lock: a process died while it held the lock, h/\n" UNLOCK "[4]",
         "4 3"},
        {SPOIL("bak", "2000"), "load h/ more",
         "zq3hist: cannot append to the history: the entry at offset 1803 is damaged, "
         "h/zq3rhist.bak\nzq3hist: hint: zq3hist repair h/  # makes the shadow anew from the "
         "history file\n[3]",
         "3 1"},
        {CUT("asc", "1803"), "load h/ more",
         "zq3hist: cannot append to the history: the file ends after 1 of 3 entries, "
         "h/zq3rhist.asc\n" FROM_SHADOW,
         "1 3"},
        {CUT("asc", "1803") CUT("bak", "1803"), "verify h/",
         "zq3rhist.asc: ends at offset 1803, after 1 of 3 entries\n"
         "zq3rhist.bak: ends at offset 1803, after 1 of 3 entries\n"
         "zq3hist: the history is not sound, h/\n" NEITHER,
         "1 1"},
        {CUT("asc", "1803") CUT("bak", "1803"), "plan h/ latest",
         "1/1  full         20250105010000  A  target\n" ENDS_EARLY "[0]", "1 1"},
        {CUT("asc", "1803") CUT("bak", "1803"), "unneeded --keep 1 h/",
         ENDS_EARLY "zq3hist: what the entries need that are missing cannot be told, h/\n[3]",
         "1 1"},
        {CUT("asc", "1803") CUT("bak", "1803"), "prune --dry-run --before 20250107000000 h/",
         ENDS_EARLY "zq3hist: cannot prune the history: the history is damaged, h/\n"
                    "zq3hist: hint: zq3hist verify h/  # names the damage and what mends it\n[3]",
         "1 1"},
        {CUT("asc", "1803") CUT("bak", "2582"), "repair --force h/",
         "Neither file is whole; a history of what can be read was made: 2 entries\n" KEPT("asc")
             KEPT("bak") "[0]",
         "2 2 1 2"},
        {SPOIL("asc", "10") SPOIL("bak", "10"), "repair h/",
         "zq3hist: cannot repair the history: the file is no history, h/zq3rhist.asc\n" NEITHER,
         "x x"},
        {SPOIL("asc", "10") SPOIL("bak", "10"), "backup h/ new",
         "zq3hist: cannot back up the history: the file is no history, h/zq3rhist.asc\n" NEITHER,
         "x x"},
        {SPOIL("asc", "2000"), "repair --dry-run h/",
         "The history file would be made anew from the shadow: 3 entries\n[0]", "1 3"},
        {SPOIL("asc", "2000"), "repair h/",
         "The history file was made anew from the shadow: 3 entries\n" KEPT("asc") "[0]", "3 3 1"},
        {SPOIL("bak", "2000"), "repair h/",
         "The shadow was made anew from the history file: 3 entries\n" KEPT("bak") "[0]", "3 3 1"},
        {"rm h/zq3rhist.asc; ", "repair h/",
         "The history file was made anew from the shadow: 3 entries\n[0]", "3 3"},
        {SPOIL("asc", "2000"), "repair --json h/",
         "{\"format\":1,\"directory\":\"h/\",\"dryRun\":false,\"madeAnew\":\"history\","
         "\"entryCount\":3,\"keptFiles\":[\"h/zq3rhist.asc.STAMP\"]}\n[0]",
         "3 3 1"},
        {KILLED, "repair h/",
         "zq3hist: cannot take the lock: a process died while it held the lock, h/\n" UNLOCK "[4]",
         "4 3"},
        {BEGUN, "load --wait 0 h/ more", "zq3hist: the lock is held by process PID, h/\n[4]",
         "3 3"},
        {BEGUN, "verify h/",
         "zq3rhist.asc: sound, 3 entries, and a batch is unfinished\nzq3rhist.bak: sound, 3 "
         "entries\nzq3hist: process PID is changing the history; what is committed is "
         "sound\n[0]",
         "3 3"},
        {BEGUN, "unlock h/", "zq3hist: the lock is held by process PID; it was left alone, h/\n[4]",
         "3 3"},
        {KILLED, "status h/",
         "history   zq3rhist.asc: 4129 bytes, status 'P' (a batch is unfinished), 3 entries, "
         "newest "
         "20250107010000 at offset 2582, node 0\n"
         "shadow    zq3rhist.bak: 3361 bytes, status 'C' (consistent since the last commit), 3 "
         "entries, newest 20250107010000 at offset 2582, node 0\n"
         "lock      left by a process that died while it held it (key KEY, process PID)\n"
         "          usable; the next open rebuilds the history from the shadow\n" UNLOCK "[4]",
         "4 3"},
        {BEGUN, "check h/", "ok: a process is changing the history; 3 entries" RESTORABLE "[0]",
         "3 3"},
        {KILLED, "check h/",
         "damaged: a batch is unfinished; process PID died while it held the lock; 3 "
         "entries" RESTORABLE "[3]",
         "4 3"},
        {OTHER, "check h/",
         "damaged: the two files hold different entries; 3 entries" RESTORABLE "[3]", "3 3"},
        {COMMITTED, "check h/",
         "damaged: the shadow is to be made anew; 3 entries" RESTORABLE "[3]", "3 3"},
        {"rm h/*; zq3hist load h /dev/null >new; ", "check h/",
         "no image: no image can be restored; 0 entries, 0 images, 0 incomplete\n[5]", "0 0"},
        {"zq3hist prune h --before 20250107000000 >new; zq3hist load h more >new; ", "dump h/",
         "Operation: backup\nTimestamp: 20250107010000\nNode: 0\nNumber: 3\nTablespace: A\n\n"
         "Operation: backup\nTimestamp: 20250108010000\nNode: 0\nNumber: 4\nTablespace: A\n\n[0]",
         "2 2 3 3"},
        {"", "repair h/", "Nothing to repair: both files hold the same 3 entries\n[0]", "3 3"},
        {"mkfifo new; ", "backup --force h/ new",
         "zq3hist: the backup would replace something that is no regular file, new\n[1]", "3 3"},
        {"head -c 4096 /dev/zero >h/zq3rhist.asc; ", "verify h/",
         "zq3rhist.asc: damaged at offset 0: the header cannot be read\nzq3rhist.bak: sound, 3 "
         "entries\nzq3hist: the history is not sound, h/\n" FROM_SHADOW,
         "0 3"},
        {"rm h/zq3rhist.bak; mkdir h/zq3rhist.bak; ", "backup h/ new",
         "zq3hist: cannot back up the history: Is a directory, h/zq3rhist.bak\n" AGAIN "[1]",
         "3 -"},
        {"rm h/zq3rhist.bak; mkdir h/zq3rhist.bak; ", "repair h/",
         "zq3hist: cannot repair the history: Is a directory, h/zq3rhist.bak\n" AGAIN "[1]", "3 -"},
        {"rm h/zq3rhist.bak; mkdir h/zq3rhist.bak; ", "verify h/",
         "zq3rhist.asc: sound, 3 entries\n"
         "zq3rhist.bak: cannot be read at offset 0: Is a directory\n"
         "zq3hist: the history is not sound, h/\n" AGAIN "[1]",
         "3 -"},
        {"rm h/zq3rhist.bak; mkdir h/zq3rhist.bak; ", "load h/ more",
         "zq3hist: cannot append to the history: Is a directory, h/zq3rhist.bak\n" AGAIN "[1]",
         "3 -"},
        {OTHER, "verify h/",
         "zq3rhist.asc: sound, 3 entries\nzq3rhist.bak: sound, 3 entries\n"
         "The two files hold different entries.\nzq3hist: the history is not sound, h/\n"
         "zq3hist: hint: zq3hist repair h/  # makes the shadow anew from the history file\n[3]",
         "3 3"},
        {OTHER, "prune --before 20250106000000 h/",
         "zq3hist: cannot prune the history: the two files hold different entries, h/\n"
         "zq3hist: hint: zq3hist repair h/  # makes the shadow anew from the history file\n[3]",
         "3 3"},
        {"", "prune h/", "zq3hist: prune takes --before TIMESTAMP\nTry 'zq3hist --help'.\n[2]",
         "3 3"},
        {"", "restore h/ none",
         "zq3hist: cannot restore the history: No such file or directory, none\n[1]", "3 3"},
        {"", "backup h/ image",
         "zq3hist: there is a file of that name; --force replaces it, image\n[1]", "3 3"},
        {"", "backup --force h/ image", "3 entries backed up\n[0]", "3 3"},
        {"", "backup --dry-run h/ new", "3 entries would be backed up\n[0]", "3 3"},
        {SPOIL("asc", "2000"), "backup h/ new; cmp new image",
         "3 entries backed up\nzq3hist: warning: only zq3rhist.bak is whole\n"
         "zq3hist: hint: zq3hist repair h/  # takes the entries of the shadow\n[0]",
         "1 3"},
        {"", "backup h/ - >new; cmp new image", "3 entries backed up\n[0]", "3 3"},
        {"zq3hist load h more >new; ", "restore --dry-run h/ image",
         "3 entries would be restored\nWhat is there would be kept: 4 entries\n[0]", "4 4"},
        {"zq3hist load h more >new; ", "restore h/ image",
         "3 entries restored\n" KEPT("asc") KEPT("bak") "[0]", "3 3 4 4"},
        {"", "restore h/ image; zq3hist restore h image >new; zq3hist restore h image >new",
         "3 entries restored\n" KEPT("asc") KEPT("bak") "[0]", "3 3 3 3 3 3 3 3"},
        {SPOIL("asc", "10") SPOIL("bak", "10"), "status h/",
         "history   zq3rhist.asc: 3361 bytes, header not readable: the history is damaged\n"
         "shadow    zq3rhist.bak: 3361 bytes, header not readable: the history is damaged\n"
         "lock      free (key KEY)\n"
         "          not usable; the next open would move both files aside\n"
         "zq3hist: hint: zq3hist verify h/  # reads both files and tells what mends them\n[3]",
         "x x"},
        {"rm h/*; ", "restore h/ image", "3 entries restored\n[0]", "3 3"},
        {CUT("bak", "1803"), "restore h/ h/zq3rhist.bak",
         "zq3hist: cannot restore the history: the file ends after 1 of 3 entries, "
         "h/zq3rhist.bak\n[3]",
         "3 1"},
        {"zq3hist load h odd >new; ", "prune --before 20250107000000 h/",
         "2 of 4 entries removed, those before 20250107010000; 2 stay\n" KEPT("asc")
             KEPT("bak") "[0]",
         "2 2 4 4"},
        {"", "prune --before '2025-01-06 01:00:00' h/",
         "0 of 3 entries removed, those before 20250105010000; 3 stay\n"
         "The entries from 20250105010000 on stay because 20250106010000 needs "
         "them\n[0]",
         "3 3"},
        {"", "prune --before 20990101000000 h/",
         "2 of 3 entries removed, those before 20250107010000; 1 stay\n"
         "The entries from 20250107010000 on stay because 20250107010000 needs them\n" KEPT("asc")
             KEPT("bak") "[0]",
         "1 1 3 3"},
        {"", "prune --dry-run --before 20250107000000 h/",
         "2 of 3 entries would be removed, those before 20250107010000; 1 would stay\n[0]", "3 3"},
        {SPOIL("bak", "2000"), "prune --before 20250107000000 h/",
         "zq3hist: cannot prune the history: the entry at offset 1803 is damaged, h/zq3rhist.bak\n"
         "zq3hist: hint: zq3hist repair h/  # makes the shadow anew from the history file\n[3]",
         "3 1"},
    };
    for (const auto& row : rows) {
        prepare(row.state);
        EXPECT_EQ(row.output, runStamped(row.arguments)) << row.state << row.arguments;
        EXPECT_EQ(row.there, entriesThere()) << row.state << row.arguments;
    }
    for (const fs::path& file : fs::recursive_directory_iterator(root))
        EXPECT_NE(".tmp", file.extension());
}

// Types a command and what its hints say, at most four times.
void ChangeTest::follow(const std::string& arguments, std::string* trace)
{
    std::string typed = "zq3hist " + arguments;
    for (int step = 0; step < 5; step++) {
        int rc = system(("cd " + root + "; (" + typed + ") >out 2>err").c_str());
        std::string said = slurp(root + "err");
        *trace += "\n$ " + typed + "\n" + slurp(root + "out") + said + "[" +
                  std::to_string(WEXITSTATUS(rc)) + "]";
        size_t hint = said.find("hint: "), end = said.find("  #");
        if (hint == std::string::npos)
            return;
        typed = said.substr(hint + 6, end - hint - 6);
        if (size_t file = typed.find("FILE"); file != std::string::npos)
            typed.replace(file, 4, "image");
        followed++;
    }
    ADD_FAILURE() << "hints without end\n" << *trace;
}

// Every hint is a command: followed until there is none, it leads to a sound history that has lost
// nothing.
TEST_F(ChangeTest, FollowedHintsMendTheHistory)
{
    static const char* const states[] = {
        "",
        SPOIL("asc", "10"),
        SPOIL("bak", "10"),
        SPOIL("asc", "10") SPOIL("bak", "10"),
        SPOIL("asc", "2000"),
        SPOIL("bak", "2000"),
        SPOIL("asc", "2000") SPOIL("bak", "1100"),
        CUT("asc", "1803"),
        CUT("bak", "1803"),
        CUT("asc", "1803") CUT("bak", "1803"),
        CUT("asc", "0"),
        CUT("asc", "2000"),
        "rm h/zq3rhist.asc; ",
        "rm h/zq3rhist.bak; ",
        "rm h/*; ",
        KILLED,
    };
    static const char* const commands[] = {"verify h/",      "status h/",     "load h/ more",
                                           "dump h/",        "backup h/ new", "repair h/",
                                           "copy h/ target", "images h/"};
    fs::create_directory(root + "target");
    for (const char* state : states)
        for (const char* command : commands) {
            if (std::string(state) + command == "rm h/*; load h/ more")
                continue; // it begins a history
            prepare(state);
            std::string trace = state;
            follow(command, &trace);
            follow("verify h/", &trace);
            std::string last = run("verify h/");
            std::string count = last.starts_with("zq3rhist.asc: sound, 4") ? "4" : "3";
            EXPECT_TRUE(last.starts_with("zq3rhist.asc: sound, " + count +
                                         " entries\nzq3rhist.bak: sound, " + count + " entries") &&
                        last.ends_with("\n[0]"))
                << trace << "\n"
                << last;
        }
    printf("%d hints followed\n", followed);
}

// What only looks leaves every file as it is, down to its times, and no lock.
TEST_F(ChangeTest, LookingOnlyLooks)
{
    static const char* const states[] = {"",
                                         SPOIL("asc", "10"),
                                         SPOIL("asc", "10") SPOIL("bak", "10"),
                                         SPOIL("asc", "2000"),
                                         CUT("asc", "1803"),
                                         "rm h/zq3rhist.asc; ",
                                         "rm h/zq3rhist.bak; ",
                                         "rm h/*; ",
                                         KILLED,
                                         BEGUN,
                                         COMMITTED};
    static const char* const commands[] = {"status h",
                                           "verify h",
                                           "dump h",
                                           "load --dry-run --skip-existing h more",
                                           "repair --dry-run h",
                                           "repair --dry-run --force h",
                                           "restore --dry-run h image",
                                           "backup --dry-run h new",
                                           "copy --dry-run h target",
                                           "copy --dry-run target h",
                                           "prune --dry-run --before 20250107000000 h",
                                           "images h",
                                           "plan h latest",
                                           "chart h",
                                           "check h",
                                           "unneeded --keep 1 h",
                                           "needed-by h 20250105010000"};
    fs::create_directory(root + "target");
    const auto look = [&] {
        int set = lockSetOf(historyPath);
        EXPECT_EQ(0, system(("cd " + root +
                             "; stat -c '%n %i %s %z' h/ h/* >seen 2>&-; "
                             "md5sum h/* >>seen 2>&-; ls . target >>seen")
                                .c_str()));
        return slurp(root + "seen") + std::to_string(set);
    };
    for (const char* state : states) {
        prepare(state);
        const std::string before = look();
        for (const char* command : commands) {
            std::string said = run(command);
            EXPECT_EQ(before, look()) << state << command << said;
        }
    }
}

// Whoever only asks is answered as long as one file holds what was committed, and told what to know
// about the files.
TEST_F(ChangeTest, QuestionsAreAnsweredInEveryState)
{
#define SHADOW_READ "zq3hist: warning: the history file cannot be used; the shadow was read, h/\n"
#define OTHER_READ(entry, file, at)                                                                \
    "zq3hist: warning: entry " entry " of zq3rhist." file ", at offset " at                        \
    ", is damaged; the other file was read, h/\n"
#define UNUSABLE                                                                                   \
    "zq3hist: cannot read the history: the history is damaged, h/\n"                               \
    "zq3hist: hint: zq3hist verify h/  # names the damage and what mends it\n"
#define DAMAGED_AT(entry, at)                                                                      \
    "zq3hist: cannot read the history: entry " entry ", at offset " at                             \
    ", is damaged, h/zq3rhist.asc\n"                                                               \
    "zq3hist: hint: zq3hist verify h/  # reads both files and tells what mends them\n"
    const struct {
        const char* state;
        int status;
        const char* said;
    } rows[] = {
        {"", 0, ""},
        {COMMITTED, 0, ""},
        {SPOIL("bak", "10"), 0, ""},
        {CUT("bak", "1803"), 0, ""},
        {"rm h/zq3rhist.bak; ", 0, ""},
        {SPOIL("bak", "2000"), 0, ""},
        {BEGUN, 0,
         "zq3hist: warning: a batch is being written; the state before it was read, h/\n"},
        {KILLED, 0,
         "zq3hist: warning: a process died while it held the lock, which stops the next writer, "
         "h/\n" UNLOCK
         "zq3hist: warning: a batch is unfinished; the state before it was read, h/\n"},
        {SPOIL("asc", "10"), 0, SHADOW_READ},
        {"rm h/zq3rhist.asc; ", 0, SHADOW_READ},
        {CUT("asc", "1803"), 0, SHADOW_READ},
        {SPOIL("asc", "1100"), 0, OTHER_READ("1", "asc", "1024")},
        {SPOIL("asc", "2000"), 0, OTHER_READ("2", "asc", "1803")},
        {SPOIL("asc", "2700"), 0, OTHER_READ("3", "asc", "2582")},
        {SPOIL("asc", "10") SPOIL("bak", "10"), 3, UNUSABLE},
        {": >h/zq3rhist.asc; : >h/zq3rhist.bak; ", 3, UNUSABLE},
        {SPOIL("asc", "1100") SPOIL("bak", "1100"), 3, DAMAGED_AT("1", "1024")},
        {SPOIL("asc", "2000") SPOIL("bak", "2000"), 3, DAMAGED_AT("2", "1803")},
        {SPOIL("asc", "2700") SPOIL("bak", "2700"), 3, DAMAGED_AT("3", "2582")},
    };
    prepare("");
    setenv("ZQ3DBPATH", root.c_str(), 1);
    fs::create_directory_symlink(directory, root + "H");
    const std::string zq3ckrst = "cd " + root + "; " ZQ3CKRST " -d h -t 20250106010000 >out 2>err";
    const char* const questions[] = {"images h/", "plan h/ latest", "chart h/", "dump h/"};
    std::vector<std::string> answers;
    ASSERT_EQ(0, system(zq3ckrst.c_str()));
    const std::string planned = slurp(root + "out");
    for (const char* question : questions)
        answers.push_back((run(question), slurp(root + "out")));
    for (const auto& row : rows) {
        prepare(row.state);
        EXPECT_EQ(row.status == 0, system(zq3ckrst.c_str()) == 0) << row.state;
        EXPECT_EQ(row.status == 0 ? planned : "", slurp(root + "out")) << row.state;
        for (size_t i = 0; i < answers.size() - (row.status != 0); i++) { // a dump says other words
            std::string said = run(questions[i]);
            EXPECT_EQ(row.said, slurp(root + "err")) << row.state << questions[i];
            EXPECT_EQ(row.status == 0 ? answers[i] : "", slurp(root + "out")) << row.state;
            EXPECT_TRUE(said.ends_with(row.status == 0 ? "[0]" : "[3]")) << said;
        }
    }
}
