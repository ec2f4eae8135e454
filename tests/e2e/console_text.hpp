// What Wine's console draws on a terminal, told back as the text written to
// it: a run of blanks drawn as an erase and a move over it, a trailing blank
// as an erase, the cursor hidden and shown around each change, lines ending
// in CR LF.
#pragma once

#include <regex>
#include <string>

namespace e2e {

// Appends to text the whole lines of raw; gives how much of raw that took.
inline std::size_t console_text(const std::string& raw, std::string& text) {
    static const std::regex drawing("\x1b\\[\\?25[lh]|\x1b\\[K(?:\x1b\\[(\\d*)C|(?=\r))|\r(?=\n)");
    std::size_t end = raw.rfind('\n') + 1; // 0 when no line is whole yet
    auto from = raw.cbegin();
    for (std::sregex_iterator at(from, from + end, drawing), none; at != none; ++at) {
        const std::smatch& match = *at;
        text.append(match.prefix().first, match.prefix().second);
        if (match.str().starts_with("\x1b[K"))
            text.append(match[1].matched && match[1].length() > 0 ? std::stoul(match[1]) : 1, ' ');
        from = match.suffix().first;
    }
    text.append(from, raw.cbegin() + end);
    return end;
}

} // namespace e2e
