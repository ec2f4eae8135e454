// Children from launch to exit: version first, restarts, stops, launch
// failures, account switch and descriptor hygiene, with the real binary.
#include <gtest/gtest.h>

#include <csignal>
#include <unistd.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

std::vector<std::string> child(std::vector<std::string> mode) {
    mode.insert(mode.begin(), {"--", child_binary});
    return mode;
}

std::vector<std::string> with(std::vector<std::string> options, std::vector<std::string> mode) {
    auto args = child(std::move(mode));
    args.insert(args.begin(), options.begin(), options.end());
    return args;
}

} // namespace

TEST(children, a_persistent_child_gets_version_first_and_ends_on_sigint) {
    daemon_run run(child({"peer"}));
    ASSERT_TRUE(run.wait_for("child: version torvad")) << run.output();
    run.signal(SIGINT);
    EXPECT_TRUE(run.wait_for("stopping torvad version 1.1.21.0..."));
    EXPECT_TRUE(run.wait_for("child: sigterm"));
    EXPECT_TRUE(run.wait_for("'test_child' exited with 0x0."));
    EXPECT_EQ(run.wait_exit(), 0) << run.output();
    EXPECT_EQ(run.output().find("child: version torvad 1.1.21.0 Background:false"),
              run.output().find("child: version"));
}

// How a child's end decides what comes next.
TEST(children, exit_codes_decide_restart_and_the_end_of_the_run) {
    struct row {
        std::vector<std::string> args;
        std::vector<std::string> expected; // in this order
        bool restarted;
    };
    const row rows[] = {
        {child({"exit", "0"}), {"'test_child' exited with 0x0."}, false},
        {with({"-o"}, {"exit", "3"}), {"'test_child' exited with 0x3."}, false},
        {child({"no_such_mode"}), {"'test_child' exited with 0x40."}, true},
        {child({"signal", "9"}), {"'test_child' exited with 0x89."}, true},
        {{"--", "no_such_program_xyz"},
         {"executable 'no_such_program_xyz' not found.", "failed to start torvad version"},
         false},
        {{"--", "/no/such/dir/prog"},
         {"failed to create child process.", "failed to start torvad version"},
         false},
    };
    for (const auto& r : rows) {
        daemon_run run(r.args);
        for (const auto& line : r.expected)
            EXPECT_TRUE(run.wait_for(line)) << line << "\n" << run.output();
        if (r.restarted) {
            EXPECT_TRUE(run.wait_for("starting 'test_child' again."));
            EXPECT_TRUE(run.wait_for("starting 'test_child' again."));
            run.signal(SIGINT);
        }
        EXPECT_EQ(run.wait_exit(), 0) << run.output();
        if (!r.restarted) {
            EXPECT_EQ(run.output().find("again"), std::string::npos) << run.output();
        }
    }
}

TEST(children, a_restart_storm_ends_clean_and_leaves_no_zombie) {
    scratch_dir dir;
    daemon_run run(child({"fail-once", dir.path + "/failed"}));
    EXPECT_TRUE(run.wait_for("'test_child' exited with 0x3."));
    EXPECT_TRUE(run.wait_for("starting 'test_child' again."));
    ASSERT_TRUE(run.wait_for("child: ready")) << run.output();
    EXPECT_EQ(zombie_children(run.pid()), 0);
    run.signal(SIGTERM);
    EXPECT_TRUE(run.wait_for("'test_child' exited with 0x0."));
    EXPECT_EQ(run.wait_exit(), 0) << run.output();
}

// A child that ignores sigterm keeps the run alive; nothing escalates.
TEST(children, a_child_that_ignores_sigterm_keeps_the_supervisor_running) {
    daemon_run run(child({"ignore-sigterm"}));
    std::string child_pid = run.wait_value("pid");
    ASSERT_FALSE(child_pid.empty()) << run.output();
    for (int round = 0; round < 2; ++round) {
        run.signal(SIGINT);
        EXPECT_TRUE(run.wait_for("stopping torvad version 1.1.21.0..."));
        EXPECT_TRUE(run.wait_for("child: sigterm ignored")) << run.output();
    }
    kill(std::stoi(child_pid), SIGKILL);
    EXPECT_TRUE(run.wait_for("'test_child' exited with 0x89."));
    EXPECT_EQ(run.wait_exit(), 0) << run.output();
    EXPECT_EQ(run.output().find("again"), std::string::npos) << run.output();
}

// The peer closing its end is no reason to die, not even when we write to it.
TEST(children, a_peer_that_closes_its_end_never_kills_the_supervisor) {
    daemon_run run(child({"close-ipc"}));
    std::string child_pid = run.wait_value("child: closed ipc pid");
    ASSERT_FALSE(child_pid.empty()) << run.output();
    run.signal(SIGINT);
    EXPECT_TRUE(run.wait_for("stopping torvad version 1.1.21.0..."));
    kill(std::stoi(child_pid), SIGTERM);
    EXPECT_TRUE(run.wait_for("'test_child' exited with 0x8f.")) << run.output();
    EXPECT_EQ(run.wait_exit(), 0) << run.output();
}

TEST(children, a_child_holds_only_its_own_descriptors_and_default_signals) {
    daemon_run run(with({"-v"}, {"fds"}));
    std::string last = run.wait_value("last");
    ASSERT_FALSE(last.empty()) << run.output();
    EXPECT_TRUE(run.wait_for("child: fds 0 1 2 " + last + "\n")) << run.output();
    EXPECT_TRUE(run.wait_for("child: sigmask empty")) << run.output();
    EXPECT_TRUE(run.wait_for("child: ignored \n")) << run.output();
    run.signal(SIGINT);
    EXPECT_EQ(run.wait_exit(), 0) << run.output();
}

TEST(children, the_account_switch_is_made_before_exec_or_refused) {
    if (geteuid() != 0)
        GTEST_SKIP() << "changing account needs root";
    daemon_run run(with({"-u", "nobody"}, {"fds"}));
    EXPECT_TRUE(run.wait_for("child: uid=65534 gid=65534 groups=65534")) << run.output();
    run.signal(SIGINT);
    EXPECT_EQ(run.wait_exit(), 0);

    for (std::string user : {"no_such_user_xyz", "OTHERDOMAIN\\nobody"}) {
        daemon_run refused(with({"-u", user}, {"fds"}));
        EXPECT_TRUE(refused.wait_for("Failed to logon as user '" + user + "': error 2"))
            << refused.output();
        EXPECT_EQ(refused.wait_exit(), 0);
        EXPECT_EQ(refused.output().find("child:"), std::string::npos);
    }
}

// A channel outlives its requester; at the stop it has no living parent, so
// it is ended by force and that end counts as 0. Channels hold no fd of ours.
TEST(children, an_orphaned_channel_is_ended_by_force_at_the_stop) {
    scratch_dir dir;
    daemon_run run(child({"spawn-once", dir.path + "/spawned"}));
    ASSERT_FALSE(run.wait_value("spawned pid").empty()) << run.output();
    EXPECT_TRUE(run.wait_for("starting 'test_child' again."));
    std::string requester = run.wait_value("ready pid");
    ASSERT_FALSE(requester.empty()) << run.output();
    // The requester ignores sigterm, so the run lasts until the orphan's end is seen.
    run.signal(SIGINT);
    EXPECT_TRUE(run.wait_for("'sleep' exited with 0x0.")) << run.output();
    kill(std::stoi(requester), SIGKILL);
    EXPECT_EQ(run.wait_exit(), 0) << run.output();
    EXPECT_NE(run.output().find("child: fds 0 1 2\n"), std::string::npos) << run.output();
}
