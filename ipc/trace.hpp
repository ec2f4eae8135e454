// The text of one packet trace line: pure functions of the packet bytes, so
// the formats can be checked without a daemon.
#pragma once

#include <cstdint>
#include <string>

namespace torvad {

// "name:instance" for a channel whose upper 12 bits name a known module,
// otherwise the whole id in decimal.
std::string channel_label(std::uint32_t channel);

// The type word and the details text of the packet at packet (header and
// payload in one block, length already checked).
struct trace_text {
    const char* type_name;
    std::string details;
};
trace_text describe_packet(const char* packet);

// The module table behind channel_label; null for an id without a row.
const char* module_name(std::uint32_t module_id);

} // namespace torvad
