// Feeds arbitrary bytes to the ipc framer, cut into reads of varying size, and
// describes every packet it hands out as the trace would.
#include <algorithm>
#include <cstdint>
#include <cstring>

#include "ipc/framer.hpp"
#include "ipc/trace.hpp"

using namespace torvad;

namespace {

// The first byte picks the size of every read: tiny ones that cut headers
// apart, or large ones up to the whole buffer.
std::size_t read_size(std::uint8_t selector) {
    if (selector < 128)
        return selector + 1u;
    return (selector - 127u) * 512u;
}

// No whole packet may be left unframed, and the buffer never overflows.
void check_invariants(const framer& input) {
    if (input.held() > packet_max_size)
        __builtin_trap();
    if (input.held() >= packet_header_size) {
        packet_header header = read_packet_header(input.data());
        if (!valid_packet_length(header.length) || header.length <= input.held())
            __builtin_trap();
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    framer input;
    std::size_t chunk = size == 0 ? 1 : read_size(data[0]);
    for (std::size_t offset = size == 0 ? 0 : 1; offset < size;) {
        // A read never takes more than the free space behind the held bytes.
        std::size_t bytes = std::min({chunk, input.free_size(), size - offset});
        std::memcpy(input.free_space(), data + offset, bytes);
        input.add(
            bytes,
            [](const packet_header& header, const char* payload) {
                if (!valid_packet_length(header.length))
                    __builtin_trap();
                trace_line(header, payload, false, "fuzz", true);
            },
            [] {});
        check_invariants(input);
        offset += bytes;
    }
    return 0;
}
