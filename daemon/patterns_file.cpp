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
    // The expression compiler recurses as deep as a line is long: it gets a
    // stack of that size, and a file that can't have one loads as closed.
    bool parsed = platform::run_on_large_stack(
        patterns_stack_bytes(text), [&] { file.lists = parse_patterns(text, file.skipped); });
    if (!parsed) {
        file.lists = parse_patterns({}, file.skipped);
        file.stack_failure = "no stack to compile the patterns of '" + path + "'";
    }
    return file;
}

} // namespace torvad
