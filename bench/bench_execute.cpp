// Execute round trip: a peer under torvad asks for /bin/true to be run and
// times the request until its `closed`, median over 1000; against the same
// peer running /bin/true itself with posix_spawn and waitpid, alternating
// with the requests so that both see the same load.
//   bench_execute [path of torvad]
#include <cstdio>
#include <cstring>
#include <spawn.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

#include "bench/bench_support.hpp"

using namespace bench;

extern char** environ;

namespace {

constexpr int requests = 1000;
constexpr int run_limit_s = 120;
constexpr std::uint32_t first_channel = 1 << 20;

// One round trip through torvad in microseconds, or a negative number.
double execute_through_torvad(peer_session& session, std::uint32_t channel) {
    long long start = now_ns();
    // No stdio flags: the child inherits torvad's own, as the baseline's does ours.
    if (!session.link.execute(channel, 0, {"/bin/true"}) || !wait_closed(session.reader, channel))
        return -1;
    return (now_ns() - start) / 1000.0;
}

double spawn_and_wait() {
    long long start = now_ns();
    char* argv[] = {const_cast<char*>("/bin/true"), nullptr};
    pid_t pid;
    int status = 0;
    if (posix_spawn(&pid, argv[0], nullptr, nullptr, argv, environ) != 0 ||
        waitpid(pid, &status, 0) != pid || status != 0)
        return -1;
    return (now_ns() - start) / 1000.0;
}

int run_peer(const std::string& results, int argc, char** argv) {
    auto session = start_session(argc, argv);
    if (!session)
        return 1;
    std::string samples;
    char line[64];
    for (std::uint32_t i = 0; i < requests; ++i) {
        double supervised = execute_through_torvad(*session, first_channel + i);
        double bare = spawn_and_wait();
        if (supervised < 0 || bare < 0) {
            std::fprintf(stderr, "bench_execute: request %u failed\n", i);
            return 1;
        }
        std::snprintf(line, sizeof line, "torvad %.3f\nbare %.3f\n", supervised, bare);
        samples += line;
    }
    return end_session(*session, results, samples);
}

} // namespace

int main(int argc, char** argv) {
    if (argc == 4 && std::strcmp(argv[1], "peer") == 0)
        return run_peer(argv[2], argc, argv);
    auto samples = measure_under_torvad(argc, argv, "peer", run_limit_s);
    auto &supervised = samples["torvad"], &bare = samples["bare"];
    if (supervised.size() != requests || bare.size() != requests) {
        std::fprintf(stderr, "incomplete run: %zu requests through torvad, %zu bare spawns\n",
                     supervised.size(), bare.size());
        return 1;
    }
    double ours = median(supervised), baseline = median(bare);
    std::printf("execute round trip median over %d: torvad %.0f us, posix_spawn+waitpid %.0f us, "
                "ratio %.2f\n",
                requests, ours, baseline, ours / baseline);
    return 0;
}
