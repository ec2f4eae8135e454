#include "bench/bench_support.hpp"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <poll.h>
#include <pty.h>
#include <sys/wait.h>
#include <unistd.h>

namespace bench {

using namespace torvad;

long long now_ns() {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return now.tv_sec * 1000000000LL + now.tv_nsec;
}

double median(std::vector<double> values) {
    if (values.empty())
        return 0;
    std::nth_element(values.begin(), values.begin() + values.size() / 2, values.end());
    return values[values.size() / 2];
}

std::string self_path() {
    std::error_code error;
    return std::filesystem::read_symlink("/proc/self/exe", error).string();
}

scratch_directory::scratch_directory(const char* name) {
    std::string pattern = std::string("/tmp/") + name + "-XXXXXX";
    if (mkdtemp(pattern.data()) != nullptr)
        path_ = pattern;
}

scratch_directory::~scratch_directory() {
    std::error_code ignored;
    if (made())
        std::filesystem::remove_all(path_, ignored);
}

namespace {

constexpr std::size_t console_tail_size = 4096;

// Reads torvad's console until it ends (EIO once torvad and its children are
// gone), sending SIGTERM once the results are in. False past the deadline.
bool drive_console(int terminal, pid_t torvad_pid, const std::string& results, int limit_s,
                   std::string& tail) {
    const long long deadline = now_ns() + limit_s * 1000000000LL;
    bool stop_sent = false;
    char buffer[4096];
    while (now_ns() < deadline) {
        if (!stop_sent && access(results.c_str(), F_OK) == 0)
            stop_sent = kill(torvad_pid, SIGTERM) == 0;
        pollfd output{terminal, POLLIN, 0};
        if (poll(&output, 1, 100) != 1)
            continue;
        ssize_t got = read(terminal, buffer, sizeof buffer);
        if (got <= 0)
            return true;
        tail.append(buffer, static_cast<std::size_t>(got));
        if (tail.size() > console_tail_size)
            tail.erase(0, tail.size() - console_tail_size);
    }
    return false;
}

} // namespace

bool run_under_torvad(const char* torvad, const char* mode, const std::string& results,
                      int limit_s) {
    std::string self = self_path();
    int terminal = -1;
    pid_t pid = forkpty(&terminal, nullptr, nullptr, nullptr);
    if (pid == -1)
        return false;
    if (pid == 0) {
        // -o: a peer that fails ends the run instead of being started again.
        execl(torvad, torvad, "-o", "--", self.c_str(), mode, results.c_str(), nullptr);
        _exit(127);
    }
    std::string tail;
    bool ended = drive_console(terminal, pid, results, limit_s, tail);
    // torvad leads a session of its own: its group holds all it started.
    if (!ended)
        kill(-pid, SIGKILL);
    int status = 0;
    waitpid(pid, &status, 0);
    close(terminal);
    bool clean = ended && WIFEXITED(status) && WEXITSTATUS(status) == 0;
    if (!ended)
        std::fprintf(stderr, "torvad did not end within %d s and was killed\n", limit_s);
    else if (!clean)
        std::fprintf(stderr, "torvad ended with status 0x%x\n", status);
    if (!clean || access(results.c_str(), F_OK) != 0)
        std::fprintf(stderr, "torvad's console, last lines:\n%s\n", tail.c_str());
    return clean;
}

samples read_results(const std::string& path) {
    std::map<std::string, std::vector<double>> values;
    std::ifstream file(path);
    std::string key;
    double value;
    while (file >> key >> value)
        values[key].push_back(value);
    return values;
}

bool packet_reader::next(packet_view& out) {
    for (;;) {
        std::size_t held = end_ - begin_;
        if (held >= packet_header_size) {
            out.header = read_packet_header(buffer_.data() + begin_);
            if (!valid_packet_length(out.header.length))
                return false;
            if (held >= out.header.length) {
                out.payload = buffer_.data() + begin_ + packet_header_size;
                begin_ += out.header.length;
                stopped = out.header.type == packet_sigterm && out.header.channel == 0;
                return !stopped;
            }
        }
        if (!fill())
            return false;
    }
}

bool packet_reader::fill() {
    // Room for a whole packet behind the unread tail, moved once to the front.
    if (buffer_.size() - end_ < packet_max_size) {
        std::memmove(buffer_.data(), buffer_.data() + begin_, end_ - begin_);
        end_ -= begin_;
        begin_ = 0;
    }
    for (;;) {
        ssize_t got = read(fd_, buffer_.data() + end_, buffer_.size() - end_);
        if (got > 0) {
            end_ += static_cast<std::size_t>(got);
            return true;
        }
        if (got == -1 && errno == EINTR)
            continue;
        return false;
    }
}

std::unique_ptr<peer_session> start_session(int argc, char** argv) {
    int fd = peer::ipc_fd_from_arguments(argc, argv);
    if (fd < 0 || fcntl(fd, F_SETFD, FD_CLOEXEC) == -1)
        return nullptr;
    auto session = std::make_unique<peer_session>(fd);
    packet_view first;
    if (!session->reader.next(first) || first.header.type != packet_version)
        return nullptr;
    return session;
}

int end_session(peer_session& session, const std::string& results, const std::string& text) {
    std::string part = results + ".part";
    {
        std::ofstream file(part);
        file << text;
        if (!file.flush())
            return 1;
    }
    if (std::rename(part.c_str(), results.c_str()) != 0)
        return 1;
    packet_view ignored;
    while (session.reader.next(ignored)) {
    }
    // Status 0 only for an orderly stop: anything else fails the run.
    return session.reader.stopped ? 0 : 1;
}

bool wait_closed(packet_reader& reader, std::uint32_t channel) {
    packet_view packet;
    while (reader.next(packet)) {
        if (packet.header.channel != channel)
            continue;
        if (packet.header.type == packet_failed)
            return false;
        if (packet.header.type == packet_closed)
            return packet.header.flags == 0;
    }
    return false;
}

int run_writer() {
    static char block[1 << 20];
    std::memset(block, 'w', sizeof block);
    for (std::uint64_t left = relay_bytes; left != 0;) {
        ssize_t put = write(STDOUT_FILENO, block, std::min<std::uint64_t>(left, sizeof block));
        if (put == -1 && errno == EINTR)
            continue;
        if (put <= 0)
            return 1;
        left -= static_cast<std::uint64_t>(put);
    }
    return 0;
}

relay_result consume_relay(packet_reader& reader, std::uint32_t channel) {
    relay_result result;
    packet_view packet;
    while (reader.next(packet)) {
        if (packet.header.channel != channel)
            continue;
        if (packet.header.type == packet_opened)
            result.opened_ns = now_ns();
        else if (packet.header.type == packet_stdout)
            result.bytes += packet.payload_size();
        else if (packet.header.type == packet_failed)
            break;
        else if (packet.header.type == packet_closed) {
            result.closed_ns = now_ns();
            result.closed_clean = packet.header.flags == 0;
            break;
        }
    }
    return result;
}

relay_result relay_through_torvad(peer_session& session, std::uint32_t channel) {
    if (!session.link.execute(channel, execute_stdio_pipes, {self_path(), "writer"}))
        return {};
    return consume_relay(session.reader, channel);
}

long status_kib(pid_t pid, const char* field) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string name = std::string(field) + ":", word;
    long kib = -1;
    while (status >> word)
        if (word == name && status >> kib)
            break;
    return kib;
}

samples measure_under_torvad(int argc, char** argv, const char* mode, int limit_s) {
    const char* torvad = argc > 1 ? argv[1] : "./build/torvad";
    scratch_directory scratch("bench");
    if (!scratch.made() || access(torvad, X_OK) != 0) {
        std::fprintf(stderr, "usage: %s [path of torvad]\n", argv[0]);
        return {};
    }
    std::string results = scratch.file(mode);
    if (!run_under_torvad(torvad, mode, results, limit_s))
        return {};
    return read_results(results);
}

} // namespace bench
