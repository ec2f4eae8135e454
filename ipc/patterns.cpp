// The patterns file's lines and the permission decision over them.
#include "ipc/patterns.hpp"

#include <algorithm>

#include "ipc/strings.hpp"

namespace torvad {

namespace {

void add_line(pattern_lists& lists, std::string_view line, unsigned number,
              std::vector<skipped_line>& skipped) {
    if (line.empty() || line[0] == '#')
        return;
    bool for_all = line.substr(0, all_prefix.size()) == all_prefix;
    std::string error;
    auto compiled = bounded_regex::compile(for_all ? line.substr(all_prefix.size()) : line, error);
    if (!compiled) {
        skipped.push_back({number, std::string(line), std::move(error)});
        return;
    }
    (for_all ? lists.all : lists.exec).push_back({number, std::string(line), std::move(*compiled)});
}

// The verdict of the first pattern that matches; undecided when none
// matched and one of them could not be decided.
match_verdict match_any(const std::vector<pattern_line>& list, std::string_view text,
                        match_clock clock, std::vector<tried_line>* tried) {
    match_verdict verdict = match_verdict::no_match;
    for (const auto& pattern : list) {
        match_verdict one = pattern.regex.match(text, clock);
        if (tried != nullptr)
            tried->push_back({&pattern, one});
        if (one == match_verdict::match)
            return one;
        if (one == match_verdict::undecided)
            verdict = one;
    }
    return verdict;
}

} // namespace

std::string describe_skipped(const skipped_line& skipped, std::string_view file_name) {
    return "bad pattern on line " + std::to_string(skipped.number) + " of '" +
           std::string(file_name) + "' skipped: " + skipped.reason;
}

pattern_lists parse_patterns(std::string_view text, std::vector<skipped_line>& skipped) {
    pattern_lists lists;
    lists.allow_all = false;
    unsigned number = 0;
    while (!text.empty()) {
        std::size_t end = text.find('\n');
        std::string_view line = text.substr(0, end);
        // A line written elsewhere may end in CR LF; the CR is not the pattern's.
        if (end != std::string_view::npos && !line.empty() && line.back() == '\r')
            line.remove_suffix(1);
        add_line(lists, line, ++number, skipped);
        text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    }
    return lists;
}

permission decide_permission(const pattern_lists& patterns, const std::string& requester_user,
                             const std::string& wanted_user, const std::vector<std::string>& items,
                             match_clock clock, std::vector<tried_line>* tried) {
    std::string text = join_strings(items);
    if (wanted_user != requester_user) {
        match_verdict verdict = match_any(patterns.all, text, clock, tried);
        if (verdict == match_verdict::match)
            return {};
        return {"permission to change user denied", verdict == match_verdict::undecided};
    }
    if (patterns.allow_all)
        return {};
    match_verdict own = match_any(patterns.exec, text, clock, tried);
    if (own == match_verdict::match)
        return {};
    match_verdict any = match_any(patterns.all, text, clock, tried);
    if (any == match_verdict::match)
        return {};
    bool undecided = own == match_verdict::undecided || any == match_verdict::undecided;
    return {"permission to execute denied", undecided};
}

} // namespace torvad
