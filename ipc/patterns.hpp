// The execution patterns: which commands a child may have run, and which of
// them under another account. Parsed once at start into plain lists that the
// daemon keeps, read-only after.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "matcher/bounded_regex.hpp"

namespace torvad {

struct pattern_lists {
    // No patterns file: every command under the requester's own account.
    bool allow_all = true;
    std::vector<bounded_regex> exec; // lines without a prefix: the own account
    std::vector<bounded_regex> all;  // lines with "(all) ": any account
};

// The lists of a patterns file's text. A line that is not a valid expression
// is skipped with one text in problems, so a typo permits less, never more.
pattern_lists parse_patterns(std::string_view text, std::string_view file_name,
                             std::vector<std::string>& problems);

// The stack parse_patterns may need for text: as much as its deepest line.
std::size_t patterns_stack_bytes(std::string_view text);

// The decision for one request: refusal is null when permitted, else the
// text to log. undecided: a pattern could not be matched within its bounds
// (each match on its own, as clock tells them), and the request is refused
// for that alone.
struct permission {
    const char* refusal = nullptr;
    bool undecided = false;
};
permission decide_permission(const pattern_lists& patterns, const std::string& requester_user,
                             const std::string& wanted_user, const std::vector<std::string>& items,
                             match_clock clock);

} // namespace torvad
