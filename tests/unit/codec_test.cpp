// String lists, quoting and packet bytes against known byte sequences, and
// the text of a trace line: channel labels and packet details.
#include <gtest/gtest.h>

#include <tuple>

#include "ipc/packet.hpp"
#include "ipc/strings.hpp"
#include "ipc/trace.hpp"

using namespace torvad;

TEST(codec, split_strings_gives_separators_plus_one_items) {
    const std::pair<std::string, std::vector<std::string>> rows[] = {
        {"", {""}},
        {"abc", {"abc"}},
        {std::string("a\0b", 3), {"a", "b"}},
        {std::string("\0", 1), {"", ""}}, // an empty item at either end
        {std::string("a\0\0b", 4), {"a", "", "b"}},
        {"\xff\x80", {"\xff\x80"}},
    };
    for (const auto& [data, items] : rows) {
        EXPECT_EQ(split_strings(data.data(), data.size(), '\0'), items);
        EXPECT_EQ(join_strings(items), data);
    }
    // Nothing at or behind data + size is read: the NUL there would add an item.
    const char bounded[] = {'a', 'b', '\0', 'c'};
    EXPECT_EQ(split_strings(bounded, 2, '\0'), std::vector<std::string>{"ab"});
    EXPECT_EQ(split_strings(bounded, 3, '\0'), (std::vector<std::string>{"ab", ""}));
    EXPECT_EQ(split_strings(bounded + 2, 0, '\0'), std::vector<std::string>{""});
}

TEST(codec, quote_argument_escapes_only_its_set) {
    const std::pair<std::string, std::string> rows[] = {
        {"", "\"\""}, {"a\"b", "\"a\\\"b\""}, {"dir\\", "\"dir\\\\\""}, {"\xe9 x", "\"\xe9 x\""}};
    for (const auto& [text, quoted] : rows)
        EXPECT_EQ(quote_argument(text, trace_escapes), quoted);
    EXPECT_EQ(quote_argument("a\\\"b", "\""), "\"a\\\\\"b\""); // only the set is escaped
}

TEST(codec, packets_match_their_bytes) {
    const std::tuple<std::uint32_t, std::uint32_t, std::uint32_t, std::string, std::string> rows[] =
        {
            {0x300002, packet_stdin, stdin_close, "abc",
             "13000000 02003000 00000000 01000000 616263"},
            {0x300002, packet_opened, 4660, "", "10000000 02003000 03000000 34120000"},
            {0x300002, packet_failed, 13, "", "10000000 02003000 04000000 0d000000"},
            {0, packet_sigterm, 0, "", "10000000 00000000 08000000 00000000"},
            {0x300002, packet_execute, execute_persistent | execute_user,
             join_strings({"svc", "tool.exe", "-x"}),
             "1f000000 02003000 06000000 09000000 73766300 746f6f6c2e65786500 2d78"},
        };
    for (auto [channel, type, flags, payload, expected] : rows) {
        auto framed = encode_packet(channel, type, flags, payload.data(), payload.size());
        std::string hex;
        std::erase(expected, ' ');
        for (unsigned char byte : framed)
            hex += {"0123456789abcdef"[byte >> 4], "0123456789abcdef"[byte & 15]};
        EXPECT_EQ(hex, expected);
        packet_header header = read_packet_header(framed.data());
        EXPECT_EQ(std::tuple(header.length, header.channel, header.type, header.flags),
                  std::tuple(std::uint32_t(framed.size()), channel, type, flags));
    }
    for (auto [length, valid] :
         {std::pair{15u, false}, {16u, true}, {65536u, true}, {65537u, false}})
        EXPECT_EQ(valid_packet_length(length), valid) << length;
    EXPECT_STREQ(packet_type_name(packet_sigterm), "sigterm");
    EXPECT_STREQ(packet_type_name(packet_ready), "ready");
    EXPECT_STREQ(packet_type_name(10), "unknown");
}

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
        {10, 7, "zz", "unknown", ""},
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
