// The ipc pipe from the far end, with the real binary: the trace at a
// terminal, and a pipe attached by its caller.
#include <gtest/gtest.h>

#include <csignal>
#include <sys/socket.h>

#include "ipc/packet.hpp"
#include "peer/link.hpp"
#include "peer/peer.hpp"
#include "tests/e2e/harness.hpp"

using namespace e2e;

TEST(ipc, the_trace_is_coloured_at_a_terminal_and_absent_without_v) {
    run_scenario({"-v", "--", child_binary, "peer"},
                 {"?\x1b[36m-> test_child:0\x1b[35m version\x1b[0m \"" + torvad_name +
                      "\" \"1.1.21.0\" \"Background:false\" \n",
                  "!INT", "=0"});
    run_scenario({"--", child_binary, "peer"}, {"?child: ready", "!INT", "=0", "-version\x1b"});
}

// The test is the caller that made the pipe; the command behind -a is never run.
TEST(ipc, an_attached_pipe_is_served_until_the_peer_closes_it) {
    if (!holds_here(systems::linux_only))
        GTEST_SKIP() << "a Windows pipe handle can't be made here";
    int ends[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    long their_end = ends[1];
    torvad::peer::connection ours(ends[0]);
    daemon_run run(
        {"-v", "-l", "-a", "4242", std::to_string(their_end), "--", child_binary, "peer"},
        {.inherit = their_end});
    torvad::peer::close_link(static_cast<int>(their_end));
    torvad::peer::packet packet;
    ASSERT_TRUE(ours.receive(packet));
    EXPECT_EQ(packet.header.type, torvad::packet_version);
    EXPECT_EQ(packet.payload, std::string("\0"
                                          "1.1.21.0\0Background:false",
                                          26));

    // The largest packet there is, then a stdin for a channel nobody made.
    ASSERT_TRUE(ours.send(3, 9, 0, std::string(torvad::packet_max_payload, 'x')));
    ASSERT_TRUE(ours.send(7, torvad::packet_stdin, 0, "hi"));
    EXPECT_TRUE(run.wait_for("<- test_child:3 unknown \n")) << run.output();
    EXPECT_TRUE(run.wait_for("channel 0x7 does not exist"));

    // A program the peer has run doesn't hold the pipe: it can't speak on it as torvad.
    ASSERT_TRUE(ours.execute(1, torvad::execute_stdio_none,
                             {child_binary, "forge", std::to_string(their_end)}));
    do
        ASSERT_TRUE(ours.receive(packet) && packet.header.channel != 9) << run.output();
    while (packet.header.type != torvad::packet_closed);

    run.signal(SIGINT);
    ASSERT_TRUE(ours.receive(packet));
    EXPECT_EQ(packet.header.type, torvad::packet_sigterm);
    ours = torvad::peer::connection(-1);
    EXPECT_TRUE(run.wait_for("attached ipc pipe closed."));
    EXPECT_EQ(run.wait_exit(), 0) << run.output();
    EXPECT_EQ(run.output().find("child: "), std::string::npos) << run.output();
}

TEST(ipc, a_failed_attachment_without_a_command_ends_the_run) {
    run_scenario({"-a", "4242"},
                 {"?failed to attach to ipc pipe.", "?executable not specified", "=0"});
}
