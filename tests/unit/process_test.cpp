// A process alone, with a fake owner: a peer on the other end of a socket pair
// asks for channels, and the test reads what comes back in the loop's turns.
#include <gtest/gtest.h>

#include <csignal>
#include <fstream>
#include <functional>
#include <linux/sockios.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include "ipc/patterns.hpp"
#include "ipc/strings.hpp"
#include "matcher/bounded_regex.hpp"
#include "process/process.hpp"

namespace torvad {
namespace {

// length, when given, replaces the true length field: a lie for the framer.
std::string packet_bytes(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                         const std::string& payload, std::uint32_t length = 0) {
    auto bytes = encode_packet(channel, type, flags, payload.data(), payload.size());
    if (length != 0)
        store_u32(reinterpret_cast<unsigned char*>(bytes.data()), length);
    return {bytes.begin(), bytes.end()};
}

// The owner, and the peer's end of the pipe that a requester process serves.
struct rig final : process_owner {
    boost::asio::io_context context;
    run_facts run;
    pattern_lists everything;
    std::vector<std::shared_ptr<process>> children;
    std::vector<std::uint32_t> ended; // each end's status, as the owner is told it
    std::vector<std::string> log;
    bool restart_killed = false; // makes a successor for a child killed by a signal
    std::shared_ptr<process> requester;
    std::vector<std::pair<packet_header, std::string>> packets; // all that came but the version
    std::string unframed;
    int fd;

    // send_buffer, when given, bounds what torvad's end of the socket holds.
    explicit rig(bool verbose = false, int send_buffer = 0) {
        run.verbose = verbose;
        signal(SIGPIPE, SIG_IGN); // as torvad's start does: a child that ended closed its end
        int ends[2];
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends), 0);
        if (send_buffer != 0)
            setsockopt(ends[1], SOL_SOCKET, SO_SNDBUF, &send_buffer, sizeof send_buffer);
        fd = ends[0];
        requester = process::create(*this, {{"peer"}, "", ".", true, stdio_inherit});
        requester->attach(1, ends[1]);
        log.clear();
    }
    // As the daemon's shutdown: nothing outlives the loop.
    ~rig() {
        for (const auto& child : children)
            child->close_all();
        context.restart();
        context.run();
        children.clear();
        close(fd);
    }
    boost::asio::io_context& loop() override { return context; }
    void adopt(std::shared_ptr<process> child) override { children.push_back(std::move(child)); }
    void remove(const std::shared_ptr<process>& child) override { std::erase(children, child); }
    void child_ended(const process& child, std::uint32_t status) override {
        ended.push_back(status);
        if (restart_killed && status > 128)
            process::create(*this, child.what, child.place)->start();
    }
    const pattern_lists& patterns() const override { return everything; }
    const run_facts& facts() const override { return run; }
    void write_log(platform::event_type, const char* text) override { log.emplace_back(text); }

    void send(const std::string& bytes) {
        ASSERT_EQ(write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    }
    void execute(std::uint32_t channel, std::uint32_t flags, const std::string& shell_line) {
        send(packet_bytes(channel, packet_execute, flags,
                          join_strings({"/bin/sh", "-c", shell_line})));
    }
    // Runs the loop until torvad has read every byte written so far (bounded).
    void let_read() {
        for (int turns = 0, unread = 1; turns < 2000 && ioctl(fd, SIOCOUTQ, &unread) == 0 && unread;
             ++turns)
            context.run_for(std::chrono::milliseconds(1));
    }
    // Runs the loop until count packets of type came on channel, or done() (bounded).
    bool read_until(std::uint32_t channel, std::uint32_t type, long count = 1) {
        return read_until([&] {
            return std::count_if(packets.begin(), packets.end(), [&](const auto& p) {
                       return p.first.channel == channel && p.first.type == type;
                   }) >= count;
        });
    }
    bool read_until(const std::function<bool()>& done) {
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
        while (!done() && std::chrono::steady_clock::now() < deadline) {
            context.run_for(std::chrono::milliseconds(5));
            char chunk[65536];
            for (ssize_t got; (got = read(fd, chunk, sizeof chunk)) > 0;)
                unframed.append(chunk, static_cast<std::size_t>(got));
            for (packet_header h;
                 unframed.size() >= packet_header_size &&
                 unframed.size() >= (h = read_packet_header(unframed.data())).length;
                 unframed.erase(0, h.length))
                if (h.type != packet_version)
                    packets.emplace_back(
                        h, unframed.substr(packet_header_size, h.length - packet_header_size));
        }
        return done();
    }
    // What came on channel: output as text, the rest as <type:flags>.
    std::string story(std::uint32_t channel) const {
        std::string text;
        for (const auto& [h, payload] : packets)
            if (h.channel == channel)
                text += h.type <= packet_stderr   ? payload
                        : h.type == packet_opened ? "<opened>"
                                                  : std::string("<") + packet_type_name(h.type) +
                                                        ":" + std::to_string(h.flags) + ">";
        return text;
    }
};

std::string opened_closed(const std::string& between, int status = 0) {
    return "<opened>" + between + "<closed:" + std::to_string(status) + ">";
}

// Pipelined requests end in the order asked, output ahead of the end, and an
// id is free again at once. The largest request, that no line decides within
// the bound, is refused, and the log says why.
TEST(process, a_channel_ends_after_its_output_and_frees_its_id_at_once) {
    rig peer;
    std::vector<skipped_line> skipped;
    peer.everything =
        parse_patterns("/bin/sh\\0.*\n/no/such/program\n/bin/echo\\0x(y|y)*\\1z\n", skipped);
    peer.send(packet_bytes(1, packet_execute, 0, join_strings({"/no/such/program"})));
    // a failed request leaves no channel behind
    peer.send(packet_bytes(1, packet_stdin, 0, "lost"));
    peer.execute(2, execute_stdio_pipes, "printf out; printf err >&2; exit 3");
    ASSERT_TRUE(peer.read_until(2, packet_closed));
    EXPECT_EQ(peer.packets.at(0).first.type, packet_failed);
    EXPECT_EQ(peer.packets.at(1).first.type, packet_opened);
    EXPECT_EQ(peer.story(2), opened_closed("outerr", 3));
    peer.execute(1, execute_stdio_pipes, "printf again");
    ASSERT_TRUE(peer.read_until(1, packet_closed));
    EXPECT_EQ(peer.story(1), "<failed:2>" + opened_closed("again"));
    std::string largest = join_strings({"/bin/echo", "x" + std::string(65520 - 11, 'y')});
    peer.send(packet_bytes(3, packet_execute, 0, largest));
    ASSERT_TRUE(peer.read_until(3, packet_failed));
    EXPECT_EQ(peer.story(3), "<failed:13>");
    EXPECT_EQ(peer.log, (std::vector<std::string>{
                            "failed to create child process.", "channel 0x1 does not exist",
                            "a pattern could not be matched within " +
                                std::to_string(regex_time_bound_ms) + " ms; refused",
                            "permission to execute denied"}));
}

// A requester that doesn't read holds its channel's output back in the child's
// full pipe, not in torvad; a child that ended meanwhile still has its output
// sent. Once the peer reads, every byte arrives, in order, before closed.
TEST(process, output_waits_for_a_requester_that_does_not_read) {
    for (auto [size, ends_unread] : {std::pair{std::size_t(1) << 20, false}, {300u << 10, true}}) {
        rig peer(false, 4096);
        peer.execute(1, execute_stdio_pipes,
                     "head -c " + std::to_string(size) + " /dev/zero | tr '\\0' x");
        peer.context.run_for(std::chrono::milliseconds(500));
        EXPECT_EQ(peer.ended.size(), ends_unread ? 1u : 0u) << size;
        ASSERT_TRUE(peer.read_until(1, packet_closed));
        EXPECT_TRUE(peer.story(1) == opened_closed(std::string(size, 'x'))) << size;
    }
}

// What the owner hears of each end (the exit status, 128 + a signal), and a
// successor it makes takes its predecessor's place on the requester's pipe.
TEST(process, the_owner_hears_each_end_and_restarts_in_place) {
    rig peer;
    peer.restart_killed = true;
    std::string marker = testing::TempDir() + "/killed-once";
    unlink(marker.c_str());
    peer.execute(1, 0, "exit 5");
    peer.execute(2, 0, "test -e " + marker + " && exit 0; touch " + marker + "; kill -9 $$");
    ASSERT_TRUE(peer.read_until(2, packet_closed, 2));
    ASSERT_TRUE(peer.read_until(1, packet_closed));
    std::sort(peer.ended.begin(), peer.ended.end());
    EXPECT_EQ(peer.ended, (std::vector<std::uint32_t>{0, 5, 137}));
    // The successor opens before its predecessor's closed goes out.
    EXPECT_EQ(peer.story(2), "<opened><opened><closed:137><closed:0>");
    unlink(marker.c_str());
}

// A child the terminal stopped (it read from its background group) can't take
// its sigterm: a stop continues it, and names the stop.
TEST(process, a_stop_continues_a_child_the_terminal_stopped) {
    rig peer;
    peer.execute(1, execute_persistent, "kill -TTIN $$; exit 7");
    ASSERT_TRUE(peer.read_until(1, packet_opened));
    std::string stat = "/proc/" + std::to_string(peer.packets.back().first.flags) + "/stat";
    ASSERT_TRUE(peer.read_until([&] {
        std::string pid, name, state;
        return std::ifstream(stat) >> pid >> name >> state && state == "T";
    }));
    peer.children.back()->terminate();
    EXPECT_NE(peer.children.back()->description().find("stopped by the terminal"),
              std::string::npos);
    ASSERT_TRUE(peer.read_until(1, packet_closed));
    EXPECT_EQ(peer.ended, std::vector<std::uint32_t>{7});
}

// A channel's standard streams travel over its requester's pipe, in order and
// in packets of one relayed read at most; stdin only reaches a channel with
// pipes, and its close flag holds even when the queue had drained.
TEST(process, a_channel_relays_its_standard_streams_in_order) {
    rig peer;
    std::string sent(10000, 'a');
    for (std::size_t i = 0; i < sent.size(); ++i)
        sent[i] = static_cast<char>('a' + i % 26);
    peer.execute(7, execute_stdio_pipes, "cat; echo eof >&2");
    peer.execute(8, execute_stdio_none, "sleep 1");
    peer.send(packet_bytes(7, packet_stdin, 0, sent.substr(0, 6000)));
    peer.send(packet_bytes(7, packet_stdin, 0, sent.substr(6000)));
    peer.send(packet_bytes(8, packet_stdin, 0, "nobody reads this"));
    ASSERT_TRUE(peer.read_until([&] { return peer.story(7) == "<opened>" + sent; }));
    peer.send(packet_bytes(7, packet_stdin, stdin_close, "tail"));
    ASSERT_TRUE(peer.read_until(7, packet_closed));
    EXPECT_EQ(peer.story(7), opened_closed(sent + "tail" + "eof\n"));
    for (const auto& [h, payload] : peer.packets) {
        EXPECT_LE(payload.size(), 4096u);
        EXPECT_EQ(h.type == packet_stderr, payload == "eof\n");
    }
    EXPECT_EQ(peer.log, std::vector<std::string>{"channel 0x8 standard input is not available"});
}

// Packets split across reads (each piece one read) or joined in one are framed
// in order, and traced under -v; a length that can't be trusted drops every
// byte held, whole packets too.
TEST(process, packets_are_framed_across_reads_and_traced) {
    const std::string stdin5 = packet_bytes(5, packet_stdin, 0, "abc"),
                      stdin6 = packet_bytes(6, packet_stdin, stdin_close, "x");
    const std::pair<std::vector<std::string>, std::vector<std::string>> rows[] = {
        {{stdin5 + stdin6},
         {"<- peer:5 stdin abc", "channel 0x5 does not exist", "<- peer:6 stdin x flags=0x1",
          "channel 0x6 does not exist"}},
        {{stdin5.substr(0, 5), stdin5.substr(5, 12), stdin5.substr(17)},
         {"<- peer:5 stdin abc", "channel 0x5 does not exist"}},
        {{packet_bytes(7, packet_stdin, 0, "", 15) + stdin5, stdin6},
         {"bad ipc packet length", "<- peer:6 stdin x flags=0x1", "channel 0x6 does not exist"}},
        {{packet_bytes(0x500003, 10, 4, "zz") + packet_bytes(1, packet_sigterm, 0, "")},
         {"<- peer:psfile:3 unknown ", "<- peer:1 sigterm "}},
    };
    for (auto [pieces, lines] : rows) {
        rig peer(true);
        for (const auto& piece : pieces) {
            peer.send(piece);
            peer.let_read();
        }
        peer.requester->terminate();
        lines.push_back("-> peer:0 sigterm ");
        EXPECT_EQ(peer.log, lines);
    }
}

// A requester's end closes its channels' pipes, as the daemon's order has it:
// a channel that writes after that dies of the closed pipe.
TEST(process, a_requester_that_ends_closes_its_channels_pipes) {
    rig peer;
    peer.execute(1, execute_stdio_pipes, "sleep 0.3; echo late");
    ASSERT_TRUE(peer.read_until(1, packet_opened));
    close(std::exchange(peer.fd, -1));
    ASSERT_TRUE(peer.read_until([&] { return !peer.ended.empty(); }));
    EXPECT_EQ(peer.ended, std::vector<std::uint32_t>{platform::signal_status(SIGPIPE)});
    EXPECT_EQ(peer.log, std::vector<std::string>{"attached ipc pipe closed."});
}

// The edges of a child's life no end-to-end run reaches on this system: an
// end or a stop while the output drains, a stop while it launches.
TEST(process, a_life_moves_by_its_table) {
    using enum life_event;
    using step = std::pair<life_event, std::uint32_t>;
    const std::tuple<std::vector<step>, life_state, life_action, std::uint32_t> rows[] = {
        {{{launched, 0}, {exited, 5}, {output, 1}, {stop, 0}, {drained, 0}},
         life_state::ended,
         life_action::close_end,
         5},
        {{{launched, 0}, {exited, 3}, {shut_down, 0}},
         life_state::shut_down,
         life_action::close_handles,
         0},
        {{{stop, 0}}, life_state::launching, life_action::none, 0},
        {{{stop, 0}, {launched, 0}}, life_state::running, life_action::watch, 0},
        {{{attached, 0}, {pipe_closed, 0}, {exited, 4}}, life_state::ended, life_action::none, 4},
        {{{launch_failed, 2}}, life_state::ended, life_action::fail, 2},
    };
    for (const auto& [steps, state, action, value] : rows) {
        child_life life;
        child_life::taken last{};
        for (auto [event, event_value] : steps)
            last = life.take(event, event_value);
        EXPECT_EQ(life.state(), state) << steps.size();
        EXPECT_EQ(std::pair(last.action, last.value), std::pair(action, value)) << steps.size();
    }
}

// An end counts as its status, or 128 + its signal unless we ended it; a status
// that can't be read is a clean end, no restart.
TEST(process, an_end_counts_as_its_status_or_its_signal) {
    const platform::os_error unreadable{10, "waitid"};
    const std::tuple<platform::exit_status, bool, std::uint32_t> rows[] = {
        {{true, true, 3, {}}, false, 3},          {{true, false, 9, {}}, false, 137},
        {{true, false, 9, {}}, true, 0},          {{true, true, 3, unreadable}, false, 0},
        {{true, false, 9, unreadable}, false, 0},
    };
    for (const auto& [exit, forced, code] : rows)
        EXPECT_EQ(exit_code_of(exit, forced), code) << exit.code << " " << forced;
}

} // namespace
} // namespace torvad
