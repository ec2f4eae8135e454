#include "daemon/patterns_file.hpp"

#include "platform/platform.hpp"

namespace torvad {

patterns_file load_patterns_file(const std::string& path) {
    patterns_file file;
    std::string text;
    // An unreadable file leaves the lists empty: closed, not open.
    if (platform::os_error error = platform::read_file(path, text)) {
        file.open_failure = "failed to open patterns file '" + path + "'";
        file.open_failure_reason = platform::describe(error);
    }
    file.lists = parse_patterns(text, file.skipped);
    return file;
}

} // namespace torvad
