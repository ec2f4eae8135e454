// The program's start and end as an operator sees them: help, PID file,
// working directory, console and service paths.
#include <gtest/gtest.h>

#include <csignal>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {
const char* const started = "successfully started torvad version 1.1.21.0";
}

// A console run with no child starts and ends at once, whatever the options;
// outside a service manager the service path ends without a word or a child.
TEST(start, a_run_without_child_ends_at_once_with_0) {
    scratch_dir dir;
    const std::string pid = dir.path + "/pid", ok = std::string("?") + started;
    const char* const no_pid_file = "-failed to create pid file";
    run_rows({
        {{}, {ok, "=0", no_pid_file}},
        {{"-d"}, {ok, "=0", no_pid_file}},
        {{"-a", "garbage", "-d", "/no/such/dir", "stray", "-zz", "-"}, {ok, "=0", no_pid_file}},
        {{"-p", dir.path + "/missing/pid"}, {ok, "=0", "+failed to create pid file"}},
        {{"-f", "family", "-u", "nobody", "--"}, {ok, "=0", no_pid_file}},
        {{"-a", "4242"}, {"?failed to attach to ipc pipe.", "?executable not specified", "=0"}},
        {{"-p", "relative.pid", "-d", dir.path}, {ok, "=0", no_pid_file}, {.directory = dir.path}},
        // help, on stderr, and nothing else: no PID file either
        {{"-p", pid, "-v", "-h", "-p"},
         {"?torvad version 1.1.21.0\nUsage: " + torvad_binary + " <options> -- <exe> <exe args>\n",
          "?  -a  <pid> <pipe>\n", "=0", "-successfully"},
         {.terminal = false}},
        {{"--", child_binary, "exit", "0"}, {"=0", "-torvad", "-child"}, {.terminal = false}},
        {{"-v", "-l", "--", child_binary, "exit", "0"},
         {"=0", "-torvad", "-child"},
         {.terminal = false}},
        {{"-b", "--", child_binary, "exit", "0"}, {"=0", "-torvad", "-child"}},
    });
    EXPECT_FALSE(file_exists(pid) || file_exists(dir.path + "/relative.pid"));
}

// A relative PID file name is taken in the starting directory, and the run
// removes that file, whatever -d says.
TEST(start, pid_file_holds_the_pid_while_running_and_goes_at_the_end) {
    scratch_dir dir, elsewhere;
    daemon_run run({"-p", "torvad.pid", "-d", elsewhere.path, "--", child_binary, "peer"},
                   {.directory = dir.path});
    ASSERT_TRUE(run.wait_for("child: ready")) << run.output();
    // Under Wine the pid is Windows', which we don't see.
    std::string pid = under_wine ? read_file(dir.path + "/torvad.pid") : std::to_string(run.pid());
    EXPECT_EQ(read_file(dir.path + "/torvad.pid"), std::to_string(std::atoi(pid.c_str())) + "\n");
    run.signal(SIGTERM);
    EXPECT_EQ(run.wait_exit(), 0);
    EXPECT_FALSE(file_exists(dir.path + "/torvad.pid"));
    EXPECT_FALSE(file_exists(elsewhere.path + "/torvad.pid"));
}
