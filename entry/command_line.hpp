// The scan of the command line: what main needs to know, and nothing done yet.
#pragma once

#include <string>
#include <vector>

namespace torvad {

struct command_line {
    bool help = false;
    bool verbose = false;
    bool logging = false;
    bool background = false; // -b; main ors in "stdout is not a terminal"
    bool no_restart = false; // -o
    bool readiness = false;  // -r
    std::string family = "torvaSentry";
    std::string user;
    std::string directory;
    const char* pid_file = nullptr;
    int attach_pid = 0;
    int attach_pipe = -1;
    std::vector<std::string> command;
};

// Reads argv as operators have always typed it: an option is told by its
// second character alone, a value is the next argument whatever it is, a
// missing value keeps the old one, and anything unknown passes in silence.
command_line scan_command_line(int argc, char** argv);

// The help text, with the program's name in it.
std::string help_text(const char* program);

} // namespace torvad
