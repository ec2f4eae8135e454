// The packet codec: header fields in little-endian order, whatever the host.
#include "ipc/packet.hpp"

#include <cstring>

namespace torvad {

const char* packet_type_name(std::uint32_t type) {
    static const char* const names[] = {"stdin",  "stdout",  "stderr",  "opened",  "failed",
                                        "closed", "execute", "version", "sigterm", "ready"};
    return type < std::size(names) ? names[type] : "unknown";
}

void write_packet_header(void* out, const packet_header& header) {
    auto* bytes = static_cast<unsigned char*>(out);
    store_u32(bytes, header.length);
    store_u32(bytes + 4, header.channel);
    store_u32(bytes + 8, header.type);
    store_u32(bytes + 12, header.flags);
}

packet_header read_packet_header(const void* in) {
    const auto* bytes = static_cast<const unsigned char*>(in);
    return {load_u32(bytes), load_u32(bytes + 4), load_u32(bytes + 8), load_u32(bytes + 12)};
}

std::vector<char> encode_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                                const void* data, std::size_t size) {
    std::vector<char> packet(size + packet_header_size);
    write_packet_header(packet.data(),
                        {static_cast<std::uint32_t>(packet.size()), channel, type, flags});
    if (data != nullptr && size != 0)
        std::memcpy(packet.data() + packet_header_size, data, size);
    return packet;
}

std::string version_payload(std::string_view program_name, std::string_view version,
                            bool background) {
    std::string text(program_name);
    text += '\0';
    text += version;
    text += '\0';
    text += background ? "Background:true" : "Background:false";
    return text;
}

} // namespace torvad
