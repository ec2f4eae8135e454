// The ipc pipe from the far end: framing of bytes split and joined across
// reads, bad lengths, stdin routing errors, the trace, and an attached pipe.
#include <gtest/gtest.h>

#include <csignal>

#include "ipc/packet.hpp"
#include "peer/link.hpp"
#include "peer/peer.hpp"
#include "tests/e2e/harness.hpp"
#include "tests/packet_hex.hpp"

using namespace e2e;

// The test child writes packets given as hex; "/" splits them into writes.
TEST(ipc, packets_split_and_joined_across_reads_are_framed_in_order) {
    const std::string stdin5 = hex_packet(5, torvad::packet_stdin, 0, "abc");
    const std::string stdin6 = hex_packet(6, torvad::packet_stdin, 1, "x");
    const std::string bad = hex_packet(7, torvad::packet_stdin, 0, "", 15);
    const std::pair<std::string, std::vector<std::string>> rows[] = {
        {stdin5 + stdin6,
         {"?<- test_child:5 stdin abc", "?channel 0x5 does not exist",
          "?<- test_child:6 stdin x flags=0x1", "?channel 0x6 does not exist"}},
        {stdin5.substr(0, 10) + "/" + stdin5.substr(10, 24) + "/" + stdin5.substr(34),
         {"?channel 0x5 does not exist"}},
        // a bad length drops every byte held, whole packets behind it too
        {bad + stdin5 + "/" + stdin6,
         {"?bad ipc packet length", "?channel 0x6 does not exist", "-0x5", "-0x7"}},
        {hex_packet(0x500003, 9, 4, "zz") + hex_packet(1, torvad::packet_sigterm, 0, ""),
         {"?<- test_child:psfile:3 unknown \n", "?<- test_child:1 sigterm \n"}},
    };
    for (auto [hex, steps] : rows) {
        steps.insert(steps.end(), {"!INT", "?-> test_child:0 sigterm \n", "=0"});
        run_scenario({"-v", "-l", "--", child_binary, "raw", hex}, steps);
    }
}

TEST(ipc, the_trace_is_coloured_at_a_terminal_and_absent_without_v) {
    run_scenario({"-v", "--", child_binary, "peer"},
                 {"?\x1b[36m-> test_child:0\x1b[35m version\x1b[0m \"torvad\" \"1.1.21.0\" "
                  "\"Background:false\" \n",
                  "!INT", "=0"});
    run_scenario({"--", child_binary, "peer"}, {"?child: ready", "!INT", "=0", "-version\x1b"});
}

// The test is the caller that made the pipe; the command behind -a is never run.
TEST(ipc, an_attached_pipe_is_served_until_the_peer_closes_it) {
    int our_end = -1;
    long their_end = -1;
    ASSERT_TRUE(make_link_pair(our_end, their_end));
    torvad::peer::connection ours(our_end);
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
    std::string forged = hex_packet(9, torvad::packet_stdout, 0, "forged");
    ASSERT_TRUE(ours.execute(1, torvad::execute_stdio_none,
                             {child_binary, "raw", forged, std::to_string(their_end)}));
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
