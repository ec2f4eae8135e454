// The program's start and end as an operator sees them: help, PID file,
// working directory, console and service paths, event log records.
#include <gtest/gtest.h>

#include <csignal>
#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
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
    EXPECT_EQ(read_file(dir.path + "/torvad.pid"), std::to_string(run.pid()) + "\n");
    run.signal(SIGTERM);
    EXPECT_EQ(run.wait_exit(), 0);
    EXPECT_FALSE(file_exists(dir.path + "/torvad.pid"));
    EXPECT_FALSE(file_exists(elsewhere.path + "/torvad.pid"));
}

// Outside a service manager the service path ends at once, silently.
TEST(start, service_path_outside_a_service_manager_starts_nothing) {
    const std::vector<std::string> silent = {"=0", "-torvad", "-child"};
    run_scenario({"--", child_binary, "exit", "0"}, silent, {.terminal = false});
    run_scenario({"-v", "-l", "--", child_binary, "exit", "0"}, silent, {.terminal = false});
    run_scenario({"-b", "--", child_binary, "exit", "0"}, silent);
}

namespace {

// Binds a datagram socket at /dev/log inside a private mount namespace of a
// forked child, runs torvad there and sends back every record it received.
std::string syslog_records(const std::vector<std::string>& args) {
    scratch_dir dev; // ours, so that it goes when the test does
    int report[2];
    if (pipe(report) == -1)
        return "pipe failed";
    pid_t helper = fork();
    if (helper == 0) {
        close(report[0]);
        if (unshare(CLONE_NEWNS) == -1 ||
            mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == -1)
            _exit(2);
        // A /dev of our own: what torvad and the pty need, and our /dev/log.
        std::string null_node = dev.path + "/null", pts = dev.path + "/pts";
        close(open(null_node.c_str(), O_CREAT | O_WRONLY, 0666));
        mkdir(pts.c_str(), 0755);
        if (symlink("pts/ptmx", (dev.path + "/ptmx").c_str()) == -1 ||
            mount("/dev/null", null_node.c_str(), nullptr, MS_BIND, nullptr) == -1 ||
            mount("/dev/pts", pts.c_str(), nullptr, MS_BIND | MS_REC, nullptr) == -1)
            _exit(2);
        if (mount(dev.path.c_str(), "/dev", nullptr, MS_BIND | MS_REC, nullptr) == -1)
            _exit(2);
        int log = bound_datagram_socket("/dev/log");
        {
            daemon_run run(args);
            run.wait_exit();
        }
        char record[8192];
        ssize_t got;
        while ((got = recv(log, record, sizeof record, MSG_DONTWAIT)) > 0) {
            ssize_t sent = write(report[1], record, got);
            sent = write(report[1], "\n", 1);
            (void)sent;
        }
        _exit(0);
    }
    close(report[1]);
    std::string records;
    char buffer[4096];
    ssize_t got;
    while ((got = read(report[0], buffer, sizeof buffer)) > 0)
        records.append(buffer, got);
    close(report[0]);
    int status = 0;
    waitpid(helper, &status, 0);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0
               ? records
               : "helper failed: " + std::to_string(status);
}

} // namespace

TEST(start, event_log_gets_one_record_per_line_with_ident_and_priority) {
    if (geteuid() != 0)
        GTEST_SKIP() << "needs root for a private mount namespace";
    std::string records = syslog_records({"-l", "-p", "/no/such/dir/pid"});
    // <27> is daemon.err, <30> daemon.info; the record is the text alone.
    EXPECT_NE(records.find("<27>"), std::string::npos) << records;
    EXPECT_NE(records.find("torvad["), std::string::npos) << records;
    EXPECT_NE(records.find("]: failed to create pid file\n"), std::string::npos) << records;
    EXPECT_NE(records.find("<30>"), std::string::npos) << records;
    EXPECT_NE(records.find(std::string("]: ") + started + "\n"), std::string::npos) << records;
    EXPECT_EQ(records.find("\x1b"), std::string::npos) << records;
    EXPECT_EQ(syslog_records({"-p", "/no/such/dir/pid"}), "");
}
