// Framing throughput in small packets per second, against the least any
// framer must do: walking the same buffer by its length fields.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <unistd.h>
#include <vector>

#include "ipc/framer.hpp"
#include "ipc/packet.hpp"

using namespace torvad;

namespace {

constexpr std::uint32_t packet_size = 64;
constexpr std::uint32_t packets_per_read = packet_max_size / packet_size;
// Not a type of the protocol: framed and passed over, nothing is routed.
constexpr std::uint32_t ignored_type = 9;

// A full read of small packets that nobody acts on.
std::vector<char> full_read() {
    const std::string payload(packet_size - packet_header_size, 'p');
    std::vector<char> bytes;
    for (std::uint32_t i = 0; i < packets_per_read; ++i) {
        auto packet = encode_packet(i, ignored_type, 0, payload.data(), payload.size());
        bytes.insert(bytes.end(), packet.begin(), packet.end());
    }
    return bytes;
}

// A read that ends on a packet boundary leaves the buffer as it was, so the
// bytes go in once and every iteration frames the whole of them again.
void framing(benchmark::State& state) {
    auto bytes = full_read();
    framer input;
    std::memcpy(input.free_space(), bytes.data(), bytes.size());
    std::uint32_t framed = 0;
    bool bad = false;
    for (auto _ : state) {
        input.add(
            bytes.size(), [&](const packet_header& header, const char*) { framed += header.type; },
            [&] { bad = true; });
        benchmark::DoNotOptimize(framed);
        benchmark::ClobberMemory();
    }
    if (bad || input.held() != 0)
        state.SkipWithError("a whole packet was left unframed");
    state.SetItemsProcessed(state.iterations() * packets_per_read);
}

void header_walk(benchmark::State& state) {
    auto bytes = full_read();
    const auto* data = reinterpret_cast<const unsigned char*>(bytes.data());
    for (auto _ : state) {
        std::uint32_t offset = 0, count = 0;
        while (offset < bytes.size()) {
            offset += load_u32(data + offset);
            ++count;
        }
        benchmark::DoNotOptimize(count);
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * packets_per_read);
}

BENCHMARK(framing);
BENCHMARK(header_walk);

// Keeps the rate of each run to print the ratio at the end.
class ratio_reporter : public benchmark::ConsoleReporter {
  public:
    // Colour only at a terminal, so the ratio line stays plain in a log.
    ratio_reporter() : ConsoleReporter(isatty(STDOUT_FILENO) ? OO_Defaults : OO_Tabular) {}
    void ReportRuns(const std::vector<Run>& runs) override {
        ConsoleReporter::ReportRuns(runs);
        for (const auto& run : runs) {
            auto rate = run.counters.find("items_per_second");
            if (rate != run.counters.end())
                rates[run.benchmark_name()] = rate->second;
        }
    }
    std::map<std::string, double> rates;
};

} // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    ratio_reporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();
    double framed = reporter.rates["framing"], walked = reporter.rates["header_walk"];
    if (framed <= 0 || walked <= 0) {
        std::fprintf(stderr, "a benchmark did not run\n");
        return 1;
    }
    std::printf("framing throughput ratio vs bare header walk: %.2f (%.1f M packets/s)\n",
                framed / walked, framed / 1e6);
    return 0;
}
