// Framing throughput in small packets per second, against the least any
// framer must do: walking the same buffer by its length fields.
#include <benchmark/benchmark.h>

#include <cstring>
#include <sys/socket.h>

#include "daemon/daemon.hpp"
#include "ipc/packet.hpp"
#include "process/process.hpp"

using namespace torvad;

namespace {

constexpr std::uint32_t packet_size = 64;
constexpr std::uint32_t packets_per_read = 65536 / packet_size;

// A full read of small packets of a type nobody acts on.
std::vector<char> full_read() {
    std::vector<char> bytes;
    for (std::uint32_t i = 0; i < packets_per_read; ++i) {
        auto packet = frame_packet(i, 9, 0, std::string(packet_size - 16, 'p').data(),
                                   packet_size - packet_header_size);
        bytes.insert(bytes.end(), packet.begin(), packet.end());
    }
    return bytes;
}

process& attached_object() {
    static process* object = [] {
        int fds[2];
        socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds);
        auto created = process::create(&the_daemon, {"bench"}, "", ".", {}, true, stdio_inherit);
        created->attach(1, fds[0]);
        return created.get();
    }();
    return *object;
}

void framing(benchmark::State& state) {
    auto bytes = full_read();
    process& object = attached_object();
    for (auto _ : state) {
        std::memcpy(object.ipc_buffer, bytes.data(), bytes.size());
        object.ipc_fill = 0;
        object.frame_ipc(static_cast<std::uint32_t>(bytes.size()));
        benchmark::DoNotOptimize(object.ipc_fill);
    }
    state.SetItemsProcessed(state.iterations() * packets_per_read);
}

void header_walk(benchmark::State& state) {
    auto bytes = full_read();
    std::vector<char> target(bytes.size());
    for (auto _ : state) {
        std::memcpy(target.data(), bytes.data(), bytes.size());
        std::uint32_t offset = 0, count = 0;
        while (offset < target.size()) {
            offset += read_packet_header(target.data() + offset).length;
            ++count;
        }
        benchmark::DoNotOptimize(count);
    }
    state.SetItemsProcessed(state.iterations() * packets_per_read);
}

BENCHMARK(framing);
BENCHMARK(header_walk);

// Keeps the rate of each run to print the ratio at the end.
class ratio_reporter : public benchmark::ConsoleReporter {
  public:
    void ReportRuns(const std::vector<Run>& runs) override {
        ConsoleReporter::ReportRuns(runs);
        for (const auto& run : runs)
            rates[run.benchmark_name()] = run.counters.at("items_per_second");
    }
    std::map<std::string, double> rates;
};

} // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    ratio_reporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    std::printf("framing throughput ratio vs bare header walk: %.2f (%.1f M packets/s)\n",
                reporter.rates["framing"] / reporter.rates["header_walk"],
                reporter.rates["framing"] / 1e6);
    benchmark::Shutdown();
    return 0;
}
