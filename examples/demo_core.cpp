// The demo product's server program: torvad finds it as "core" in
// examples/demo and supervises it. It shows what a product program does:
// answer -h with its version (or torvad hands the service over to it), read
// the supervisor's version, have tools run through execute under the rules of
// exec.patterns, fail once so torvad starts it again, say it is ready, and
// end on sigterm.
#include <cstdio>
#include <cstring>

#include "examples/demo_host.hpp"
#include "peer/peer.hpp"

using namespace torvad;

namespace {

// Channel ids are ours to choose; the upper 12 bits name a module in the trace.
constexpr std::uint32_t sysmgmt = 55 << 20;
constexpr std::uint32_t permitted = sysmgmt | 1, forbidden = sysmgmt | 2,
                        other_account = sysmgmt | 3;

// One failure per `make run`, which removes the marker before it starts us.
bool fail_this_time() {
    return demo::create_marker("failed-once.marker");
}

const char* describe(std::uint32_t channel) {
    return channel == permitted   ? "uname -sr"
           : channel == forbidden ? "cat /etc/shadow"
                                  : "whoami as nobody";
}

void ask_for_tools(peer::connection& link) {
    link.execute(permitted, execute_stdio_pipes, {"uname", "-sr"});
    link.execute(forbidden, execute_stdio_pipes, {"cat", "/etc/shadow"});
    link.execute(other_account, execute_user | execute_stdio_pipes, {"nobody", "whoami"});
}

// Prints what comes back on each channel; true when torvad asked us to end.
bool serve(peer::connection& link) {
    peer::packet packet;
    while (link.receive(packet)) {
        std::uint32_t channel = packet.header.channel, flags = packet.header.flags;
        switch (packet.header.type) {
        case packet_opened:
            std::printf("core: '%s' running as pid %u\n", describe(channel), flags);
            break;
        case packet_stdout:
        case packet_stderr:
            std::printf("core: '%s' says: %s", describe(channel), packet.payload.c_str());
            break;
        case packet_failed:
            std::printf("core: '%s' refused with status %u%s\n", describe(channel), flags,
                        flags == status_not_permitted ? " (not permitted)" : "");
            break;
        case packet_closed:
            std::printf("core: '%s' ended with %u\n", describe(channel), flags);
            break;
        case packet_sigterm:
            std::printf("core: asked to stop, ending cleanly\n");
            return true;
        }
        std::fflush(stdout);
    }
    return false;
}

} // namespace

int main(int argc, char** argv) {
    // A console's Ctrl-Break or close reaches us as it reaches torvad, whose
    // sigterm is then our orderly end.
    peer::outlive_console_events();
    // torvad asks this before every start; without "version" on the first
    // line of stderr it would hand the service over to us.
    if (argc > 1 && std::strcmp(argv[1], "-h") == 0) {
        std::fputs("demo core version 1.0\n", stderr);
        return 0;
    }
    int fd = peer::ipc_fd_from_arguments(argc, argv);
    if (fd < 0) {
        std::fprintf(stderr, "core: run me under torvad: make run\n");
        return 2;
    }
    peer::connection link(fd);
    peer::version_info version;
    if (!peer::read_version(link, version))
        return 3;
    std::printf("core: supervised by %s %s, running as %s\n", version.program_name.c_str(),
                version.version.c_str(), demo::account().c_str());
    if (fail_this_time()) {
        std::printf("core: failing once on purpose; torvad starts a failed program again\n");
        return 3;
    }
    ask_for_tools(link);
    // Serving from here on: under -r torvad reports the product ready once
    // every persistent child has said so; the failing first start never did.
    link.send_ready();
    std::fflush(stdout);
    // 0 tells torvad this was an orderly end, not one to restart.
    return serve(link) ? 0 : 1;
}
