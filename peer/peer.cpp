#include "peer/peer.hpp"

#include <cstdlib>

#include "ipc/strings.hpp"
#include "peer/link.hpp"

namespace torvad::peer {

int ipc_fd_from_arguments(int argc, char** argv) {
    if (argc < 2 || argv[argc - 1][0] == '\0')
        return -1;
    char* end = nullptr;
    long fd = std::strtol(argv[argc - 1], &end, 10);
    if (*end != '\0' || fd < 0 || fd > 0x7fffffff || argv[argc - 1][0] == '-')
        return -1;
    if (!link_is_open(fd))
        return -1;
    return static_cast<int>(fd);
}

connection::connection(int fd) : fd_(fd) {}

connection::~connection() {
    if (fd_ >= 0)
        close_link(fd_);
}

connection::connection(connection&& other) noexcept
    : fd_(other.fd_), send_wait_ms_(other.send_wait_ms_), buffer_(std::move(other.buffer_)) {
    other.fd_ = -1;
}

connection& connection::operator=(connection&& other) noexcept {
    if (this != &other) {
        if (fd_ >= 0)
            close_link(fd_);
        fd_ = other.fd_;
        send_wait_ms_ = other.send_wait_ms_;
        buffer_ = std::move(other.buffer_);
        other.fd_ = -1;
    }
    return *this;
}

bool connection::fill() {
    char chunk[65536];
    long got = read_link(fd_, chunk, sizeof chunk);
    if (got <= 0)
        return false;
    buffer_.append(chunk, static_cast<std::size_t>(got));
    return true;
}

bool connection::receive(packet& out) {
    while (buffer_.size() < packet_header_size)
        if (!fill())
            return false;
    packet_header header = read_packet_header(buffer_.data());
    if (!valid_packet_length(header.length))
        return false;
    while (buffer_.size() < header.length)
        if (!fill())
            return false;
    out.header = header;
    out.payload.assign(buffer_, packet_header_size, header.length - packet_header_size);
    buffer_.erase(0, header.length);
    return true;
}

bool connection::send(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                      std::string_view payload) {
    if (payload.size() > packet_max_payload)
        return false;
    auto block = encode_packet(channel, type, flags, payload.data(), payload.size());
    return write_link(fd_, block.data(), block.size(), send_wait_ms_);
}

bool connection::execute(std::uint32_t channel, std::uint32_t flags,
                         const std::vector<std::string>& items) {
    return send(channel, packet_execute, flags, join_strings(items));
}

bool connection::send_stdin(std::uint32_t channel, std::string_view bytes, bool close) {
    return send(channel, packet_stdin, close ? stdin_close : 0, bytes);
}

std::optional<version_info> parse_version(const packet& received) {
    if (received.header.type != packet_version)
        return std::nullopt;
    auto items = split_strings(received.payload.data(), received.payload.size(), '\0');
    constexpr std::string_view prefix = "Background:";
    if (items.size() != 3 || items[2].rfind(prefix, 0) != 0)
        return std::nullopt;
    return version_info{items[0], items[1], items[2].substr(prefix.size()) == "true"};
}

bool read_version(connection& link, version_info& out) {
    packet first;
    if (!link.receive(first))
        return false;
    auto parsed = parse_version(first);
    if (!parsed)
        return false;
    out = *parsed;
    return true;
}

} // namespace torvad::peer
