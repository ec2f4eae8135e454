// The child program of the end-to-end tests: one mode per behaviour a
// supervised program can show. It reports on stdout in lines "child: ...".
//   test_child <mode> [args...] [ipc fd, appended by torvad]
#include <algorithm>
#include <chrono>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
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

void say(const char* format, ...) __attribute__((format(printf, 1, 2)));
void say(const char* format, ...) {
    va_list args;
    va_start(args, format);
    // One write for the line, so it stands whole beside the supervisor's.
    char line[4096] = "child: ";
    int length = 7 + std::min(std::vsnprintf(line + 7, sizeof line - 8, format, args),
                              static_cast<int>(sizeof line - 9));
    va_end(args);
    line[length++] = '\n';
    for (int put = 0, at = 0; at < length; at += put)
        if ((put = static_cast<int>(write(1, line + at, static_cast<unsigned>(length - at)))) <= 0)
            return;
}

struct context {
    const char* self;
    std::vector<std::string> args; // behind the mode, without the ipc fd
    int ipc_fd = -1;
    std::string mode = "";
    int number(std::size_t i) const { return i < args.size() ? std::atoi(args[i].c_str()) : 0; }
};

bool create_once(const std::string& path) {
    if (fs::exists(path))
        return false;
    std::ofstream{path};
    return true;
}

// Reads version and reports it; false when the first packet isn't one.
bool greet(connection& link) {
    peer::version_info version;
    if (!peer::read_version(link, version))
        return false;
    say("version %s %s Background:%s", version.program_name.c_str(), version.version.c_str(),
        version.background ? "true" : "false");
    say("ready pid=%d", getpid());
    return true;
}

// Ends 0 at sigterm; a deaf peer ignores the first and, as if it had been
// killed, ends 137 at the second, so that no row needs to kill it.
int await_sigterm(connection& link, bool deaf = false) {
    peer::packet packet;
    for (int sigterms = 0; link.receive(packet);) {
        if (packet.header.type != packet_sigterm)
            continue;
        if (!deaf)
            return say("sigterm"), 0;
        if (++sigterms == 2)
            return say("second sigterm"), 137;
        say("sigterm ignored");
    }
    return deaf ? 0 : 4;
}

int serve(const context& how, bool deaf = false) {
    if (how.ipc_fd < 0)
        return 0;
    connection link(how.ipc_fd);
    return greet(link) ? await_sigterm(link, deaf) : 5;
}

int mode_peer(const context& how) {
    return serve(how, how.mode == "ignore-sigterm");
}

// A peer whose report goes to the file FILE, for a run with no console to
// write to (a service): its version, then how it ended.
int mode_record(const context& how) {
    std::ofstream report(how.args.empty() ? "record.log" : how.args[0],
                         std::ios::app | std::ios::binary);
    connection link(how.ipc_fd);
    peer::version_info version;
    if (!peer::read_version(link, version))
        return 5;
    report << "version " << version.version << " Background:" << version.background << std::endl;
    peer::packet packet;
    while (link.receive(packet))
        if (packet.header.type == packet_sigterm)
            return report << "sigterm" << std::endl ? 0 : 1;
    report << "eof" << std::endl;
    return 4;
}

// "exit CODE [SECONDS]s": the unit keeps a bare number from being taken for the ipc fd.
int mode_exit(const context& how) {
    std::this_thread::sleep_for(std::chrono::seconds(how.number(1)));
    return how.number(0);
}

// What the child was started with, as the lines of the host's report.
int mode_fds(const context& how) {
    for (const auto& line : child_host::start_state(how.ipc_fd))
        say("%s", line.c_str());
    return serve(how);
}

// Speaks as torvad on the ipc fd it was given, if any: output of channel 9.
int mode_forge(const context& how) {
    auto packet = encode_packet(9, packet_stdout, 0, "forged", 6);
    return peer::write_link(how.ipc_fd, packet.data(), packet.size()) ? 0 : 1;
}

// Sends one execute per request, on channels 1, 2, ...; each request is its
// flags, then its items, and "+" separates requests. "!rmcwd" instead removes
// the working directory; everything between two "!rmcwd" goes out in one write, as a peer
// that pipelines sends it. Reports each opened, stdout and end per channel.
// Led by "once MARKER OPENS", the first time (no MARKER yet) it waits for
// OPENS opened packets instead and exits 3, leaving its channels behind;
// started again, it serves ("once-deaf": deaf to the first sigterm).
int mode_execute(const context& how) {
    bool once = how.args.size() > 2 && how.args[0].starts_with("once");
    if (once && !create_once(how.args[1]))
        return serve(how, how.args[0] == "once-deaf");
    connection link(how.ipc_fd);
    greet(link);
    std::string batch;
    auto flush = [&] {
        if (!batch.empty())
            peer::write_link(how.ipc_fd, batch.data(), batch.size());
        batch.clear();
    };
    std::uint32_t channel = 0;
    std::vector<std::string> request;
    auto args = std::vector(how.args.begin() + (once ? 3 : 0), how.args.end());
    args.push_back("+");
    for (const auto& arg : args) {
        if (arg != "+") {
            request.push_back(arg);
            continue;
        }
        std::error_code error;
        if (request == std::vector<std::string>{"!rmcwd"}) {
            flush();
            say("rmcwd %d", fs::remove(fs::current_path(), error) ? 0 : -1);
        } else if (request.size() > 1) {
            std::string items = join_strings({request.begin() + 1, request.end()});
            auto block = encode_packet(++channel, packet_execute,
                                       static_cast<std::uint32_t>(std::stoul(request[0])),
                                       items.data(), items.size());
            batch.append(block.begin(), block.end());
        }
        request.clear();
    }
    flush();
    peer::packet packet;
    if (once) {
        for (int opened = 0; opened < how.number(2) && link.receive(packet);)
            opened += packet.header.type == packet_opened;
        say("left");
        return 3;
    }
    for (std::uint32_t ends = 0; ends < channel && link.receive(packet);) {
        const auto& h = packet.header;
        if (h.type == packet_sigterm)
            return 0;
        if (h.type == packet_stdout)
            say("%u stdout %s", h.channel, packet.payload.c_str());
        else if (h.type == packet_opened)
            say("%u opened", h.channel);
        else if ((h.type == packet_failed || h.type == packet_closed) && ++ends)
            say("%u %s %u", h.channel, packet_type_name(h.type), h.flags);
    }
    return await_sigterm(link);
}

// Each argument in brackets, as the program got it; a byte that a console
// would draw otherwise as \xHH.
int mode_args(const context& how) {
    std::string line;
    char escaped[5];
    for (const auto& arg : how.args) {
        line += "[";
        for (unsigned char c : arg)
            line += c >= 0x20 && c < 0x7f ? std::string(1, static_cast<char>(c))
                                          : (std::snprintf(escaped, sizeof escaped, "\\x%02x", c),
                                             std::string(escaped));
        line += "]";
    }
    say("args %s", line.c_str());
    return 0;
}

// Takes the name of torvad's ipc pipe number N first, then sends the
// requests behind N as the execute mode does.
int mode_squat(const context& how) {
    say("squat %s", child_host::take_pipe_name(how.number(0)) ? "taken" : "failed");
    return mode_execute({how.self, {how.args.begin() + 1, how.args.end()}, how.ipc_fd});
}

// A peer that floods the stdin of the channel COMMAND; a send that can't go
// out within half a second means torvad holds back.
int mode_flood_in(const context& how) {
    connection link(how.ipc_fd);
    greet(link);
    link.execute(1, execute_stdio_pipes, how.args);
    link.limit_send_wait(500);
    std::string chunk(packet_max_payload, 'i');
    std::size_t sent = 0;
    while (sent < (std::size_t(256) << 20) && link.send_stdin(1, chunk))
        sent += chunk.size();
    say("flood-in %s after %s MiB", sent < (std::size_t(256) << 20) ? "held" : "sent all",
        std::to_string(sent >> 20).c_str());
    return await_sigterm(link);
}

// The first time (no marker yet): leaves N orphans behind, which end together
// with us as we exit with 3; then, started again, serves.
int mode_orphans(const context& how) {
    if (how.args.size() < 2 || !create_once(how.args[1]))
        return serve(how);
    if (!child_host::leave_orphans(how.number(0)))
        return 1;
    say("orphans made");
    return 3;
}

const std::pair<const char*, int (*)(const context&)> modes[] = {
    {"exit", mode_exit},
    {"peer", mode_peer},
    {"ignore-sigterm", mode_peer},
    {"fds", mode_fds},
    {"record", mode_record},
    {"forge", mode_forge},
    {"execute", mode_execute},
    {"flood-in", mode_flood_in},
    {"orphans", mode_orphans},
    {"args", mode_args},
    {"squat", mode_squat},
    {"console-event",
     [](const context& how) {
         return child_host::console_event(how.number(0)) ? serve(how) : 1;
     }},
};

} // namespace

// Named "core" ("core.exe" on Windows), it stands in for the product's server
// program: it answers -h with its version on stderr (a file "silent" in its
// working directory keeps the version back) and otherwise reports as the fds
// mode does, or records as the record mode does to a file "core.log" that is
// there, for a run with no console, or sends the requests of the execute mode
// that a file "core.execute" holds, one argument a line.
bool is_core(const char* self) {
    std::string name = fs::path(self).filename().string();
    return name == "core" || name == "core.exe";
}

int main(int argc, char** argv) {
    child_host::prepare_streams();
    context how{argv[0], {}, peer::ipc_fd_from_arguments(argc, argv)};
    if (is_core(argv[0]) && argc > 1 && std::strcmp(argv[1], "-h") == 0)
        return std::fputs(fs::exists("silent") ? "usage: core\n" : "test_child version 1\n",
                          stderr) < 0;
    if (int code = child_host::stand_in_for_tool(argv[0]); code >= 0)
        return code;
    if (is_core(argv[0]) && fs::exists("core.log"))
        return mode_record({argv[0], {"core.log"}, how.ipc_fd});
    std::ifstream requests("core.execute", std::ios::binary);
    for (std::string line; is_core(argv[0]) && std::getline(requests, line);)
        how.args.push_back(line);
    if (!how.args.empty())
        return mode_execute(how);
    if (is_core(argv[0]))
        return mode_fds(how);
    for (int i = 2; i < (how.ipc_fd >= 0 ? argc - 1 : argc); ++i)
        how.args.emplace_back(argv[i]);
    how.mode = argc > 1 ? argv[1] : "";
    for (const auto& [name, run] : modes)
        if (how.mode == name)
            return run(how);
    std::fprintf(stderr, "usage: test_child <mode> [args...] [ipc fd]\n");
    return 64;
}
