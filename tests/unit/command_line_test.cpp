// The scan of the command line, quirks included: operators' scripts rely on them.
#include <gtest/gtest.h>

#include "entry/command_line.hpp"

TEST(command_line, options_values_and_the_end_of_the_scan) {
    // The scanned values in one line, so that each case is one row.
    auto scanned = [](std::vector<std::string> args) {
        args.insert(args.begin(), "torvad");
        std::vector<char*> argv;
        for (auto& arg : args)
            argv.push_back(arg.data());
        auto c = torvad::scan_command_line(static_cast<int>(argv.size()), argv.data());
        std::string text =
            std::string(c.help ? "h" : "") + (c.verbose ? "v" : "") + (c.logging ? "l" : "") +
            (c.background ? "b" : "") + (c.no_restart ? "o" : "") + (c.readiness ? "r" : "") +
            " f=" + c.family + " u=" + c.user + " d=" + c.directory +
            " p=" + (c.pid_file ? c.pid_file : "null") + " a=" + std::to_string(c.attach_pid) +
            "," + std::to_string(c.attach_pipe);
        for (const auto& word : c.command)
            text += " [" + word + "]";
        return text;
    };
    const std::string plain = " f=torvaSentry u= d= p=null a=0,-1";
    const std::pair<std::vector<std::string>, std::string> rows[] = {
        {{}, plain},
        {{"-verbose", "-vl"}, "v" + plain},
        {{"-p", "-v"}, " f=torvaSentry u= d= p=-v a=0,-1"},
        {{"-pfile", "other"}, " f=torvaSentry u= d= p=other a=0,-1"},
        {{"-d", "a", "stray", "-d", "b", "-z", "-", "-d"}, " f=torvaSentry u= d=b p=null a=0,-1"},
        {{"-a", "12x", "7"}, " f=torvaSentry u= d= p=null a=12,7"},
        {{"-a", "1234"}, " f=torvaSentry u= d= p=null a=1234,-1"},
        {{"-a", "9", "x", "-a", "abc"}, " f=torvaSentry u= d= p=null a=0,0"},
        {{"-o", "-r", "-b", "-f", "fam", "-u", "svc", "--", "prog", "-v", "--"},
         "bor f=fam u=svc d= p=null a=0,-1 [prog] [-v] [--]"},
        {{"-v", "--"}, "v" + plain},
        {{"-l", "-help", "-v", "-p", "x"}, "hl" + plain},
        {{"-h", "--", "prog"}, "h" + plain},
    };
    for (const auto& [args, expected] : rows)
        EXPECT_EQ(scanned(args), expected) << ::testing::PrintToString(args);
}
