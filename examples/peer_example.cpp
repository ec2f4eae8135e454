// A product program as torvad runs it: a persistent child that talks to the
// supervisor over the ipc fd given as its last argument. It asks for one
// program to be run with its output relayed, prints what comes back, then
// waits for the supervisor's request to end.
#include <cstdio>

#include "peer/peer.hpp"

using namespace torvad;

int main(int argc, char** argv) {
    int fd = peer::ipc_fd_from_arguments(argc, argv);
    if (fd < 0) {
        std::fprintf(stderr, "peer_example: run me under torvad: torvad -- %s\n", argv[0]);
        return 2;
    }
    peer::connection link(fd);

    // The supervisor always speaks first, with its version.
    peer::version_info version;
    if (!peer::read_version(link, version))
        return 3;
    std::printf("peer_example: supervised by %s %s\n", version.program_name.c_str(),
                version.version.c_str());

    // Channel ids are ours to choose; the upper 12 bits name a module in the trace.
    const std::uint32_t channel = 1 << 20 | 1;
    link.execute(channel, execute_stdio_pipes, {"echo", "hello from a channel"});

    peer::packet packet;
    while (link.receive(packet)) {
        switch (packet.header.type) {
        case packet_opened:
            std::printf("peer_example: channel running as pid %u\n", packet.header.flags);
            break;
        case packet_stdout:
            std::printf("peer_example: channel says: %s", packet.payload.c_str());
            break;
        case packet_failed:
        case packet_closed:
            std::printf("peer_example: channel ended with %u; Ctrl-C stops the demo\n",
                        packet.header.flags);
            break;
        case packet_sigterm:
            // An orderly end: status 0 tells torvad not to start us again.
            std::printf("peer_example: asked to stop\n");
            return 0;
        }
        std::fflush(stdout);
    }
    return 1; // the supervisor went away
}
