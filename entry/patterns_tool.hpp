// torvad-patterns: the check of a patterns file and the explanation of one
// decision, as text and an exit status. The file and the decision are
// torvad's own (load_patterns_file, decide_execute); only the words are here.
#pragma once

#include <string>
#include <vector>

#include "daemon/patterns_file.hpp"

namespace torvad::patterns_tool {

struct command_line {
    bool check = false; // else explain
    std::string path;
    // explain: the item list of an execute, and the requester's account.
    bool change_account = false;
    std::string account, requester;
    std::vector<std::string> command;
};

extern const char* const usage;

// False when args (without the program's name) are no valid command line.
bool parse_command_line(const std::vector<std::string>& args, command_line& parsed);

struct report {
    std::string out, err;
    int status = 0;
};

// 0 for a clean file, 1 when torvad would skip a line, 2 when it can't be read.
report check(const std::string& path, const patterns_file& file);

// 0 when permitted, else the status of torvad's failed packet (13, or 22 for
// a malformed request); 2 when the file can't be read.
report explain(const command_line& request, const patterns_file& file, match_clock clock);

} // namespace torvad::patterns_tool
