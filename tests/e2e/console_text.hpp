// What Wine's console draws on a terminal, told back as the text written to
// it: a run of blanks drawn as an erase and a move over it, a trailing blank
// as an erase, the cursor hidden and shown around each change, lines ending
// in CR LF.
#pragma once

#include <string>

namespace e2e {

// The length of the escape sequence at text[at], 0 when it isn't complete yet.
inline std::size_t sequence_length(const std::string& text, std::size_t at) {
    if (at + 1 >= text.size())
        return 0;
    if (text[at + 1] != '[')
        return 1;
    for (std::size_t end = at + 2; end < text.size(); ++end)
        if (text[end] >= 0x40 && text[end] <= 0x7e)
            return end + 1 - at;
    return 0;
}

// Appends to text what can be told of raw; gives how much of raw that took.
inline std::size_t console_text(const std::string& raw, std::string& text) {
    std::size_t at = 0;
    while (at < raw.size()) {
        if (raw[at] == '\r') {
            if (at + 1 == raw.size())
                break; // a line feed may follow
            if (raw[at + 1] != '\n')
                text += '\r';
            ++at;
            continue;
        }
        if (raw[at] != '\x1b') {
            text += raw[at++];
            continue;
        }
        std::size_t length = sequence_length(raw, at);
        if (length == 0)
            break;
        std::string sequence = raw.substr(at, length);
        if (sequence == "\x1b[K") {
            std::size_t next = at + length;
            std::size_t move =
                next < raw.size() && raw[next] == '\x1b' ? sequence_length(raw, next) : 0;
            if (next == raw.size() || (raw[next] == '\x1b' && move == 0))
                break; // what the erase stands for comes next
            if (move > 0 && raw[next + move - 1] == 'C') {
                std::string count = raw.substr(next + 2, move - 3);
                text.append(count.empty() ? 1 : std::stoul(count), ' ');
                length += move;
            } else if (raw[next] == '\r') {
                text += ' ';
            }
        } else if (sequence != "\x1b[?25l" && sequence != "\x1b[?25h") {
            text += sequence;
        }
        at += length;
    }
    return at;
}

} // namespace e2e
