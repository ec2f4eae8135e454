// Feeds arbitrary bytes to the ipc framing loop, cut into reads of varying
// size, through the same member that a completed pipe read calls.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <sys/socket.h>

#include "daemon/daemon.hpp"
#include "ipc/packet.hpp"
#include "process/process.hpp"

using namespace torvad;

namespace {

// Owned by the daemon's children, like any process; it must not outlive them.
// The daemon is never configured, so every execute request is refused and
// nothing is ever started, whatever the input asks for.
process* peer_object = nullptr;

// The first byte picks the size of every read: tiny ones that cut headers
// apart, or large ones up to the whole buffer.
std::size_t read_size(std::uint8_t selector) {
    if (selector < 128)
        return selector + 1u;
    return (selector - 127u) * 512u;
}

// The loop never runs, so the replies to refused requests pile up behind the
// version packet, whose write stays in flight: drop all but that one.
void drop_queued_replies(process& object) {
    if (object.ipc_queue.size() > 1)
        object.ipc_queue.erase(object.ipc_queue.begin() + 1, object.ipc_queue.end());
}

// No whole packet may be left unframed, and the buffer never overflows.
void check_invariants(const process& object) {
    if (object.ipc_fill > sizeof object.ipc_buffer)
        __builtin_trap();
    if (object.ipc_fill >= packet_header_size) {
        packet_header header = read_packet_header(object.ipc_buffer);
        if (!valid_packet_length(header.length) || header.length <= object.ipc_fill)
            __builtin_trap();
    }
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    // The daemon logs every bad length; keep the run fast.
    if (std::freopen("/dev/null", "w", stdout) == nullptr)
        return 1;
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == -1)
        return 1;
    auto created = process::create(&the_daemon, {"peer"}, "", ".", {}, true, stdio_inherit);
    created->attach(1, fds[0]);
    peer_object = created.get();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    process& object = *peer_object;
    object.ipc_fill = 0;
    std::size_t chunk = size == 0 ? 1 : read_size(data[0]);
    for (std::size_t offset = size == 0 ? 0 : 1; offset < size;) {
        // A read never takes more than the free space behind the held bytes.
        std::size_t free_space = sizeof object.ipc_buffer - object.ipc_fill;
        std::size_t bytes = std::min({chunk, free_space, size - offset});
        std::memcpy(object.ipc_buffer + object.ipc_fill, data + offset, bytes);
        object.frame_ipc(static_cast<std::uint32_t>(bytes));
        check_invariants(object);
        offset += bytes;
    }
    drop_queued_replies(object);
    return 0;
}
