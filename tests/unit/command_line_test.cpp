// The scan of the command line, quirks included: operators' scripts rely on them.
#include <gtest/gtest.h>

#include "entry/command_line.hpp"

using torvad::command_line;

namespace {

command_line scan(std::vector<std::string> args) {
    args.insert(args.begin(), "torvad");
    std::vector<char*> argv;
    for (auto& arg : args)
        argv.push_back(arg.data());
    return torvad::scan_command_line(static_cast<int>(argv.size()), argv.data());
}

} // namespace

TEST(command_line, options_values_and_the_end_of_the_scan) {
    struct row {
        std::vector<std::string> args;
        void (*check)(const command_line&);
    };
    const row rows[] = {
        {{"-verbose", "-vl"},
         [](const command_line& c) {
             EXPECT_TRUE(c.verbose && !c.logging);
         }},
        {{"-p", "-v"},
         [](const command_line& c) {
             EXPECT_STREQ(c.pid_file, "-v");
             EXPECT_FALSE(c.verbose);
         }},
        {{"-pfile", "other"},
         [](const command_line& c) {
             EXPECT_STREQ(c.pid_file, "other");
         }},
        {{"-d", "a", "stray", "-d", "b", "-z", "-", "-d"},
         [](const command_line& c) {
             EXPECT_EQ(c.directory, "b");
         }},
        {{"-a", "12x", "7"},
         [](const command_line& c) {
             EXPECT_EQ(c.attach_pid, 12);
             EXPECT_EQ(c.attach_pipe, 7);
         }},
        {{"-a", "1234"},
         [](const command_line& c) {
             EXPECT_EQ(c.attach_pid, 1234);
             EXPECT_EQ(c.attach_pipe, -1);
         }},
        {{"-a", "abc", "-1"},
         [](const command_line& c) {
             EXPECT_EQ(c.attach_pid, 0);
             EXPECT_EQ(c.attach_pipe, -1);
         }},
        {{"-o", "-b", "-f", "fam", "-u", "svc", "--", "prog", "-v", "--"},
         [](const command_line& c) {
             EXPECT_TRUE(c.no_restart && c.background && !c.verbose);
             EXPECT_EQ(c.family, "fam");
             EXPECT_EQ(c.user, "svc");
             EXPECT_EQ(c.command, (std::vector<std::string>{"prog", "-v", "--"}));
         }},
        {{"-v", "--"},
         [](const command_line& c) {
             EXPECT_TRUE(c.command.empty());
         }},
        {{"-l", "-help", "-v", "-p", "x"},
         [](const command_line& c) {
             EXPECT_TRUE(c.help && c.logging && !c.verbose);
             EXPECT_EQ(c.pid_file, nullptr);
         }},
        {{},
         [](const command_line& c) {
             EXPECT_EQ(c.family, "torvaSentry");
             EXPECT_EQ(c.attach_pid, 0);
             EXPECT_EQ(c.attach_pipe, -1);
         }},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE(::testing::PrintToString(r.args));
        r.check(scan(r.args));
    }
}
