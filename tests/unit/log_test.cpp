// The console line: both forms, the cut at 4095 characters, and -v.
#include <gtest/gtest.h>

#include <regex>

#include "daemon/daemon.hpp"

using supervisor = torvad::daemon;

TEST(log, line_forms_by_level_colour_and_length) {
    const std::string time = R"(\d\d:\d\d:\d\d)", tag = "\x1b\\[36m torvad\x1b\\[0m ";
    const std::tuple<bool, void (*)(supervisor&), std::string> rows[] = {
        {false, [](supervisor& d) { d.log_info("%s", "100%d"); }, "^" + time + " torvad 100%d\n$"},
        {true, [](supervisor& d) { d.log_error("bad"); }, "^\x1b\\[31m" + time + tag + "bad\n$"},
        {true, [](supervisor& d) { d.log_warning("so"); }, "^\x1b\\[33m" + time + tag + "so\n$"},
        {true, [](supervisor& d) { d.log_info("ok"); }, "^\x1b\\[32m" + time + tag + "ok\n$"},
        {false, [](supervisor& d) { d.log_verbose("hidden %s", "x"); }, "^$"},
        {false, [](supervisor& d) { d.log_info("%s", std::string(5000, 'y').c_str()); },
         "^" + time + " torvad y{4095}\n$"},
    };
    supervisor the_daemon({});
    for (const auto& [coloured, log, pattern] : rows) {
        the_daemon.set_colour(coloured);
        testing::internal::CaptureStdout();
        log(the_daemon);
        std::string line = testing::internal::GetCapturedStdout();
        EXPECT_TRUE(std::regex_match(line, std::regex(pattern))) << line;
    }
}
