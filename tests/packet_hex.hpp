// A packet as hex text, as the byte tables of the tests spell it.
#pragma once

#include <cstdio>
#include <string>

#include "ipc/packet.hpp"

// length, when given, replaces the true length field: a lie for the framer.
inline std::string hex_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                              const std::string& payload, std::uint32_t length = 0) {
    auto bytes = torvad::encode_packet(channel, type, flags, payload.data(), payload.size());
    if (length != 0)
        torvad::store_u32(reinterpret_cast<unsigned char*>(bytes.data()), length);
    std::string hex;
    char digits[3];
    for (char byte : bytes) {
        std::snprintf(digits, sizeof digits, "%02x", static_cast<unsigned char>(byte));
        hex += digits;
    }
    return hex;
}
