// The text of one packet trace line: pure functions of the packet, so the
// formats can be checked without a daemon.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "ipc/packet.hpp"

namespace torvad {

// "name:instance" for a channel whose upper 12 bits name a known module,
// otherwise the whole id in decimal.
std::string channel_label(std::uint32_t channel);

// The type word and the details text of one packet.
struct trace_text {
    const char* type_name;
    std::string details;
};
trace_text describe_packet(const packet_header& header, const char* payload);

// The whole line: direction, program and channel, type, details; with the
// terminal's colours when colour is set.
std::string trace_line(const packet_header& header, const char* payload, bool sent,
                       std::string_view program, bool colour);

// The module table behind channel_label; null for an id without a row.
const char* module_name(std::uint32_t module_id);

} // namespace torvad
