// torvad-wrap: puts a program that doesn't speak torvad's protocol under
// torvad. It speaks the protocol on the pipe torvad gives it, runs the program
// with its own standard streams, turns sigterm into the program's own stop
// and the program's notify READY=1 into the ready packet, and ends with the
// program's status, so that a failure is restarted as any child's is.
//   torvad [options] -- torvad-wrap [-s signal] [-i] [--] program args
#include <atomic>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "peer/peer.hpp"
#include "peer/wrap/program.hpp"

namespace {

using namespace torvad;

struct wrap_options {
    int stop_signal = wrap::default_stop_signal();
    bool ready_at_once = false;
    std::vector<std::string> command;
};

const char* const usage = "Usage: torvad -- torvad-wrap <options> [--] <program> <args>\n"
                          "  -s  <signal> that stops the program (default TERM)\n"
                          "  -i  ready at once, not at the program's READY=1\n";

// Options come first; the first other word, or what follows "--", is the
// program. The last argument is torvad's pipe, no word of the program's.
bool scan(int argc, char** argv, wrap_options& out) {
    int i = 1;
    for (; i < argc - 1 && argv[i][0] == '-'; ++i) {
        std::string_view option = argv[i];
        if (option == "--") {
            ++i;
            break;
        }
        if (option == "-i")
            out.ready_at_once = true;
        else if (option == "-s" && i + 1 < argc - 1)
            out.stop_signal = wrap::signal_by_name(argv[++i]);
        else
            return false;
    }
    out.command.assign(argv + i, argv + argc - 1);
    return out.stop_signal > 0 && !out.command.empty();
}

// What a stop shares with the end: the program once started, and the signal
// once one was sent to stop it. A stop may come on a thread of its own (a
// Windows console's), hence the atomics.
wrap::running_program program;
std::atomic<bool> started = false;
std::atomic<int> stop_sent = 0;

// A stop that can't be sent leaves the program running and torvad waiting:
// the line says why.
void stop() {
    if (!started)
        return;
    stop_sent = program.stop_signal;
    if (wrap::stop_failure failed = wrap::stop_program(program); failed.error != 0)
        std::fprintf(stderr, "torvad-wrap: can't stop the program: %s: %s\n", failed.call,
                     wrap::error_text(failed.error).c_str());
}

// Takes what the link holds: the version, first, is passed over like any
// packet but sigterm, since the program starts without waiting for it. Every
// sigterm stops it again; the end of the pipe means torvad is gone, and the
// program is stopped the same way rather than left behind. False at the end.
bool take_packets(peer::connection& link) {
    peer::packet packet;
    do {
        if (!link.receive(packet)) {
            std::fprintf(stderr, "torvad-wrap: torvad's pipe closed; stopping the program.\n");
            stop();
            return false;
        }
        if (packet.header.type == packet_sigterm && packet.header.channel == 0)
            stop();
    } while (link.buffered());
    return true;
}

// A message is lines of NAME=value; READY=1 among them is the one we act on,
// the first time. One too long for the buffer is dropped whole, as systemd
// does. False once the socket fails.
bool take_notification(const wrap::notify_socket& socket, peer::connection& link, bool& ready) {
    char buffer[4096];
    bool too_long = false;
    long got = wrap::receive_notification(socket, buffer, sizeof buffer, too_long);
    if (got < 0)
        return false;
    if (too_long) {
        std::fprintf(stderr, "torvad-wrap: a notify message of %ld bytes ignored.\n", got);
        return true;
    }
    std::string_view message(buffer, static_cast<std::size_t>(got));
    for (std::size_t at = 0, end; !ready && at <= message.size(); at = end + 1) {
        end = std::min(message.find('\n', at), message.size());
        ready = message.substr(at, end - at) == "READY=1" && link.send_ready();
    }
    return true;
}

[[noreturn]] void end_with(int status) {
    std::fflush(nullptr);
    // A reader of the link may still be blocked on a thread of its own
    // (Windows): end without unwinding anything.
    std::_Exit(status);
}

int run(int argc, char** argv) {
    wrap_options options;
    int fd = peer::ipc_fd_from_arguments(argc, argv);
    if (fd < 0 || !scan(argc, argv, options))
        return std::fputs(usage, stderr), 2;
    wrap::hold_own_stop_requests();
    wrap::keep_link_from_program(fd);
    peer::connection link(fd);
    wrap::notify_socket socket;
    if (!options.ready_at_once)
        socket = wrap::open_notify_socket();
    if (socket.error != 0)
        std::fprintf(stderr,
                     "torvad-wrap: no NOTIFY_SOCKET for the program (%s); -i makes it "
                     "ready at once.\n",
                     wrap::error_text(socket.error).c_str());
    if (int error =
            wrap::start_program(options.command, socket.address, options.stop_signal, program)) {
        std::fprintf(stderr, "torvad-wrap: cannot run '%s': %s\n", options.command[0].c_str(),
                     wrap::error_text(error).c_str());
        return error;
    }
    started = true;
    if (options.ready_at_once)
        link.send_ready();
    bool ready = false;
    wrap::handlers handlers{
        [&link] { return take_packets(link); },
        [&socket, &link, &ready] { return take_notification(socket, link, ready); }, stop};
    wrap::program_end end = wrap::serve(program, fd, socket, handlers);
    // A program ended by the very signal sent to stop it has ended cleanly,
    // as service managers count it.
    end_with(end.signal != 0 && end.signal == stop_sent ? 0 : end.status);
}

} // namespace

int main(int argc, char** argv) {
    end_with(run(argc, argv));
}
