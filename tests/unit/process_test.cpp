// A process alone, with a fake owner: a peer on the other end of a socket pair
// asks for channels, and the test reads what comes back in the loop's turns.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <sys/socket.h>
#include <unistd.h>

#include "ipc/strings.hpp"
#include "process/process.hpp"

namespace torvad {
namespace {

struct fake_owner final : process_owner {
    boost::asio::io_context context;
    run_facts run;
    pattern_lists everything;
    std::vector<std::shared_ptr<process>> children;
    std::vector<std::uint32_t> ended; // each end's status, as the owner is told it
    bool restart_killed = false;      // makes a successor for a child killed by a signal

    boost::asio::io_context& loop() override { return context; }
    void adopt(std::shared_ptr<process> child) override { children.push_back(std::move(child)); }
    void remove(const std::shared_ptr<process>& child) override { std::erase(children, child); }
    void child_ended(const process& child, std::uint32_t status) override {
        ended.push_back(status);
        if (restart_killed && status > 128)
            process::create(*this, child.request(), child.place())->start();
    }
    const pattern_lists& patterns() const override { return everything; }
    const run_facts& facts() const override { return run; }
    void write_log(platform::event_type, const char*) override {}

    // As the daemon's shutdown: nothing outlives the loop.
    ~fake_owner() {
        for (const auto& child : children)
            child->close_all();
        context.restart();
        context.run();
        children.clear();
    }
};

struct packet {
    std::uint32_t channel, type, flags;
    std::string payload;
};

// The peer's end: a requester process serves the other one.
class peer_pipe {
  public:
    explicit peer_pipe(fake_owner& owner) {
        int ends[2];
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends), 0);
        fd_ = ends[0];
        requester = process::create(owner, {{"peer"}, "", ".", true, stdio_inherit});
        requester->attach(1, ends[1]);
        owner_ = &owner;
    }
    ~peer_pipe() { close(fd_); }

    void send(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
              const std::string& payload) {
        auto bytes = encode_packet(channel, type, flags, payload.data(), payload.size());
        ASSERT_EQ(write(fd_, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    }
    void execute(std::uint32_t channel, std::uint32_t flags, const std::string& shell_line) {
        send(channel, packet_execute, flags, join_strings({"/bin/sh", "-c", shell_line}));
    }
    // Runs the loop until count packets of type on channel have come
    // (bounded), keeping every packet but the version.
    bool read_until(std::uint32_t channel, std::uint32_t type, long count = 1) {
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
        while (std::chrono::steady_clock::now() < deadline) {
            owner_->context.run_for(std::chrono::milliseconds(5));
            char chunk[65536];
            ssize_t got;
            while ((got = read(fd_, chunk, sizeof chunk)) > 0)
                buffer_.append(chunk, static_cast<std::size_t>(got));
            while (buffer_.size() >= packet_header_size) {
                packet_header header = read_packet_header(buffer_.data());
                if (buffer_.size() < header.length)
                    break;
                std::string payload(buffer_, packet_header_size,
                                    header.length - packet_header_size);
                buffer_.erase(0, header.length);
                if (header.type != packet_version)
                    packets.push_back({header.channel, header.type, header.flags, payload});
            }
            if (std::count_if(packets.begin(), packets.end(), [&](const packet& p) {
                    return p.channel == channel && p.type == type;
                }) >= count)
                return true;
        }
        return false;
    }
    // What came on channel: its output as text, the rest by type name.
    std::string story(std::uint32_t channel) const {
        std::string text;
        for (const auto& p : packets)
            if (p.channel == channel)
                text += p.type <= packet_stderr ? p.payload
                                                : std::string("<") + packet_type_name(p.type) + ">";
        return text;
    }

    std::shared_ptr<process> requester;
    std::vector<packet> packets;

  private:
    fake_owner* owner_;
    int fd_;
    std::string buffer_;
};

std::string opened_closed(const std::string& between) {
    return "<opened>" + between + "<closed>";
}

// Pipelined requests end in the order asked, output ahead of the end, and an
// id is free again at once.
TEST(process, a_channel_ends_after_its_output_and_frees_its_id_at_once) {
    fake_owner owner;
    peer_pipe peer(owner);
    peer.send(1, packet_execute, 0, join_strings({"/no/such/program"}));
    peer.execute(2, execute_stdio_pipes, "printf out; printf err >&2; exit 3");
    ASSERT_TRUE(peer.read_until(2, packet_closed));
    ASSERT_GE(peer.packets.size(), 2u);
    EXPECT_EQ(peer.packets[0].type, packet_failed);
    EXPECT_EQ(peer.packets[1].type, packet_opened);
    EXPECT_EQ(peer.story(2), opened_closed("outerr"));
    EXPECT_EQ(peer.packets.back().flags, 3u); // closed carries the exit status
    peer.execute(1, execute_stdio_pipes, "printf again");
    ASSERT_TRUE(peer.read_until(1, packet_closed));
    EXPECT_EQ(peer.story(1), "<failed>" + opened_closed("again"));
}

// A requester that doesn't read holds its channel's output back: the child
// blocks on its full pipe instead of torvad holding megabytes, and once the
// peer reads again every byte arrives, in order, before closed.
TEST(process, output_waits_for_a_requester_that_does_not_read) {
    fake_owner owner;
    peer_pipe peer(owner);
    const std::size_t size = 4 << 20;
    peer.execute(1, execute_stdio_pipes,
                 "head -c " + std::to_string(size) + " /dev/zero | tr '\\0' x");
    owner.context.run_for(std::chrono::milliseconds(500));
    EXPECT_TRUE(owner.ended.empty()) << "the whole output was taken while nobody read it";
    ASSERT_TRUE(peer.read_until(1, packet_closed));
    EXPECT_EQ(peer.story(1), opened_closed(std::string(size, 'x')));
}

// What the owner hears of each end (the exit status, 128 + a signal), and a
// successor it makes takes its predecessor's place on the requester's pipe.
TEST(process, the_owner_hears_each_end_and_restarts_in_place) {
    fake_owner owner;
    owner.restart_killed = true;
    peer_pipe peer(owner);
    std::string marker = testing::TempDir() + "/killed-once";
    unlink(marker.c_str());
    peer.execute(1, 0, "exit 5");
    peer.execute(2, 0, "test -e " + marker + " && exit 0; touch " + marker + "; kill -9 $$");
    ASSERT_TRUE(peer.read_until(2, packet_closed, 2));
    ASSERT_TRUE(peer.read_until(1, packet_closed));
    std::sort(owner.ended.begin(), owner.ended.end());
    EXPECT_EQ(owner.ended, (std::vector<std::uint32_t>{0, 5, 137}));
    // The successor opens before its predecessor's closed goes out.
    EXPECT_EQ(peer.story(2), "<opened><opened><closed><closed>");
    unlink(marker.c_str());
}

// A child the terminal stopped (it read the terminal from its background
// group) can't take its sigterm: a stop continues it, and names the stop.
TEST(process, a_stop_continues_a_child_the_terminal_stopped) {
    fake_owner owner;
    peer_pipe peer(owner);
    peer.execute(1, execute_persistent, "kill -TTIN $$; exit 7");
    ASSERT_TRUE(peer.read_until(1, packet_opened));
    std::string stat = "/proc/" + std::to_string(peer.packets.back().flags) + "/stat";
    auto stopped = [&] {
        std::ifstream file(stat);
        std::string pid, name, state;
        return file >> pid >> name >> state && state == "T";
    };
    for (int tries = 0; tries < 2000 && !stopped(); ++tries)
        owner.context.run_for(std::chrono::milliseconds(5));
    ASSERT_TRUE(stopped());
    auto child = owner.children.back();
    child->terminate();
    EXPECT_NE(child->description().find("stopped by the terminal"), std::string::npos);
    ASSERT_TRUE(peer.read_until(1, packet_closed));
    EXPECT_EQ(owner.ended, std::vector<std::uint32_t>{7});
}

} // namespace
} // namespace torvad
