// The child program of the end-to-end tests: one mode per behaviour a
// supervised program can show. It reports on stdout in lines "child: ...".
//   test_child <mode> [args...] [ipc fd, appended by torvad]
#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
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
using std::chrono::milliseconds;
namespace fs = std::filesystem;

// Writes all of data to standard output (1) or standard error (2), bytes as
// they are (Windows would turn \n into \r\n but for prepare_streams).
bool write_stream(int stream, const char* data, std::size_t size) {
    for (int put = 0; size > 0; data += put, size -= static_cast<std::size_t>(put))
        if ((put = static_cast<int>(write(stream, data, static_cast<unsigned>(size)))) <= 0)
            return false;
    return true;
}

void say(const char* format, ...) __attribute__((format(printf, 1, 2)));
void say(const char* format, ...) {
    va_list args;
    va_start(args, format);
    // One write for the line, so it stands whole beside the supervisor's.
    char line[4096] = "child: ";
    int length = std::vsnprintf(line + 7, sizeof line - 8, format, args);
    length = 7 + std::min(length, static_cast<int>(sizeof line - 9));
    line[length++] = '\n';
    std::fflush(stdout);
    write_stream(1, line, static_cast<std::size_t>(length));
    va_end(args);
}

struct context {
    const char* self;
    std::vector<std::string> args; // behind the mode, without the ipc fd
    int ipc_fd = -1;
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

// Reports every packet until sigterm or end of stream.
int await_sigterm(connection& link, bool obey_sigterm) {
    peer::packet packet;
    while (link.receive(packet)) {
        if (packet.header.type != packet_sigterm)
            say("packet type=%u channel=%u", packet.header.type, packet.header.channel);
        else if (say(obey_sigterm ? "sigterm" : "sigterm ignored"); obey_sigterm)
            return 0;
    }
    say("eof");
    return obey_sigterm ? 4 : 0;
}

int serve(const context& how, bool obey_sigterm) {
    if (how.ipc_fd < 0)
        return 0;
    connection link(how.ipc_fd);
    return greet(link) ? await_sigterm(link, obey_sigterm) : 5;
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

int mode_exit(const context& how) {
    return how.number(0);
}

// What the child was started with, as the lines of the host's report.
int mode_fds(const context& how) {
    for (const auto& line : child_host::start_state(how.ipc_fd))
        say("%s", line.c_str());
    return serve(how, true);
}

int mode_signal(const context& how) {
    std::signal(how.number(0), SIG_DFL);
    raise(how.number(0));
    return 0;
}

int mode_echo(const context&) {
    char buffer[4096];
    long got;
    while ((got = read(0, buffer, sizeof buffer)) > 0)
        if (!write_stream(1, buffer, static_cast<std::size_t>(got)))
            return 1;
    const char eof[] = "child: echo eof\n";
    return write_stream(2, eof, sizeof eof - 1) ? 0 : 1;
}

// "sleep 3s": the unit keeps a bare number from being taken for the ipc fd.
int mode_sleep(const context& how) {
    std::this_thread::sleep_for(std::chrono::seconds(how.number(0)));
    return 0;
}

// Writes hex bytes to the pipe; each "/" ends one write and pauses, so the
// supervisor sees the pieces in separate reads.
int mode_raw(const context& how) {
    std::string hex = how.args.empty() ? "" : how.args[0] + "/", bytes;
    for (std::size_t i = 0; i < hex.size(); ++i) {
        if (hex[i] != '/') {
            bytes += static_cast<char>(std::stoi(hex.substr(i++, 2), nullptr, 16));
        } else if (peer::write_link(how.ipc_fd, bytes.data(), bytes.size())) {
            bytes.clear();
            std::this_thread::sleep_for(milliseconds(50));
        }
    }
    return serve(how, true);
}

int mode_close_ipc(const context& how) {
    peer::close_link(how.ipc_fd);
    say("closed ipc pid=%d", getpid());
    std::this_thread::sleep_for(std::chrono::seconds(30));
    return 0;
}

// Runs "echo" as a channel with relayed streams and checks what comes back:
// opened first, output in order and in pieces of 4096 at most, closed last.
int mode_relay(const context& how) {
    connection link(how.ipc_fd);
    greet(link);
    std::string sent(10000, 'a'), out, err;
    for (std::size_t i = 0; i < sent.size(); ++i)
        sent[i] = static_cast<char>('a' + i % 26);
    link.execute(7, execute_stdio_pipes, {how.self, "echo"});
    link.execute(8, execute_stdio_none, {how.self, "sleep", "1s"});
    link.send_stdin(7, sent.substr(0, 6000));
    link.send_stdin(7, sent.substr(6000));
    link.send_stdin(8, "nobody reads this");
    peer::packet packet;
    bool ordered = true, first = true;
    while (link.receive(packet) &&
           !(packet.header.channel == 7 && packet.header.type == packet_closed)) {
        if (packet.header.channel != 7)
            continue;
        std::uint32_t type = packet.header.type;
        ordered = ordered && (first ? type == packet_opened : packet.payload.size() <= 4096);
        first = false;
        (type == packet_stderr ? err : out) += packet.payload;
        if (type == packet_stdout && out.size() == sent.size())
            link.send_stdin(7, "tail", true);
    }
    bool ok = ordered && out == sent + "tail" && err == "child: echo eof\n" &&
              packet.header.type == packet_closed && packet.header.flags == 0;
    say("relay %s", ok ? "ok" : "broken");
    while (link.receive(packet))
        if (packet.header.type == packet_sigterm)
            return 0;
    return 4;
}

// Sends one execute per request, on channels 1, 2, ...; each request is its flags, then its items,
// and "+" separates requests. "<text" instead sends text to the last request's stdin, and "!rmcwd"
// removes the working directory. Everything between two
// "!rmcwd" goes out in one write, as a peer that pipelines sends it. Reports
// each opened, stdout and end per channel as it comes.
// Led by "once MARKER OPENS", the first time (no MARKER yet) it waits for
// OPENS opened packets instead and exits 3, leaving its channels behind;
// started again, it serves ("once-deaf": ignoring sigterm).
int mode_execute(const context& how) {
    bool once = how.args.size() > 2 && how.args[0].starts_with("once");
    if (once && !create_once(how.args[1]))
        return serve(how, how.args[0] == "once");
    connection link(how.ipc_fd);
    greet(link);
    std::vector<std::vector<std::string>> requests(1);
    for (const auto& arg : std::vector(how.args.begin() + (once ? 3 : 0), how.args.end())) {
        if (arg == "+")
            requests.emplace_back();
        else
            requests.back().push_back(arg);
    }
    std::string batch;
    auto add = [&](std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                   const std::string& payload) {
        auto block = encode_packet(channel, type, flags, payload.data(), payload.size());
        batch.append(block.begin(), block.end());
    };
    auto flush = [&] {
        if (!batch.empty())
            peer::write_link(how.ipc_fd, batch.data(), batch.size());
        batch.clear();
    };
    std::uint32_t next = 0, channel = 0, expected = 0;
    for (auto& request : requests) {
        std::error_code error;
        if (request.size() == 1 && request[0] == "!rmcwd") {
            flush();
            say("rmcwd %d", fs::remove(fs::current_path(), error) ? 0 : -1);
        } else if (request.size() == 1 && request[0].rfind('<', 0) == 0) {
            add(channel, packet_stdin, 0, request[0].substr(1));
        } else if (request.size() > 1) {
            channel = ++next;
            add(channel, packet_execute, std::stoul(request[0]),
                join_strings({request.begin() + 1, request.end()}));
            ++expected;
        }
    }
    flush();
    peer::packet packet;
    if (once) {
        for (int opened = 0; opened < how.number(2) && link.receive(packet);)
            opened += packet.header.type == packet_opened;
        say("left");
        return 3;
    }
    for (std::uint32_t ends = 0; ends < expected && link.receive(packet);) {
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
    return await_sigterm(link, true);
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
    return await_sigterm(link, true);
}

// The first time (no marker yet): leaves N orphans behind, which end together
// with us as we exit with 3; then, started again, serves.
int mode_orphans(const context& how) {
    if (how.args.size() < 2 || !create_once(how.args[1]))
        return serve(how, true);
    if (!child_host::leave_orphans(how.number(0)))
        return 1;
    say("orphans made");
    return 3;
}

struct mode {
    const char* name;
    int (*run)(const context&);
};

const mode modes[] = {
    {"exit", mode_exit},
    {"peer",
     [](const context& how) {
         return serve(how, true);
     }},
    {"ignore-sigterm",
     [](const context& how) {
         return serve(how, false);
     }},
    {"fds", mode_fds},
    {"signal", mode_signal},
    {"echo", mode_echo},
    {"record", mode_record},
    {"sleep", mode_sleep},
    {"raw", mode_raw},
    {"close-ipc", mode_close_ipc},
    {"relay", mode_relay},
    {"execute", mode_execute},
    {"flood-in", mode_flood_in},
    {"orphans", mode_orphans},
    {"args", mode_args},
    {"squat", mode_squat},
    {"console-event",
     [](const context& how) {
         return child_host::console_event(how.number(0)) ? serve(how, true) : 1;
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
    for (const auto& entry : modes)
        if (argc > 1 && std::strcmp(argv[1], entry.name) == 0)
            return entry.run(how);
    std::fprintf(stderr, "usage: test_child <mode> [args...] [ipc fd]\n");
    return 64;
}
