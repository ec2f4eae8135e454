// The programs' start and end as an operator sees them: torvad's, and
// torvad-patterns', whose report and exit status tell its decision (its words
// are unit tested).
#include <gtest/gtest.h>

#include <filesystem>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {
const char* const started = "successfully started torvad version 1.1.21.0";
}

// A console run with no child starts and ends at once, whatever the options;
// outside a service manager the service path ends without a word or a child.
// The PID file holds the pid while torvad runs and goes at its end.
TEST(start, options_help_and_the_pid_file) {
    scratch_dir dir, elsewhere;
    const std::string pid = dir.path + "/pid", ok = std::string("?") + started;
    const char* const no_pid_file = "-failed to create pid file";
    const options pipe{.terminal = false};
    const char* const debug = "WINEDEBUG=fixme+advapi,+eventlog";
    const char* const syslog =
        R"(d=${NOTIFY_SOCKET%/*}; unset NOTIFY_SOCKET; ln $d/notify $d/log; touch $d/null;
        exec unshare -m sh -c 'mount -B /dev/null $0/null && mount -B $0 /dev && exec "$@"' $d "$@")";
    const std::string tag = ".{16}torvad\\[\\d+\\]: ";
    const std::string record = ",0x0000,0x00000000,0000000000000000,0x0002,0x00000000,";
    run_rows({
        {{}, {ok, "=0", no_pid_file}},
        {{"-a", "garbage", "-f", "family", "-u", "nobody", "-d", "/no/such/dir", "stray", "-zz",
          "-", "-d"},
         {ok, "=0", no_pid_file}},
        // -l: each line is also an event log record (Wine traces them): the source
        // registered once; the level's type, category 0, event 0, no user, two
        // strings, no data. Without -l, none.
        {{"-l", "-p", dir.path + "/missing/pid"},
         {"?failed to create pid file", ok, "=0", "&RegisterEventSourceA ((null),\"torvad\")",
          "&,0x0001" + record, "&err:eventlog:ReportEventW L\"torvad\"\n",
          "&err:eventlog:ReportEventW L\"failed to create pid file\"\n", "&,0x0004" + record,
          "&trace:eventlog:ReportEventW L\"" + std::string(started) + "\"\n"},
         {.env = {debug}, .where = systems::windows_only}},
        {{"-p", dir.path + "/missing/pid"},
         {ok, "=0", "&failed to create pid file", "-EventSource"},
         {.env = {debug}}},
        // on Linux each line also goes to syslog's /dev/log (here the manager's
        // socket, in a /dev of torvad's own): facility daemon, the level's priority
        {{"-l", "-o", "-p", dir.path + "/missing/pid", "--", child_binary, "exit", "3"},
         {"@<27>" + tag + "failed to create pid file", "@<30>" + tag + started,
          "@<28>" + tag + "'test_child' exited with 0x3\\.", "=0", "@"},
         {.shell = syslog, .manager = true, .where = systems::linux_only, .as_root = true}},
        {{"-a", "4242"}, {"?failed to attach to ipc pipe.", "?executable not specified", "=0"}},
        // a relative PID file name is taken in the starting directory, whatever -d says
        {{"-p", "torvad.pid", "-d", elsewhere.path, "--", child_binary, "peer"},
         {"?child: ready", "P" + dir.path + "/torvad.pid", "!TERM", "=0"},
         {.directory = dir.path}},
        // help, on stderr, and nothing else: no PID file either
        {{"-p", pid, "-v", "-h", "-p"},
         {"?torvad version 1.1.21.0\nUsage: " + torvad_binary +
              " <options> -- <exe> <exe args>\n  -h  help\n  -v  verbose\n  -l  enable logging\n"
              "  -b  start service\n  -o  disable auto restart after failure\n  -r  ready once all "
              "children say so\n  -f  <product family>\n  -u  <user>\n  -d  <directory>\n  -p  "
              "<pid file>\n  -a  <pid> <pipe>\n",
          "=0", "-successfully"},
         pipe},
        {{"-v", "-l", "--", child_binary, "exit", "0"}, {"=0", "-torvad", "-child"}, pipe},
        {{"-b", "--", child_binary, "exit", "0"}, {"=0", "-torvad", "-child"}},
    });
    // No PID file is left, nor anything else.
    EXPECT_TRUE(std::filesystem::is_empty(dir.path) && std::filesystem::is_empty(elsewhere.path));
}

TEST(start, torvad_patterns_prints_its_report_and_ends_with_its_status) {
    const options tool{.terminal = false, .program = tool_binary};
    const std::string demo = DEMO_PATTERNS;
    run_rows({
        {{"explain", demo, "--", "uname", "-a"}, {"?permitted by line 4", "=0"}, tool},
        {{"explain", demo, "--", "uname", "-a", "-r"}, {"?line 6 (no match)", "=13"}, tool},
        {{"explain", "/no/such", "--", "uname"}, {"?failed to open patterns file", "=2"}, tool},
        {{"check", demo}, {"?0 lines skipped", "=0"}, tool},
        {{"explain", demo}, {"?usage: torvad-patterns", "=64"}, tool},
    });
}
