// torvad's resident memory: idle with one child, the cost of each open piped
// channel with 100 and with 1000 of them open, and the peak while a 512 MiB
// relay is read as it comes. The peer reads torvad's /proc status itself (its
// parent), so that each figure is taken exactly when the state is reached.
// Two runs: the channels, then the relay, whose peak must not count them.
//   bench_memory [path of torvad]
#include <algorithm>
#include <cstdio>
#include <cstring>
#include <string>
#include <sys/resource.h>
#include <unistd.h>

#include "bench/bench_support.hpp"

using namespace bench;
using namespace torvad;

namespace {

constexpr std::uint32_t channel_counts[] = {100, 1000};
constexpr std::uint32_t first_channel = 1 << 20;
constexpr int run_limit_s = 300;
// Each piped channel holds some seven descriptors in torvad: pipe ends and a pidfd.
constexpr rlim_t descriptors_wanted = 16384;

using figures = samples;

// Opens channels [from, to), each a cat on pipes that runs until its stdin
// closes; true once all are open.
bool open_channels(peer_session& session, std::uint32_t from, std::uint32_t to) {
    for (std::uint32_t i = from; i < to; ++i)
        if (!session.link.execute(first_channel + i, execute_stdio_pipes, {"/bin/cat"}))
            return false;
    packet_view packet;
    for (std::uint32_t opened = from; opened < to;) {
        if (!session.reader.next(packet) || packet.header.type == packet_failed ||
            packet.header.type == packet_closed)
            return false;
        opened += packet.header.type == packet_opened;
    }
    return true;
}

bool close_channels(peer_session& session, std::uint32_t count) {
    for (std::uint32_t i = 0; i < count; ++i)
        if (!session.link.send_stdin(first_channel + i, {}, true))
            return false;
    packet_view packet;
    for (std::uint32_t closed = 0; closed < count;) {
        if (!session.reader.next(packet) || packet.header.type == packet_failed ||
            (packet.header.type == packet_closed && packet.header.flags != 0))
            return false;
        closed += packet.header.type == packet_closed;
    }
    return true;
}

std::string line(const char* key, long kib) {
    return std::string(key) + " " + std::to_string(kib) + "\n";
}

int run_channels_peer(const std::string& results, int argc, char** argv) {
    auto session = start_session(argc, argv);
    if (!session)
        return 1;
    std::string figures = line("idle", status_kib(getppid(), "VmRSS"));
    std::uint32_t open = 0;
    for (std::uint32_t count : channel_counts) {
        if (!open_channels(*session, open, count)) {
            std::fprintf(stderr, "bench_memory: opening %u channels failed\n", count);
            return 1;
        }
        open = count;
        figures +=
            line(("channels" + std::to_string(count)).c_str(), status_kib(getppid(), "VmRSS"));
    }
    if (!close_channels(*session, open)) {
        std::fprintf(stderr, "bench_memory: closing the channels failed\n");
        return 1;
    }
    return end_session(*session, results, figures);
}

int run_relay_peer(const std::string& results, int argc, char** argv) {
    auto session = start_session(argc, argv);
    if (!session)
        return 1;
    std::string figures = line("idle", status_kib(getppid(), "VmRSS"));
    if (!relay_through_torvad(*session, first_channel).complete()) {
        std::fprintf(stderr, "bench_memory: the relay was incomplete\n");
        return 1;
    }
    figures += line("peak", status_kib(getppid(), "VmHWM"));
    return end_session(*session, results, figures);
}

// torvad inherits the limit: 1000 channels need more descriptors than many defaults.
void raise_descriptor_limit() {
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= descriptors_wanted)
        return;
    limit.rlim_cur = std::min(descriptors_wanted, limit.rlim_max);
    setrlimit(RLIMIT_NOFILE, &limit);
}

void row(const std::string& label, double kib, int decimals, const std::string& note) {
    std::printf("  %-38s %8.*f%s\n", label.c_str(), decimals, kib, note.c_str());
}

void print_table(figures& channels, figures& relay) {
    double idle = channels["idle"][0];
    std::printf("torvad memory, KiB\n");
    row("idle, one child (VmRSS)", idle, 0, "");
    for (std::uint32_t count : channel_counts) {
        double rss = channels["channels" + std::to_string(count)][0];
        row("per piped channel, " + std::to_string(count) + " open", (rss - idle) / count, 1,
            "  (VmRSS " + std::to_string(long(rss)) + ")");
    }
    double peak = relay["peak"][0], before = relay["idle"][0];
    row("peak during a " + std::to_string(relay_mib) + " MiB relay (VmHWM)", peak, 0,
        "  (+" + std::to_string(long(peak - before)) + " over that run's idle)");
}

// Every figure there, once, and read: a missing /proc field reads as -1.
bool complete(const figures& read, std::size_t expected) {
    if (read.size() != expected)
        return false;
    for (const auto& [key, values] : read)
        if (values.size() != 1 || values[0] <= 0)
            return false;
    return true;
}

} // namespace

int main(int argc, char** argv) {
    if (argc == 2 && std::strcmp(argv[1], "writer") == 0)
        return run_writer();
    if (argc == 4 && std::strcmp(argv[1], "channels-peer") == 0)
        return run_channels_peer(argv[2], argc, argv);
    if (argc == 4 && std::strcmp(argv[1], "relay-peer") == 0)
        return run_relay_peer(argv[2], argc, argv);
    raise_descriptor_limit();
    figures channels = measure_under_torvad(argc, argv, "channels-peer", run_limit_s);
    figures relay = measure_under_torvad(argc, argv, "relay-peer", run_limit_s);
    if (!complete(channels, 1 + std::size(channel_counts)) || !complete(relay, 2)) {
        std::fprintf(stderr, "incomplete run: %zu channel figures, %zu relay figures\n",
                     channels.size(), relay.size());
        return 1;
    }
    print_table(channels, relay);
    return 0;
}
