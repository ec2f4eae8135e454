// The event log on Linux: syslog records as a log daemon receives them.
#include <gtest/gtest.h>

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
