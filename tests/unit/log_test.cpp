// The console line: both forms, the cut at 4095 characters, and -v.
#include <gtest/gtest.h>

#include <cstdio>
#include <regex>
#include <unistd.h>

#include "daemon/daemon.hpp"

using namespace torvad;

namespace {

// Runs log with stdout sent to a file, and gives what was written.
template <class Log> std::string captured(Log log) {
    std::fflush(stdout);
    std::FILE* sink = std::tmpfile();
    int saved = dup(1);
    dup2(fileno(sink), 1);
    log();
    std::fflush(stdout);
    dup2(saved, 1);
    close(saved);
    std::string text(8192, '\0');
    std::rewind(sink);
    text.resize(std::fread(text.data(), 1, text.size(), sink));
    std::fclose(sink);
    return text;
}

} // namespace

TEST(log, line_forms_by_level_and_colour) {
    struct row {
        bool colour;
        void (*log)();
        std::string pattern;
    };
    const std::string time = R"(\d\d:\d\d:\d\d)";
    const row rows[] = {
        {false, [] { the_daemon.log_info("%s", "100%d"); }, "^" + time + " torvad 100%d\n$"},
        {true, [] { the_daemon.log_error("bad"); },
         "^\x1b\\[31m" + time + "\x1b\\[36m torvad\x1b\\[0m bad\n$"},
        {true, [] { the_daemon.log_warning("so"); }, "^\x1b\\[33m" + time + ".* so\n$"},
        {true, [] { the_daemon.log_info("ok"); }, "^\x1b\\[32m" + time + ".* ok\n$"},
        {false, [] { the_daemon.log_verbose("hidden %s", "x"); }, "^$"},
    };
    bool colour = the_daemon.colour;
    for (const auto& r : rows) {
        the_daemon.colour = r.colour;
        std::string line = captured(r.log);
        EXPECT_TRUE(std::regex_match(line, std::regex(r.pattern))) << line;
    }
    the_daemon.colour = colour;
}

TEST(log, a_long_text_is_cut_to_4095_characters) {
    bool colour = the_daemon.colour;
    the_daemon.colour = false;
    std::string line = captured([] { the_daemon.log_info("%s", std::string(5000, 'y').c_str()); });
    the_daemon.colour = colour;
    EXPECT_EQ(line.size(), std::string("00:00:00 torvad ").size() + 4095 + 1);
    EXPECT_EQ(line.back(), '\n');
}
