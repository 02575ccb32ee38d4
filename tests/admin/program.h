// zq3hist through its command line, on real directories.
#pragma once

#include <sys/wait.h>

#include "tests/support.h"

namespace fs = std::filesystem;

class ProgramTest : public HistoryTest
{
  protected:
    ProgramTest()
    {
        fs::create_directory_symlink(directory, root + "h");
    }

    // Runs zq3hist in the scratch directory, where h/ is the history directory, after the commands
    // in before; returns standard output, standard error and the exit status.
    std::string run(const std::string& arguments, const std::string& input = "",
                    const std::string& before = "")
    {
        spill(root + "in", input);
        std::string program = ZQ3HIST " <in >out 2>err " + arguments;
        int status = system(("cd " + root + "; " + before + program).c_str());
        std::string text = slurp(root + "out") + slurp(root + "err") + "[" +
                           std::to_string(WEXITSTATUS(status)) + "]";
        if (size_t key = text.find("(key 0x"); key != std::string::npos)
            text.replace(key + 5, 10, "KEY");
        return text;
    }
};
