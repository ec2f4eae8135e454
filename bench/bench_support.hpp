// What the benchmarks that run the real torvad share. The bench binary runs
// twice: as itself, it starts torvad at a pseudo-terminal with its own path in
// a peer mode as the supervised child; as that peer, it measures through the
// ipc link, writes its samples to a results file and waits for `sigterm`.
// Once the results file is there, the bench stops torvad as a console user
// would, with SIGTERM, and reads the samples back.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <sys/types.h>
#include <vector>

#include "ipc/packet.hpp"
#include "peer/peer.hpp"

namespace bench {

long long now_ns();
double median(std::vector<double> values);
// The absolute path of the running binary, for torvad to start it again.
std::string self_path();

// A fresh directory under /tmp that goes, with all in it, with the object.
class scratch_directory {
  public:
    explicit scratch_directory(const char* name);
    ~scratch_directory();
    scratch_directory(const scratch_directory&) = delete;
    scratch_directory& operator=(const scratch_directory&) = delete;
    std::string file(const char* name) const { return path_ + "/" + name; }
    bool made() const { return !path_.empty(); }

  private:
    std::string path_;
};

// Runs `torvad -o -- <self> <mode> <results>` at a pseudo-terminal, so that
// it takes the console path, and stops it once results exists. A run past
// limit_s is a hang: torvad and everything it started are killed. True when
// torvad ended by itself with status 0; torvad's console is shown otherwise.
bool run_under_torvad(const char* torvad, const char* mode, const std::string& results,
                      int limit_s);

// "key value" lines of a results file, the values of each key in file order.
using samples = std::map<std::string, std::vector<double>>;
samples read_results(const std::string& path);

// Runs mode under the torvad named by argv[1] (else ./build/torvad) and reads
// its results back; empty when the run failed, which has been reported.
samples measure_under_torvad(int argc, char** argv, const char* mode, int limit_s);

struct packet_view {
    torvad::packet_header header;
    const char* payload = nullptr;
    std::uint32_t payload_size() const { return header.length - torvad::packet_header_size; }
};

// Reads a packet stream in large chunks and hands out each packet in place,
// so that counting a relay costs no copy per packet. A `sigterm` on channel
// 0 is not handed out: it ends the stream and sets stopped.
class packet_reader {
  public:
    explicit packet_reader(int fd) : fd_(fd), buffer_(256 * 1024) {}
    // The next whole packet, valid until the next call; false at the end of
    // the stream, on a bad length or at a stop request.
    bool next(packet_view& out);
    bool stopped = false;

  private:
    bool fill();
    int fd_;
    std::vector<char> buffer_;
    std::size_t begin_ = 0, end_ = 0;
};

// The peer side of a run: the link torvad passed as the last argument.
struct peer_session {
    explicit peer_session(int fd) : link(fd), reader(fd) {}
    torvad::peer::connection link;
    packet_reader reader;
};

// Takes the link from the arguments and reads torvad's version; null when
// this was not started by torvad. The link is kept from the peer's own children.
std::unique_ptr<peer_session> start_session(int argc, char** argv);
// Publishes the results at once (a partial file is never seen), then waits
// for the stop request: the status the peer ends with.
int end_session(peer_session& session, const std::string& results, const std::string& text);

// Waits for one channel to end: true when it closed with status 0.
bool wait_closed(packet_reader& reader, std::uint32_t channel);

// The bytes of one relay: a writer child writes them to its stdout in large writes.
constexpr unsigned relay_mib = 512;
constexpr std::uint64_t relay_bytes = std::uint64_t{relay_mib} << 20;
int run_writer();

struct relay_result {
    std::uint64_t bytes = 0;
    long long opened_ns = 0, closed_ns = 0;
    bool closed_clean = false;
    bool complete() const { return closed_clean && bytes == relay_bytes; }
    double mib_per_s() const { return (bytes >> 20) * 1e9 / double(closed_ns - opened_ns); }
};

// Reads a writer's channel from `opened` to `closed`, counting its stdout.
relay_result consume_relay(packet_reader& reader, std::uint32_t channel);
// Has torvad run this binary as a writer on channel and reads it as it comes.
relay_result relay_through_torvad(peer_session& session, std::uint32_t channel);

// A "Vm...:" field of /proc/<pid>/status in KiB, -1 when it can't be read.
long status_kib(pid_t pid, const char* field);

} // namespace bench
