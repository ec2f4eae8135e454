// Relay throughput: 512 MiB that a writer child puts on its stdout, read by a
// peer under torvad as stdout packets, from `opened` to `closed`; against the
// least a relay does with the same writer: an epoll loop that reads its pipe
// 4096 bytes at a time and writes each read as a packet to a socket pair, and
// a reader thread that walks the packets as the peer does. The peer runs both,
// in alternating rounds, and the medians are compared.
//   bench_relay [path of torvad]
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <spawn.h>
#include <string>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

#include "bench/bench_support.hpp"

using namespace bench;
using namespace torvad;

extern char** environ;

namespace {

constexpr int rounds = 3;
constexpr int run_limit_s = 300;
constexpr std::uint32_t bare_channel = 1;
constexpr std::uint32_t first_channel = 1 << 20;

bool write_all(int fd, const char* data, std::size_t size) {
    while (size != 0) {
        ssize_t put = write(fd, data, size);
        if (put == -1 && errno == EINTR)
            continue;
        if (put <= 0)
            return false;
        data += put;
        size -= static_cast<std::size_t>(put);
    }
    return true;
}

bool send_packet(int fd, std::uint32_t type, std::uint32_t flags) {
    auto packet = encode_packet(bare_channel, type, flags, nullptr, 0);
    return write_all(fd, packet.data(), packet.size());
}

// The writer on a pipe of our own, its read end non-blocking; 0 on failure.
pid_t spawn_writer(int& read_end) {
    int out[2];
    if (pipe2(out, O_CLOEXEC) == -1)
        return 0;
    std::string self = self_path();
    char* argv[] = {self.data(), const_cast<char*>("writer"), nullptr};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, out[1], STDOUT_FILENO);
    pid_t pid = 0;
    if (posix_spawn(&pid, argv[0], &actions, nullptr, argv, environ) != 0)
        pid = 0;
    posix_spawn_file_actions_destroy(&actions);
    close(out[1]);
    read_end = out[0];
    fcntl(read_end, F_SETFL, O_NONBLOCK);
    return pid;
}

// Frames each 4096-byte read of the pipe onto link until the pipe would
// block: 1 at its end-of-file, 0 to wait for more, -1 on an error.
int drain_pipe(int pipe_fd, int link) {
    char packet[packet_header_size + 4096];
    for (;;) {
        ssize_t got = read(pipe_fd, packet + packet_header_size, 4096);
        if (got == 0)
            return 1;
        if (got == -1 && errno == EINTR)
            continue;
        if (got == -1)
            return errno == EAGAIN ? 0 : -1;
        auto size = static_cast<std::uint32_t>(got);
        write_packet_header(packet, {packet_header_size + size, bare_channel, packet_stdout, 0});
        if (!write_all(link, packet, packet_header_size + size))
            return -1;
    }
}

bool relay_pipe(int pipe_fd, int link) {
    int poller = epoll_create1(EPOLL_CLOEXEC);
    epoll_event interest{EPOLLIN, {}};
    int state = poller != -1 && epoll_ctl(poller, EPOLL_CTL_ADD, pipe_fd, &interest) == 0 ? 0 : -1;
    while (state == 0) {
        epoll_event ready;
        state = epoll_wait(poller, &ready, 1, -1) == -1 && errno != EINTR
                    ? -1
                    : drain_pipe(pipe_fd, link);
    }
    if (poller != -1)
        close(poller);
    return state == 1;
}

// The same writer through the bare relay, read by a thread of ours.
relay_result bare_relay() {
    int link[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, link) == -1)
        return {};
    relay_result result;
    std::thread reader([&] {
        packet_reader packets(link[1]);
        result = consume_relay(packets, bare_channel);
    });
    int pipe_fd = -1;
    pid_t writer = spawn_writer(pipe_fd);
    int status = -1;
    if (writer != 0 && send_packet(link[0], packet_opened, static_cast<std::uint32_t>(writer)) &&
        relay_pipe(pipe_fd, link[0]) && waitpid(writer, &status, 0) == writer)
        send_packet(link[0], packet_closed, WIFEXITED(status) ? WEXITSTATUS(status) : 128);
    // Closing our end ends the reader, also when the relay broke off.
    close(link[0]);
    reader.join();
    close(link[1]);
    if (pipe_fd != -1)
        close(pipe_fd);
    return result;
}

int run_peer(const std::string& results, int argc, char** argv) {
    auto session = start_session(argc, argv);
    if (!session)
        return 1;
    std::string rates;
    char line[64];
    for (std::uint32_t round = 0; round < rounds; ++round) {
        relay_result supervised = relay_through_torvad(*session, first_channel + round);
        relay_result bare = bare_relay();
        if (!supervised.complete() || !bare.complete()) {
            std::fprintf(stderr, "bench_relay: round %u incomplete: %llu and %llu bytes\n", round,
                         static_cast<unsigned long long>(supervised.bytes),
                         static_cast<unsigned long long>(bare.bytes));
            return 1;
        }
        std::snprintf(line, sizeof line, "torvad %.1f\nbare %.1f\n", supervised.mib_per_s(),
                      bare.mib_per_s());
        rates += line;
    }
    return end_session(*session, results, rates);
}

} // namespace

int main(int argc, char** argv) {
    if (argc == 2 && std::strcmp(argv[1], "writer") == 0)
        return run_writer();
    if (argc == 4 && std::strcmp(argv[1], "peer") == 0)
        return run_peer(argv[2], argc, argv);
    auto rates = measure_under_torvad(argc, argv, "peer", run_limit_s);
    auto &supervised = rates["torvad"], &bare = rates["bare"];
    if (supervised.size() != rounds || bare.size() != rounds) {
        std::fprintf(stderr, "incomplete run: %zu rounds through torvad, %zu bare\n",
                     supervised.size(), bare.size());
        return 1;
    }
    double ours = median(supervised), baseline = median(bare);
    std::printf("relay of %u MiB, median of %d rounds: torvad %.0f MiB/s, bare epoll relay "
                "%.0f MiB/s, ratio %.2f\n",
                relay_mib, rounds, ours, baseline, ours / baseline);
    return 0;
}
