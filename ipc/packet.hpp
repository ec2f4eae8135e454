// The packet on an ipc pipe: a 16-byte header of four little-endian uint32
// fields (length, channel, type, flags) followed by length - 16 payload bytes.
// Pure code with no dependency on the daemon, so that peer programs can share it.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace torvad {

constexpr std::uint32_t packet_header_size = 16;
constexpr std::uint32_t packet_max_size = 0x10000;
constexpr std::uint32_t packet_max_payload = packet_max_size - packet_header_size;

enum packet_type : std::uint32_t {
    packet_stdin = 0,
    packet_stdout = 1,
    packet_stderr = 2,
    packet_opened = 3,
    packet_failed = 4,
    packet_closed = 5,
    packet_execute = 6,
    packet_version = 7,
    packet_sigterm = 8,
    // channel 0, from a product program: it serves; an older torvad ignores it
    packet_ready = 9,
};

// flags of a stdin packet
constexpr std::uint32_t stdin_close = 1;

// flags of an execute packet
constexpr std::uint32_t execute_persistent = 1;
constexpr std::uint32_t execute_stdio_pipes = 2;
constexpr std::uint32_t execute_stdio_none = 4;
constexpr std::uint32_t execute_user = 8;
constexpr std::uint32_t execute_path = 16;

// statuses of a failed packet that the daemon chooses itself
constexpr std::uint32_t status_malformed = 22;
constexpr std::uint32_t status_not_permitted = 13;
constexpr std::uint32_t status_not_found = 2;

struct packet_header {
    std::uint32_t length = packet_header_size;
    std::uint32_t channel = 0;
    std::uint32_t type = 0;
    std::uint32_t flags = 0;
};

// The lower-case word of a type, "unknown" for a code outside the protocol.
const char* packet_type_name(std::uint32_t type);

// A length field the reader may believe: 16 to 65536 inclusive.
inline bool valid_packet_length(std::uint32_t length) {
    return length >= packet_header_size && length <= packet_max_size;
}

inline void store_u32(unsigned char* out, std::uint32_t value) {
    out[0] = static_cast<unsigned char>(value);
    out[1] = static_cast<unsigned char>(value >> 8);
    out[2] = static_cast<unsigned char>(value >> 16);
    out[3] = static_cast<unsigned char>(value >> 24);
}

inline std::uint32_t load_u32(const unsigned char* in) {
    return std::uint32_t(in[0]) | std::uint32_t(in[1]) << 8 | std::uint32_t(in[2]) << 16 |
           std::uint32_t(in[3]) << 24;
}

// Writes the 16 header bytes at out.
void write_packet_header(void* out, const packet_header& header);

// Reads the 16 header bytes at in; the caller checks length before trusting it.
packet_header read_packet_header(const void* in);

// One whole packet in one block: header with length = size + 16, then the payload.
std::vector<char> encode_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                                const void* data, std::size_t size);

// This build's version, which the build names once.
inline constexpr const char* torvad_version = TORVAD_VERSION;

// The payload of version: program name, version text and "Background:true|false",
// joined by NUL bytes with none at the end.
std::string version_payload(std::string_view program_name, std::string_view version,
                            bool background);

} // namespace torvad
