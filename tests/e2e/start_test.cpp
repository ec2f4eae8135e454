// The program's start and end as an operator sees them: help, PID file,
// working directory, console and service paths, event log records.
#include <gtest/gtest.h>

#include <csignal>
#include <fstream>
#include <sys/socket.h>
#include <unistd.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {
const char* const started = "successfully started torvad version 1.1.21.0";
}

TEST(start, help_goes_to_stderr_and_nothing_else_happens) {
    scratch_dir dir;
    std::string pid_file = dir.path + "/pid";
    daemon_run run({"-p", pid_file, "-v", "-h", "-p"}, {.terminal = false});
    EXPECT_EQ(run.wait_exit(), 0);
    std::string usage = std::string("torvad version 1.1.21.0\nUsage: ") + torvad_binary +
                        " <options> -- <exe> <exe args>\n  -h  help\n";
    EXPECT_EQ(run.output().rfind(usage, 0), 0u) << run.output();
    EXPECT_TRUE(run.output().ends_with("\n  -a  <pid> <pipe>\n")) << run.output();
    EXPECT_FALSE(file_exists(pid_file));
}

// Each row runs at a console with no child: the run starts and ends at once.
TEST(start, console_run_without_child_handles_bad_options_and_pid_files) {
    scratch_dir dir;
    const std::vector<std::string> rows[] = {
        {},
        {"-d"},
        {"-a", "garbage", "-d", "/no/such/dir", "stray", "-zz", "-"},
        {"-p", dir.path + "/missing/pid"},
        {"-p", "relative.pid", "-d", dir.path},
        {"-f", "family", "-u", "nobody", "--"},
    };
    for (const auto& args : rows) {
        bool pid_error = args.size() == 2 && args[1].ends_with("/missing/pid");
        run_scenario(args,
                     {std::string("?") + started, "=0",
                      pid_error ? "+failed to create pid file" : "-failed to create pid file"},
                     {.directory = dir.path});
        EXPECT_FALSE(file_exists(dir.path + "/relative.pid"));
    }
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

// Outside a service manager the service path ends without a word or a child.
TEST(start, service_path_outside_a_service_manager_starts_nothing) {
    const std::pair<std::vector<std::string>, bool> rows[] = {
        {{"--", child_binary, "exit", "0"}, false},
        {{"-v", "-l", "--", child_binary, "exit", "0"}, false},
        {{"-b", "--", child_binary, "exit", "0"}, true},
    };
    for (const auto& [args, terminal] : rows) {
        daemon_run run(args, {.terminal = terminal});
        EXPECT_EQ(run.wait_exit(), 0);
        for (const char* word : {"torvad", "child"})
            EXPECT_EQ(run.output().find(word), std::string::npos) << run.output();
    }
}

// The event log on Linux: syslog records as a log daemon receives them from
// a run that sees a /dev of its own.
TEST(start, event_log_gets_one_record_per_line_with_ident_and_priority) {
    if (geteuid() != 0 || !holds_here(systems::linux_only))
        GTEST_SKIP() << "needs root for a private mount namespace";
    auto records = [](const std::vector<std::string>& args) {
        scratch_dir dev;
        std::ofstream(dev.path + "/null");
        int log = bound_datagram_socket(dev.path + "/log");
        daemon_run(args, {.dev = dev.path}).wait_exit();
        std::string all;
        char record[8192];
        for (ssize_t got; (got = recv(log, record, sizeof record, MSG_DONTWAIT)) > 0;)
            all.append(record, got) += '\n';
        close(log);
        return all;
    };
    std::string logged = records({"-l", "-p", "/no/such/dir/pid"});
    // <27> is daemon.err, <30> daemon.info; the record is the text alone.
    for (std::string part :
         std::vector<std::string>{"<27>", "torvad[", "]: failed to create pid file\n", "<30>",
                                  std::string("]: ") + started + "\n"})
        EXPECT_NE(logged.find(part), std::string::npos) << part << "\n" << logged;
    EXPECT_EQ(logged.find("\x1b"), std::string::npos) << logged;
    EXPECT_EQ(records({"-p", "/no/such/dir/pid"}), "");
}
