// The child program of the end-to-end tests: one mode per behaviour a
// supervised program can show. It reports on stdout in lines "child: ...".
//   test_child <mode> [args...] [ipc fd, appended by torvad]
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "ipc/strings.hpp"
#include "peer/link.hpp"
#include "peer/peer.hpp"
#include "tests/child/child_host.hpp"

#ifdef _WIN32
#include <io.h>
#include <process.h>
#else
#include <unistd.h>
#endif

namespace {

using namespace torvad;
using peer::connection;
namespace fs = std::filesystem;

int out_fd = 1; // stdout, or core.log for a core with no console (a service's)

// One write for the line, so it stands whole beside the supervisor's.
void say(std::string line) {
    line = "child: " + line + "\n";
    if (write(out_fd, line.data(), static_cast<unsigned>(line.size())) < 0) {
    }
}

struct context {
    std::vector<std::string> args; // behind the mode, without the ipc fd
    int ipc_fd = -1;
    bool says_ready = false; // sends ready once it has the version
    int number(std::size_t i) const { return i < args.size() ? std::atoi(args[i].c_str()) : 0; }
};

// True the first time only, when it makes the marker.
bool create_once(const std::string& marker) {
    return !fs::exists(marker) && std::ofstream(marker);
}

// Reads the version and reports it; false when the first packet isn't one.
bool greet(connection& link) {
    peer::version_info v;
    if (!peer::read_version(link, v))
        return false;
    say("version " + v.program_name + " " + v.version +
        " Background:" + (v.background ? "true" : "false"));
    say("ready pid=" + std::to_string(getpid()));
    return true;
}

// Ends 0 at sigterm; a deaf peer ignores the first and ends 137 at the second,
// as if killed, so that no row needs to kill it.
int await_sigterm(connection& link, bool deaf = false) {
    peer::packet packet;
    for (int heard = 0; link.receive(packet);)
        if (packet.header.type == packet_sigterm && (!deaf || ++heard == 2))
            return say(deaf ? "second sigterm" : "sigterm"), deaf ? 137 : 0;
        else if (packet.header.type == packet_sigterm)
            say("sigterm ignored");
    return deaf ? 0 : 4;
}

int serve(const context& how, bool deaf = false) {
    if (how.ipc_fd < 0)
        return 0;
    connection link(how.ipc_fd);
    if (!greet(link) || (how.says_ready && !link.send_ready()))
        return 5;
    return await_sigterm(link, deaf);
}

// What the child was started with.
int mode_fds(const context& how) {
    for (const auto& line : child_host::start_state(how.ipc_fd))
        say(line);
    if (std::getenv("NOTIFY_SOCKET") != nullptr)
        say("notify socket inherited");
    return serve(how);
}

// Sends one execute per request, "FLAGS ITEMS...", "+" between requests, on
// channels 1, 2, ..., pipelined in one write up to an "!rmcwd", which removes
// the working directory; reports each opened, stdout and end. Led by "once
// MARKER OPENS", the first time it exits 3 once OPENS channels opened, leaving
// them behind; started again, it serves ("once-deaf": deaf to one sigterm).
int mode_execute(const context& how) {
    bool once = how.args.size() > 2 && how.args[0].starts_with("once");
    if (once && !create_once(how.args[1]))
        return serve(how, how.args[0] == "once-deaf");
    connection link(how.ipc_fd);
    greet(link);
    std::string batch;
    std::uint32_t channel = 0;
    for (std::size_t at = once ? 3 : 0, end; at < how.args.size(); at = end + 1) {
        end = std::find(how.args.begin() + at, how.args.end(), "+") - how.args.begin();
        if (how.args[at] == "!rmcwd") {
            peer::write_link(how.ipc_fd, batch.data(), batch.size());
            batch.clear();
            std::error_code error;
            say(fs::remove(fs::current_path(), error) ? "rmcwd 0" : "rmcwd -1");
        } else if (end - at > 1) {
            std::vector<std::string> list(how.args.begin() + at + 1, how.args.begin() + end);
            if (how.args[at].ends_with('x')) // flags "Nx": the last item is one byte, in hex
                list.back() = std::string(1, char(std::stoi(list.back(), nullptr, 16)));
            std::string items = join_strings(list);
            auto block = encode_packet(++channel, packet_execute, std::stoul(how.args[at]),
                                       items.data(), items.size());
            batch.append(block.begin(), block.end());
        }
    }
    peer::write_link(how.ipc_fd, batch.data(), batch.size());
    peer::packet packet;
    for (int opened = 0; once && opened < how.number(2) && link.receive(packet);)
        opened += packet.header.type == packet_opened;
    if (once)
        return say("left"), 3;
    for (std::uint32_t ends = 0; ends < channel && link.receive(packet);) {
        const auto& h = packet.header;
        std::string line = std::to_string(h.channel) + " " + packet_type_name(h.type);
        if (h.type == packet_sigterm)
            return 0;
        if (h.type == packet_stdout || h.type == packet_opened)
            say(line + (h.type == packet_stdout ? " " + packet.payload : ""));
        else if ((h.type == packet_failed || h.type == packet_closed) && ++ends)
            say(line + " " + std::to_string(h.flags));
    }
    return await_sigterm(link);
}

} // namespace

int main(int argc, char** argv) {
    child_host::prepare_streams();
    if (int code = child_host::stand_in_for_tool(argv[0]); code >= 0)
        return code;
    context how{{}, peer::ipc_fd_from_arguments(argc, argv)};
    // Named core, it is the product's server program: -h gives its version on
    // stderr (unless a file "silent" is there); else it reports as the fds mode
    // does, to "core.log" when that is there, and says it is ready when a file
    // "ready" is there.
    bool core = fs::path(argv[0]).stem() == "core";
    if (core && argc > 1 && std::string_view(argv[1]) == "-h")
        return std::fputs(fs::exists("silent") ? "usage: core\n" : "test_child version 1\n",
                          stderr) < 0;
    if (core && fs::exists("core.log"))
        out_fd = open("core.log", O_WRONLY | O_APPEND);
    how.says_ready = core && fs::exists("ready");
    if (core)
        return mode_fds(how);
    if (argc > 1)
        how.args.assign(argv + 2, argv + std::max(2, argc - (how.ipc_fd >= 0)));
    std::string_view mode = argc > 1 ? argv[1] : "";
    if (mode == "peer" || mode == "ignore-sigterm")
        return serve(how, mode == "ignore-sigterm");
    if (mode == "fds")
        return mode_fds(how);
    if (mode == "execute")
        return mode_execute(how);
    // Each argument in brackets, as the program got it, unprintable bytes as \xHH.
    if (mode == "args") {
        std::string line;
        char hex[5];
        for (const auto& arg : how.args) {
            line += '[';
            for (unsigned char c : arg)
                line += c >= 0x20 && c < 0x7f ? std::string(1, static_cast<char>(c))
                                              : (std::snprintf(hex, sizeof hex, "\\x%02x", c), hex);
            line += ']';
        }
        return say("args " + line), 0;
    }
    // A peer that floods the stdin of the channel COMMAND; a send that can't go
    // out within half a second means torvad holds back, far short of 16 MiB.
    if (mode == "flood-in") {
        connection link(how.ipc_fd);
        greet(link);
        link.execute(1, execute_stdio_pipes, how.args);
        link.limit_send_wait(500);
        const std::size_t all = std::size_t(16) << 20;
        std::size_t sent = 0;
        for (std::string chunk(packet_max_payload, 'i'); sent < all && link.send_stdin(1, chunk);)
            sent += chunk.size();
        say(std::string("flood-in ") + (sent < all ? "held" : "sent all") + " after " +
            std::to_string(sent >> 20) + " MiB");
        return await_sigterm(link);
    }
    // "exit CODE [SECONDS]s": the unit keeps a bare number from being taken for the ipc fd.
    // Each argument a notify datagram ("big": READY=1 in one too long to
    // take); then it waits for a signal, as a server does.
    if (mode == "notify") {
        for (const auto& message : how.args)
            child_host::notify(message == "big" ? "READY=1\n" + std::string(5000, 'x') : message);
        for (say("notified");;)
            std::this_thread::sleep_for(std::chrono::hours(1));
    }
    if (mode == "exit")
        return std::this_thread::sleep_for(std::chrono::seconds(how.number(1))), how.number(0);
    // Speaks as torvad on the ipc fd it was given: output of channel 9.
    if (mode == "forge")
        return connection(how.ipc_fd).send(9, packet_stdout, 0, "forged") ? 0 : 1;
    // "orphans N MARKER": the first time, exits 3 leaving N orphans; then serves.
    if (mode == "orphans" && (how.args.size() < 2 || !create_once(how.args[1])))
        return serve(how);
    if (mode == "orphans")
        return child_host::leave_orphans(how.number(0)) ? (say("orphans made"), 3) : 1;
    // "squat N,N,... ...": takes torvad's pipe names N, executes the rest, tells if heard.
    if (mode == "squat") {
        say(child_host::squat(how.args.at(0)) ? "squat taken" : "squat failed");
        int code = mode_execute({{how.args.begin() + 1, how.args.end()}, how.ipc_fd});
        return say(child_host::squat("") ? "squat connected" : "squat heard nothing"), code;
    }
    // "attach TORVAD CHILD": starts TORVAD with -a on a pipe of ours and has it
    // run CHILD forging on that pipe's far end, with pipes, so that handles pass.
    int ours = -1;
    long theirs = -1;
    if (mode == "attach" && child_host::start_attached(how.args.at(0), ours, theirs)) {
        connection link(ours);
        peer::packet packet;
        bool forged = !link.receive(packet) || packet.header.type != packet_version ||
                      !link.execute(1, execute_stdio_pipes,
                                    {how.args.at(1), "forge", std::to_string(theirs)});
        while (!forged && link.receive(packet) && packet.header.type != packet_closed)
            forged = packet.header.channel == 9;
        return say(forged ? "attach forged" : "attach clean"), 0;
    }
    // A logoff is no stop: once it has passed, the child ends of its own accord.
    if (mode == "console-event" && child_host::console_event(how.number(0)))
        return how.number(0) == 5 ? (say("logoff passed"), 0) : serve(how);
    std::fprintf(stderr, "usage: test_child <mode> [args...] [ipc fd]\n");
    return 64;
}
