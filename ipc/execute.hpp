// An execute request: a child asks for a program to be run as a new channel
// on its pipe. Decoding it and checking it against the patterns is pure; the
// process that carried it does the rest.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "ipc/packet.hpp"
#include "ipc/patterns.hpp"

namespace torvad {

enum stdio_mode_t : std::int32_t { stdio_inherit = 0, stdio_pipes = 1, stdio_none = 2 };

// What a request asks for, with the requester's values where it names none.
struct execute_request {
    std::vector<std::string> command;
    std::string user;
    std::string working_directory;
    bool persistent = false;
    std::int32_t stdio_mode = stdio_inherit;
};

// The outcome: refusal is null when the request is to be carried out; else it
// is the text to log and status goes back in a failed packet.
struct execute_decision {
    const char* refusal = nullptr;
    std::uint32_t status = 0;
    bool undecided = false; // refused because a pattern match ran out of bounds
    execute_request request;
};

execute_decision decide_execute(std::uint32_t flags, const char* payload, std::size_t size,
                                const std::string& requester_user,
                                const std::string& requester_path, const pattern_lists& patterns,
                                match_clock clock, std::vector<tried_line>* tried = nullptr);

} // namespace torvad
