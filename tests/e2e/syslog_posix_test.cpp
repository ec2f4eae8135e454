// The event log on Linux: syslog records as a log daemon receives them.
#include <gtest/gtest.h>

#include <fstream>
#include <sys/socket.h>
#include <unistd.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

const char* const started = "successfully started torvad version 1.1.21.0";

// The records that torvad sends to /dev/log, in a /dev of the run's own.
std::string syslog_records(const std::vector<std::string>& args) {
    scratch_dir dev;
    std::ofstream(dev.path + "/null");
    int log = bound_datagram_socket(dev.path + "/log");
    daemon_run(args, {.dev = dev.path}).wait_exit();
    std::string records;
    char record[8192];
    for (ssize_t got; (got = recv(log, record, sizeof record, MSG_DONTWAIT)) > 0;)
        records.append(record, got) += '\n';
    close(log);
    return records;
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
