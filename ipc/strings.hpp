// String lists (items joined by single NUL bytes, nothing else) and the
// quoting of one item for a command line or the trace.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace torvad {

// Decodes size bytes at data; always gives at least one item, and a trailing
// separator gives a trailing empty item. Reads no byte at or behind data + size.
std::vector<std::string> split_strings(const char* data, std::size_t size, char separator);

// Joins items with single NUL bytes: the inverse of split_strings for any
// non-empty list.
std::string join_strings(const std::vector<std::string>& items);

// Double quotes around text, and a backslash before each character found in
// escape_set; every other character, a backslash too, passes unchanged.
std::string quote_argument(std::string_view text, std::string_view escape_set);

// The escape set of the trace: quotes and backslashes.
constexpr std::string_view trace_escapes = "\"\\";

} // namespace torvad
