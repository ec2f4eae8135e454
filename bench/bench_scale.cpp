// Cost per channel as the number of channels grows: a peer under torvad opens
// N channels of `/bin/sleep 3` at once and waits for every `closed`. torvad's
// CPU time over that round, per channel, and its resident memory with the N
// open, per channel, at 100, 1000 and as many as the descriptor limit allows
// (10,000 without pipes, 4,000 with, where it allows that much), each as a
// ratio to the 100-channel row. A cost that grows with the number of children
// shows as a ratio above 1. One torvad for each stdio mode, so that the memory
// of the one doesn't count in the other.
//   bench_scale [path of torvad]
#include <algorithm>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <sys/resource.h>
#include <unistd.h>

#include "bench/bench_support.hpp"

using namespace bench;
using namespace torvad;

namespace {

constexpr int run_limit_s = 600;
constexpr std::uint32_t first_channel = 1 << 20;
constexpr std::uint32_t base_count = 100;

// The CPU figure of a row is the median of its rounds, an odd number: the
// machine's other work shows most in the short rounds of the small rows.
struct row_plan {
    std::uint32_t count;
    int rounds;
};

struct mode_plan {
    const char* name;
    const char* peer;
    std::uint32_t flags;
    std::uint32_t largest;
    // What torvad holds per open channel: its pidfd, and with pipes our three ends.
    rlim_t descriptors_per_channel;
};

const mode_plan modes[] = {
    {"stdio_none", "none-peer", execute_stdio_none, 10000, 1},
    {"stdio_pipes", "pipes-peer", execute_stdio_pipes, 4000, 4},
};
// torvad's own descriptors, a launch's passing ones and the peer's.
constexpr rlim_t descriptor_slack = 64;

// The largest count the descriptor limit we run under allows, at most the mode's.
std::uint32_t largest_count(const mode_plan& mode) {
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur <= descriptor_slack)
        return base_count;
    rlim_t fits = (limit.rlim_cur - descriptor_slack) / mode.descriptors_per_channel;
    return static_cast<std::uint32_t>(std::clamp<rlim_t>(fits, base_count, mode.largest));
}

std::vector<row_plan> rows_of(const mode_plan& mode) {
    std::vector<row_plan> rows{{base_count, 7}, {1000, 5}};
    std::uint32_t largest = largest_count(mode);
    if (largest > 1000)
        rows.push_back({largest, 3});
    return rows;
}

// torvad's CPU time so far, in nanoseconds, over all its threads; -1 when unknown.
long long cpu_ns(pid_t pid) {
    std::string tasks = "/proc/" + std::to_string(pid) + "/task/";
    long long total = 0;
    bool any = false;
    std::error_code error;
    for (const auto& task : std::filesystem::directory_iterator(tasks, error)) {
        std::ifstream schedstat(task.path() / "schedstat");
        long long ran = 0;
        if (schedstat >> ran) {
            total += ran;
            any = true;
        }
    }
    return any ? total : -1;
}

struct round_result {
    bool ok = false;
    double cpu_us_per_channel = 0;
    double rss_kib_per_channel = 0;
    std::uint32_t most_open = 0; // channels open at once when the last one opened
};

// Opens count channels at once and waits for all to close cleanly.
round_result run_round(peer_session& session, const mode_plan& mode, std::uint32_t count,
                       std::uint32_t& next_channel, long idle_kib, const char* seconds) {
    round_result result;
    pid_t torvad = getppid();
    long long cpu_before = cpu_ns(torvad);
    std::uint32_t first = next_channel;
    next_channel += count;
    for (std::uint32_t i = 0; i < count; ++i)
        if (!session.link.execute(first + i, mode.flags, {"/bin/sleep", seconds}))
            return result;
    long rss_kib = -1;
    packet_view packet;
    for (std::uint32_t opened = 0, closed = 0; closed < count;) {
        if (!session.reader.next(packet) || packet.header.type == packet_failed ||
            (packet.header.type == packet_closed && packet.header.flags != 0))
            return result;
        opened += packet.header.type == packet_opened;
        closed += packet.header.type == packet_closed;
        if (packet.header.type == packet_opened && opened == count) {
            rss_kib = status_kib(torvad, "VmRSS");
            result.most_open = opened - closed;
        }
    }
    long long cpu_after = cpu_ns(torvad);
    result.ok = cpu_before >= 0 && cpu_after >= 0 && rss_kib > 0;
    result.cpu_us_per_channel = (cpu_after - cpu_before) / 1000.0 / count;
    result.rss_kib_per_channel = double(rss_kib - idle_kib) / std::max(result.most_open, 1u);
    return result;
}

int run_peer(const mode_plan& mode, const std::string& results, int argc, char** argv) {
    auto session = start_session(argc, argv);
    if (!session)
        return 1;
    std::uint32_t next_channel = first_channel;
    // One launch and one end first, so that the idle figure already holds the
    // code and stack they touch the first time.
    long idle_kib = 0;
    if (!run_round(*session, mode, 1, next_channel, 0, "0").ok)
        return 1;
    idle_kib = status_kib(getppid(), "VmRSS");
    std::string text;
    for (const row_plan& row : rows_of(mode)) {
        std::string count = std::to_string(row.count);
        for (int round = 0; round < row.rounds; ++round) {
            round_result result = run_round(*session, mode, row.count, next_channel, idle_kib, "3");
            if (!result.ok) {
                std::fprintf(stderr, "bench_scale: a round of %u %s channels failed\n", row.count,
                             mode.name);
                return 1;
            }
            text += "cpu" + count + " " + std::to_string(result.cpu_us_per_channel) + "\n";
            // Freed memory stays with the allocator: only a row's first round,
            // the largest yet, shows what its channels hold.
            if (round == 0) {
                text += "rss" + count + " " + std::to_string(result.rss_kib_per_channel) + "\n";
                text += "open" + count + " " + std::to_string(result.most_open) + "\n";
            }
        }
    }
    return end_session(*session, results, text);
}

// torvad inherits the limit; as high as the hard limit lets it, and said when
// that is below what the largest rows need.
void raise_descriptor_limit() {
    rlim_t wanted = 0;
    for (const mode_plan& mode : modes)
        wanted = std::max(wanted, mode.largest * mode.descriptors_per_channel + descriptor_slack);
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0)
        return;
    if (limit.rlim_cur < wanted) {
        limit.rlim_cur = std::min(wanted, limit.rlim_max);
        if (setrlimit(RLIMIT_NOFILE, &limit) != 0)
            getrlimit(RLIMIT_NOFILE, &limit);
    }
    if (limit.rlim_cur < wanted)
        std::printf("descriptor limit %llu, below the %llu wanted: the largest rows are smaller\n",
                    static_cast<unsigned long long>(limit.rlim_cur),
                    static_cast<unsigned long long>(wanted));
}

void print_mode(const mode_plan& mode, samples& figures) {
    std::printf("%-11s %8s %12s %6s %14s %6s\n", mode.name, "channels", "CPU us/ch", "ratio",
                "RSS KiB/ch", "ratio");
    double base_cpu = median(figures["cpu" + std::to_string(base_count)]);
    double base_rss = figures["rss" + std::to_string(base_count)][0];
    for (const row_plan& row : rows_of(mode)) {
        std::string count = std::to_string(row.count);
        double cpu = median(figures["cpu" + count]), rss = figures["rss" + count][0];
        auto open = static_cast<std::uint32_t>(figures["open" + count][0]);
        std::printf("%-11s %8u %12.1f %6.2f %14.2f %6.2f", "", row.count, cpu, cpu / base_cpu, rss,
                    rss / base_rss);
        if (open < row.count)
            std::printf("  (at most %u open at once)", open);
        std::printf("\n");
    }
}

bool complete(samples& figures, const mode_plan& mode) {
    for (const row_plan& row : rows_of(mode)) {
        std::string count = std::to_string(row.count);
        if (figures["cpu" + count].size() != static_cast<std::size_t>(row.rounds) ||
            figures["rss" + count].size() != 1 || figures["open" + count].size() != 1)
            return false;
    }
    return true;
}

} // namespace

int main(int argc, char** argv) {
    for (const mode_plan& mode : modes)
        if (argc == 4 && std::strcmp(argv[1], mode.peer) == 0)
            return run_peer(mode, argv[2], argc, argv);
    raise_descriptor_limit();
    std::printf("torvad per channel, one peer opening N channels of /bin/sleep 3 at once\n");
    for (const mode_plan& mode : modes) {
        samples figures = measure_under_torvad(argc, argv, mode.peer, run_limit_s);
        if (!complete(figures, mode)) {
            std::fprintf(stderr, "incomplete run of %s\n", mode.name);
            return 1;
        }
        print_mode(mode, figures);
    }
    return 0;
}
