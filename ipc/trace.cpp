// The trace of every packet under -v: labels, previews of stream bytes and
// the items of string lists.
#include "ipc/trace.hpp"

#include <cctype>
#include <cstdio>

#include "ipc/strings.hpp"

namespace torvad {

namespace {

constexpr std::size_t preview_bytes = 40;

void append_hex(std::string& out, std::uint32_t value) {
    char digits[16];
    std::snprintf(digits, sizeof digits, "%x", value);
    out += digits;
}

std::string preview(const char* payload, std::uint32_t size, std::uint32_t flags) {
    std::string text;
    for (std::uint32_t i = 0; i < size && i < preview_bytes; ++i) {
        unsigned char byte = static_cast<unsigned char>(payload[i]);
        if (std::isprint(byte))
            text += static_cast<char>(byte);
        else if (byte == '\n')
            text += "\\n";
        else if (byte == '\r')
            text += "\\r";
        else {
            text += "\\x";
            append_hex(text, byte);
        }
    }
    if (size > preview_bytes)
        text += "...";
    if (flags != 0) {
        text += " flags=0x";
        append_hex(text, flags);
    }
    return text;
}

std::string string_list(const char* payload, std::uint32_t size, std::uint32_t flags) {
    std::string text;
    for (const auto& item : split_strings(payload, size, '\0')) {
        text += quote_argument(item, trace_escapes);
        text += ' ';
    }
    if (flags != 0) {
        text += "flags=0x";
        append_hex(text, flags);
    }
    return text;
}

} // namespace

std::string channel_label(std::uint32_t channel) {
    const char* module = channel >> 20 == 0 ? nullptr : module_name(channel >> 20);
    char label[256];
    if (module == nullptr)
        std::snprintf(label, sizeof label, "%u", channel);
    else
        std::snprintf(label, sizeof label, "%s:%u", module, channel & 0xfffff);
    return label;
}

trace_text describe_packet(const packet_header& header, const char* payload) {
    std::uint32_t size = header.length - packet_header_size;
    trace_text text{packet_type_name(header.type), {}};
    switch (header.type) {
    case packet_stdin:
    case packet_stdout:
    case packet_stderr:
        text.details = preview(payload, size, header.flags);
        break;
    case packet_opened:
        text.details = "pid=" + std::to_string(header.flags);
        break;
    case packet_failed:
    case packet_closed:
        text.details = "status=0x";
        append_hex(text.details, header.flags);
        break;
    case packet_execute:
    case packet_version:
        text.details = string_list(payload, size, header.flags);
        break;
    default:
        break;
    }
    return text;
}

std::string trace_line(const packet_header& header, const char* payload, bool sent,
                       std::string_view program, bool colour) {
    trace_text text = describe_packet(header, payload);
    std::string line;
    line += colour ? "\x1b[36m" : "";
    line += sent ? "-> " : "<- ";
    line += program;
    line += ':';
    line += channel_label(header.channel);
    line += colour ? "\x1b[35m " : " ";
    line += text.type_name;
    line += colour ? "\x1b[0m " : " ";
    line += text.details;
    return line;
}

} // namespace torvad
