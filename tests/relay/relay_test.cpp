// The relay of a channel's standard streams over its requester's ipc pipe,
// in-process: a requester attached to a socketpair, a channel made as an
// execute request would make it, the loop on its own thread, the test as peer.
#include <gtest/gtest.h>

#include <sys/socket.h>
#include <thread>

#include "daemon/daemon.hpp"
#include "ipc/packet.hpp"
#include "peer/peer.hpp"
#include "process/process.hpp"

using namespace torvad;

namespace {

const char* const child_binary = TEST_CHILD_BINARY;
constexpr std::uint32_t relayed = 0x300002;

class relay : public ::testing::Test {
  protected:
    void SetUp() override {
        int fds[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
        peer = std::make_unique<peer::connection>(fds[0]);
        requester = process::create(&the_daemon, {"requester"}, "", ".", {}, true, stdio_inherit);
        requester->attach(1, fds[1]);
        ASSERT_TRUE(peer->receive(packet));
        ASSERT_EQ(packet.header.type, packet_version);
    }

    // Makes the channel and runs the loop; the test speaks from here on.
    void open_channel(std::vector<std::string> command, std::int32_t mode) {
        auto channel = process::create(&the_daemon, std::move(command), "", "",
                                       {requester, relayed}, false, mode);
        ASSERT_TRUE(channel->start());
        requester->channels[relayed] = channel;
        requester.reset();
        loop = std::thread([] {
            the_daemon.restart();
            the_daemon.run();
        });
        ASSERT_TRUE(peer->receive(packet));
        EXPECT_EQ(packet.header.type, packet_opened);
    }

    // Collects the channel's stdout until want bytes came; false on any other packet.
    bool read_stdout(std::size_t want, std::string& out) {
        while (out.size() < want) {
            if (!peer->receive(packet) || packet.header.type != packet_stdout ||
                packet.header.channel != relayed || packet.payload.size() > 4096)
                return false;
            out += packet.payload;
        }
        return true;
    }

    void TearDown() override {
        // Our end closing finishes the attached requester, which ends the run.
        peer.reset();
        if (loop.joinable())
            loop.join();
    }

    std::unique_ptr<peer::connection> peer;
    std::shared_ptr<process> requester;
    peer::packet packet;
    std::thread loop;
};

} // namespace

TEST_F(relay, stdin_reaches_the_child_and_its_output_comes_back_in_order) {
    open_channel({child_binary, "echo"}, stdio_pipes);
    std::string big(10000, 'a');
    for (std::size_t i = 0; i < big.size(); ++i)
        big[i] = static_cast<char>('a' + i % 26);
    // Joined in one write and split over several packets on the way back.
    ASSERT_TRUE(peer->send_stdin(relayed, big.substr(0, 6000), false));
    ASSERT_TRUE(peer->send_stdin(relayed, big.substr(6000), false));
    std::string echoed;
    ASSERT_TRUE(read_stdout(big.size(), echoed));
    EXPECT_EQ(echoed, big);
    // Close with a last payload: the bytes go first, then end of input.
    ASSERT_TRUE(peer->send_stdin(relayed, "tail", true));
    echoed.clear();
    ASSERT_TRUE(read_stdout(4, echoed));
    EXPECT_EQ(echoed, "tail");
    std::string err;
    while (peer->receive(packet) && packet.header.type == packet_stderr)
        err += packet.payload;
    EXPECT_EQ(err, "child: echo eof\n");
    EXPECT_EQ(packet.header.type, packet_closed);
    EXPECT_EQ(packet.header.channel, relayed);
    EXPECT_EQ(packet.header.flags, 0u);
}

TEST_F(relay, a_channel_without_pipes_refuses_stdin_and_reports_its_end) {
    open_channel({child_binary, "exit", "5"}, stdio_none);
    ASSERT_TRUE(peer->send_stdin(relayed, "lost", true));
    ASSERT_TRUE(peer->receive(packet));
    EXPECT_EQ(packet.header.type, packet_closed);
    EXPECT_EQ(packet.header.flags, 5u);
}
