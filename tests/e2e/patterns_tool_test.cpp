// The torvad-patterns program itself: it reads the file it is given and
// prints its report with the decision's status; the words are unit tested.
#include <gtest/gtest.h>

#include <boost/process.hpp>

#include "tests/e2e/harness.hpp"

using namespace e2e;

TEST(patterns_tool, prints_its_report_and_ends_with_its_status) {
    namespace bp = boost::process;
    const std::tuple<std::vector<std::string>, int, std::string> rows[] = {
        {{"explain", DEMO_PATTERNS, "--", "uname", "-a"}, 0, "permitted by line 4"},
        {{"explain", DEMO_PATTERNS, "--", "uname", "-a", "-r"}, 13, "line 6 (no match)"},
        {{"explain", "/no/such/file", "--", "uname"}, 2, "failed to open patterns file"},
        {{"check", DEMO_PATTERNS}, 0, "0 lines skipped"},
        {{"explain", DEMO_PATTERNS}, 64, "usage: torvad-patterns"},
    };
    for (const auto& [request, status, printed] : rows) {
        std::vector<std::string> args(tool_command.begin() + 1, tool_command.end());
        args.insert(args.end(), request.begin(), request.end());
        bp::ipstream output;
        bp::child tool(tool_command[0], bp::args(args), (bp::std_out & bp::std_err) > output);
        std::string out(std::istreambuf_iterator<char>(output), {});
        tool.wait();
        EXPECT_EQ(tool.exit_code(), status) << out;
        EXPECT_NE(out.find(printed), std::string::npos) << out;
    }
}
