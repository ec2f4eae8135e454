// The patterns file as the daemon loads it, shared with torvad-patterns so
// that the tool judges the very lists, and says the very words, of the daemon.
#pragma once

#include <string>
#include <vector>

#include "ipc/patterns.hpp"

namespace torvad {

struct patterns_file {
    pattern_lists lists; // closed (empty) when the file can't be read
    // The log's error when the file can't be read, and the system's reason,
    // which the log gives under -v; both empty when it was read.
    std::string open_failure, open_failure_reason;
    std::vector<skipped_line> skipped;
};

patterns_file load_patterns_file(const std::string& path);

} // namespace torvad
