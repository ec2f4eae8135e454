// The console line: both forms, the cut at 4095 characters, and -v.
#include <gtest/gtest.h>

#include <cstdio>
#include <regex>
#include <unistd.h>

#include "daemon/daemon.hpp"

using torvad::the_daemon;

TEST(log, line_forms_by_level_colour_and_length) {
    const std::string time = R"(\d\d:\d\d:\d\d)", tag = "\x1b\\[36m torvad\x1b\\[0m ";
    const std::tuple<bool, void (*)(), std::string> rows[] = {
        {false, [] { the_daemon.log_info("%s", "100%d"); }, "^" + time + " torvad 100%d\n$"},
        {true, [] { the_daemon.log_error("bad"); }, "^\x1b\\[31m" + time + tag + "bad\n$"},
        {true, [] { the_daemon.log_warning("so"); }, "^\x1b\\[33m" + time + tag + "so\n$"},
        {true, [] { the_daemon.log_info("ok"); }, "^\x1b\\[32m" + time + tag + "ok\n$"},
        {false, [] { the_daemon.log_verbose("hidden %s", "x"); }, "^$"},
        {false, [] { the_daemon.log_info("%s", std::string(5000, 'y').c_str()); },
         "^" + time + " torvad y{4095}\n$"},
    };
    bool colour = the_daemon.colour();
    for (const auto& [coloured, log, pattern] : rows) {
        // The line goes to a file standing in for stdout.
        the_daemon.set_colour(coloured);
        std::fflush(stdout);
        std::FILE* sink = std::tmpfile();
        int saved = dup(1);
        dup2(fileno(sink), 1);
        log();
        std::fflush(stdout);
        dup2(saved, 1);
        close(saved);
        std::string line(8192, '\0');
        std::rewind(sink);
        line.resize(std::fread(line.data(), 1, line.size(), sink));
        std::fclose(sink);
        EXPECT_TRUE(std::regex_match(line, std::regex(pattern))) << line;
    }
    the_daemon.set_colour(colour);
}
