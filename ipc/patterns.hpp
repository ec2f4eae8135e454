// The execution patterns: which commands a child may have run, and which of
// them under another account. Parsed once at start into plain lists that the
// daemon keeps, read-only after.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "matcher/bounded_regex.hpp"

namespace torvad {

// The prefix of a line that permits its command under any account.
constexpr std::string_view all_prefix = "(all) ";

// A line that compiled, kept with its number and text so that a decision can
// be explained by the line that made it.
struct pattern_line {
    unsigned number = 0;
    std::string line; // as written, with its prefix
    bounded_regex regex;
};

struct pattern_lists {
    // No patterns file: every command under the requester's own account.
    bool allow_all = true;
    std::vector<pattern_line> exec; // lines without a prefix: the own account
    std::vector<pattern_line> all;  // lines with "(all) ": any account
};

// A line that is not a valid expression, and what the compiler said of it.
struct skipped_line {
    unsigned number = 0;
    std::string line;
    std::string reason;
};
// The log's words on a skipped line of file_name.
std::string describe_skipped(const skipped_line& skipped, std::string_view file_name);

// The lists of a patterns file's text. A line that is not a valid expression
// is skipped and added to skipped, so a typo permits less, never more.
pattern_lists parse_patterns(std::string_view text, std::vector<skipped_line>& skipped);

// The decision for one request: refusal is null when permitted, else the
// text to log. undecided: a pattern could not be matched within its bounds
// (each match on its own, as clock tells them), and the request is refused
// for that alone.
struct permission {
    const char* refusal = nullptr;
    bool undecided = false;
};
// A line asked for a decision, and its answer. When a line permits, it is the
// last one asked.
struct tried_line {
    const pattern_line* pattern = nullptr;
    match_verdict verdict = match_verdict::no_match;
};
// tried, when given, gets each line asked, in the order asked.
permission decide_permission(const pattern_lists& patterns, const std::string& requester_user,
                             const std::string& wanted_user, const std::vector<std::string>& items,
                             match_clock clock, std::vector<tried_line>* tried = nullptr);

} // namespace torvad
