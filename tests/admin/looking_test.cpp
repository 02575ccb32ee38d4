// The programs that look, where they may do little else, and where they are ended.
#include <csignal>

#include "tests/admin/program.h"

class LookTest : public ProgramTest
{
  protected:
    const std::string planner = "-d h -t 20250101010000";

    // A history of this many images.
    explicit LookTest(int images = 2000)
    {
        std::string stanzas;
        for (int i = 0; i < images; i++) {
            char image[99];
            snprintf(image, sizeof image,
                     "Operation: backup\nTimestamp: 202501%02d%02d%02d00\nTablespace: A\n\n",
                     i / 1440 + 1, i / 60 % 24, i % 60);
            stanzas += image;
        }
        EXPECT_EQ(std::to_string(images) + " entries appended\n[0]", run("load h/", stanzas));
        fs::create_directory_symlink(directory, root + "H");
        setenv("ZQ3DBPATH", root.c_str(), 1);
    }

    ~LookTest() override
    {
        unsetenv("ZQ3DBPATH");
        fs::permissions(directory, fs::perms::owner_all);
    }

    // What is there: files, down to their times, and the lock.
    std::string look()
    {
        EXPECT_EQ(0, system(("cd " + root + "; stat -c '%n %i %s %y %z' h/ h/* >seen").c_str()));
        return slurp(root + "seen") + std::to_string(lockSetOf(historyPath));
    }

    // What a program prints. Behind a pipe: it may not write into any file.
    std::string outputOf(const std::string& where, const std::string& program)
    {
        spill(root + "where", where);
        const std::string script = "cd " + root + "; sh where " + program + " 2>err | cat >out";
        EXPECT_EQ(0, system(script.c_str())) << script;
        return slurp(root + "out");
    }
};

#define WITHOUT_PRIVILEGE                                                                          \
    "[ $(id -u) != 0 ] || "                                                                        \
    "set -- setpriv --bounding-set=-dac_override,-dac_read_search \"$@\"; exec \"$@\""

// Where a program that only reads is answered, or says why not.
static const struct {
    const char* what;
    const char* made;  // of the directory before
    const char* where; // a shell script that runs its arguments
    const char* said;  // null: the answer
} surroundings[] = {
    {"no folder for temporary files", "", "TMPDIR=/none exec \"$@\"", nullptr},
    {"no file that may grow", "", "ulimit -f 0; exec \"$@\"", nullptr},
    {"no right to write", "chmod 400 h/*; chmod 500 h/", WITHOUT_PRIVILEGE, nullptr},
    {"no right to read", "chmod 0 h/*", WITHOUT_PRIVILEGE, "Permission denied"},
    {"a file system mounted to be read", "",
     "exec unshare -m sh -ec 'mount --bind SAMPLE SAMPLE; mount -o remount,ro,bind SAMPLE; "
     "exec \"$@\"' sh \"$@\"",
     nullptr},
    {"no descriptor for the shadow", "", "ulimit -n 4; exec \"$@\"", nullptr},
    {"no right to read the shadow", "chmod 0 h/*.bak", WITHOUT_PRIVILEGE, nullptr},
};

TEST_F(LookTest, ReadingNeedsNothingButTheRightToRead)
{
    const std::string questions[] = {ZQ3CKRST " " + planner, ZQ3HIST " images h/",
                                     ZQ3HIST " plan h/ latest", ZQ3HIST " dump h/"};
    std::string answers[std::size(questions)];
    for (size_t i = 0; i < std::size(questions); i++)
        answers[i] = outputOf("exec \"$@\"", questions[i]);
    for (const auto& row : surroundings) {
        SCOPED_TRACE(row.what);
        // Not all is to be had everywhere: a program that counts its lines writes into files.
        if (outputOf(row.where, ZQ3HIST " --version >/dev/null; echo $?") != "0\n") {
            printf("not to be had here: %s\n", row.what);
            continue;
        }
        EXPECT_EQ(0, system(("cd " + root + "; " + row.made).c_str()));
        const std::string before = look();
        for (size_t i = 0; i < std::size(questions); i++) {
            EXPECT_EQ(row.said != nullptr ? "" : answers[i], outputOf(row.where, questions[i]));
            const std::string err = slurp(root + "err");
            EXPECT_EQ(row.said == nullptr, err.empty()) << err;
            EXPECT_TRUE(row.said == nullptr || i == 0 || err.find(row.said) != std::string::npos)
                << err;
        }
        EXPECT_EQ(before, look());
        EXPECT_EQ(0, system(("cd " + root + "; chmod 700 h/; chmod 600 h/*").c_str()));
    }
    EXPECT_EQ("[1]", run("images h/ >pipe", "", "mkfifo pipe; head -1 pipe >first & "))
        << "whoever reads only the beginning is not told of it";
}

TEST_F(LookTest, PlannersThatAreEndedLeaveNothing)
{
    const std::string before = look();
    unsigned int seed = 1, ended = 0;
    for (int i = 0; i < 200; i++) {
        const pid_t child = fork();
        if (child == 0) {
            if (freopen("/dev/null", "w", stdout) == nullptr)
                _exit(98);
            execl(ZQ3CKRST, ZQ3CKRST, "-d", "h", "-t", "20250101010000", nullptr);
            _exit(99);
        }
        usleep(static_cast<useconds_t>(rand_r(&seed)) % 3000);
        const int signals[] = {SIGKILL, SIGINT, SIGPIPE, SIGXFSZ};
        kill(child, signals[i % 4]);
        int status = 0;
        waitpid(child, &status, 0);
        EXPECT_TRUE(WIFSIGNALED(status) || WEXITSTATUS(status) == 0) << status;
        ended += WIFSIGNALED(status);
        ASSERT_EQ(before, look()) << i;
    }
    printf("%u of 200 planners were ended\n", ended);
    EXPECT_GT(ended, 20u);
}
