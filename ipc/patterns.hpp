// The execution patterns: which commands a child may have run, and which of
// them under another account. Loaded once into the daemon, read-only after.
#pragma once

#include <regex>
#include <string>
#include <vector>

namespace torvad {

class daemon;

// Reads the patterns file into the daemon's lists. A line that is not a valid
// expression is logged and skipped, so a typo permits less, never more.
void load_patterns(daemon& owner, const char* path);

// True when one expression of list matches the whole NUL-joined item list.
bool matches_patterns(const std::vector<std::string>& items, const std::vector<std::regex>& list);

// The decision for one request: null when permitted, else the refusal text.
const char* permission_refusal(const daemon& owner, const std::string& requester_user,
                               const std::string& wanted_user,
                               const std::vector<std::string>& items);

} // namespace torvad
