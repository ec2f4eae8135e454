#include "ipc/patterns.hpp"

#include <fstream>

#include "daemon/daemon.hpp"
#include "ipc/strings.hpp"

namespace torvad {

namespace {
constexpr std::string_view all_prefix = "(all) ";
}

void load_patterns(daemon& owner, const char* path) {
    std::ifstream file(path);
    if (!file) {
        owner.log_error("failed to open patterns file '%s'", path);
        return;
    }
    std::string line;
    for (unsigned number = 1; std::getline(file, line); ++number) {
        // A file written elsewhere may end its lines with a carriage return.
        if (!line.empty() && line.back() == '\r')
            line.pop_back();
        if (line.empty() || line[0] == '#')
            continue;
        bool for_all = line.compare(0, all_prefix.size(), all_prefix) == 0;
        try {
            if (for_all)
                owner.all_patterns.emplace_back(line.substr(all_prefix.size()),
                                                std::regex::ECMAScript);
            else
                owner.exec_patterns.emplace_back(line, std::regex::ECMAScript);
        } catch (const std::regex_error& error) {
            owner.log_error("bad pattern on line %u of '%s' skipped: %s", number, path,
                            error.what());
        }
    }
}

bool matches_patterns(const std::vector<std::string>& items, const std::vector<std::regex>& list) {
    std::string text = join_strings(items);
    for (const auto& pattern : list)
        if (std::regex_match(text, pattern))
            return true;
    return false;
}

const char* permission_refusal(const daemon& owner, const std::string& requester_user,
                               const std::string& wanted_user,
                               const std::vector<std::string>& items) {
    if (wanted_user != requester_user)
        return matches_patterns(items, owner.all_patterns) ? nullptr
                                                           : "permission to change user denied";
    if (owner.allow_all || matches_patterns(items, owner.exec_patterns) ||
        matches_patterns(items, owner.all_patterns))
        return nullptr;
    return "permission to execute denied";
}

} // namespace torvad
