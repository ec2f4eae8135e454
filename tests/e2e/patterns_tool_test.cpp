// The torvad-patterns program itself: it reads the file it is given and
// prints its report with the decision's status; the words are unit tested.
#include <gtest/gtest.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

TEST(patterns_tool, prints_its_report_and_ends_with_its_status) {
    const options tool{.terminal = false, .program = tool_binary};
    run_rows({
        {{"explain", DEMO_PATTERNS, "--", "uname", "-a"}, {"?permitted by line 4", "=0"}, tool},
        {{"explain", DEMO_PATTERNS, "--", "uname", "-a", "-r"},
         {"?line 6 (no match)", "=13"},
         tool},
        {{"explain", "/no/such/file", "--", "uname"},
         {"?failed to open patterns file", "=2"},
         tool},
        {{"check", DEMO_PATTERNS}, {"?0 lines skipped", "=0"}, tool},
        {{"explain", DEMO_PATTERNS}, {"?usage: torvad-patterns", "=64"}, tool},
    });
}
