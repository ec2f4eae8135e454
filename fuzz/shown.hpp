// Bytes as a fuzzer's report shows them: printable ASCII as it is, the rest
// and the backslash as \xHH, so that a line can be typed back in.
#pragma once

#include <cstdio>
#include <string>

inline std::string shown(const std::string& bytes) {
    std::string out;
    for (unsigned char c : bytes) {
        char hex[5];
        std::snprintf(hex, sizeof hex, "\\x%02x", c);
        out += c >= 0x20 && c < 0x7f && c != '\\' ? std::string(1, static_cast<char>(c)) : hex;
    }
    return out;
}
