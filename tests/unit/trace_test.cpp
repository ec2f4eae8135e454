// The text of a trace line: channel labels and packet details.
#include <gtest/gtest.h>

#include "ipc/packet.hpp"
#include "ipc/strings.hpp"
#include "ipc/trace.hpp"

using namespace torvad;

TEST(trace, channel_labels_name_known_modules) {
    const std::pair<std::uint32_t, std::string> rows[] = {
        {5u << 20 | 3, "psfile:3"},
        {27u << 20 | 1, std::to_string(27u << 20 | 1)}, // a gap in the table
        {87u << 20 | 0xfffff, "axisbw:1048575"},
        {4095u << 20, "4293918720"},
    };
    for (const auto& [channel, label] : rows)
        EXPECT_EQ(channel_label(channel), label);
}

TEST(trace, details_by_packet_type) {
    const std::tuple<std::uint32_t, std::uint32_t, std::string, std::string, std::string> rows[] = {
        {packet_stdin, 0, "ab\n\x07", "stdin", "ab\\n\\x7"},
        {packet_stdin, 1, "ab\n\x07", "stdin", "ab\\n\\x7 flags=0x1"},
        {packet_stdout, 0, "\t\r\xff", "stdout", "\\x9\\r\\xff"},
        {packet_stderr, 0, std::string(40, 'x'), "stderr", std::string(40, 'x')},
        {packet_stderr, 0, std::string(41, 'x'), "stderr", std::string(40, 'x') + "..."},
        {packet_stdout, 0, "", "stdout", ""},
        {packet_opened, 4660, "", "opened", "pid=4660"},
        {packet_failed, 13, "", "failed", "status=0xd"},
        {packet_closed, 0xfffffffe, "", "closed", "status=0xfffffffe"},
        {packet_sigterm, 7, "", "sigterm", ""},
        {9, 7, "zz", "unknown", ""},
        {packet_execute, 9, join_strings({"svc", "a\"b", ""}), "execute",
         "\"svc\" \"a\\\"b\" \"\" flags=0x9"},
        {packet_version, 0, version_payload("torvad", torvad_version, false), "version",
         "\"torvad\" \"1.1.21.0\" \"Background:false\" "},
    };
    for (const auto& [type, flags, payload, name, details] : rows) {
        auto packet = encode_packet(1, type, flags, payload.data(), payload.size());
        trace_text text =
            describe_packet(read_packet_header(packet.data()), packet.data() + packet_header_size);
        EXPECT_EQ(text.type_name, name);
        EXPECT_EQ(text.details, details);
    }
}
