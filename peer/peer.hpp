// The peer side of the ipc protocol, for product programs that torvad runs as
// persistent children. A connection owns its descriptor and closes it; a
// packet owns its payload. Nothing here throws or raises SIGPIPE.
//
// A peer's life: take the fd from the last argument, read `version` first,
// say `ready` once it serves, send `execute` and `stdin` packets and read
// what comes back, framed by length, until `sigterm` arrives on channel 0;
// then end with status 0.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "ipc/packet.hpp"

namespace torvad::peer {

// The ipc fd torvad passed as the last argument (on Windows the value of an
// inherited handle), or -1 when that argument is not the decimal number of an
// open descriptor or handle.
int ipc_fd_from_arguments(int argc, char** argv);

struct packet {
    packet_header header;
    std::string payload;
};

class connection {
  public:
    explicit connection(int fd);
    ~connection();
    connection(connection&& other) noexcept;
    connection& operator=(connection&& other) noexcept;
    connection(const connection&) = delete;
    connection& operator=(const connection&) = delete;

    // Blocks for the next whole packet; false on end of stream, an error or a
    // length outside 16..65536 (the stream can't be trusted after that).
    bool receive(packet& out);
    // Sends one packet in a single write of the whole block.
    bool send(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
              std::string_view payload = {});
    // Asks for items (optional user, optional path, executable, arguments) to
    // be run as a new channel; flags are the execute_* bits.
    bool execute(std::uint32_t channel, std::uint32_t flags, const std::vector<std::string>& items);
    // Bytes for a channel's standard input; close ends that input after them.
    bool send_stdin(std::uint32_t channel, std::string_view bytes, bool close = false);
    // True when bytes already read wait here: receive() takes them before it
    // reads again, so a wait for the link to be readable would miss them.
    bool buffered() const { return !buffer_.empty(); }
    // Tells torvad the program serves: sent once, when it does.
    bool send_ready() { return send(0, packet_ready, 0); }
    // From now on a send gives up when torvad takes nothing for ms.
    void limit_send_wait(int ms) { send_wait_ms_ = ms; }
    int fd() const { return fd_; }

  private:
    bool fill();
    int fd_ = -1;
    int send_wait_ms_ = -1; // no limit
    std::string buffer_;    // bytes read but not yet handed out
};

struct version_info {
    std::string program_name;
    std::string version;
    bool background = false;
};

// The three items of a version packet; nothing when the packet isn't one.
std::optional<version_info> parse_version(const packet& received);

// Reads the first packet, which must be a valid version.
bool read_version(connection& link, version_info& out);

// Keeps the program running through the events a Windows console sends to
// every program on it (Ctrl-Break, its close, the system's shutdown, and a
// logoff, which is a user's and not the service's): torvad hears them too
// and stops its children in order, so the program ends at its sigterm,
// not before. Call it first thing in main; nothing to do on Linux, where
// torvad keeps the terminal's signals from its children.
void outlive_console_events();

} // namespace torvad::peer
