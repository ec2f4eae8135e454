// What a child's end counts as decides its restart and the code its requester sees.
#include <gtest/gtest.h>

#include "process/process.hpp"

using namespace torvad;

TEST(exit_code, an_end_counts_as_its_status_or_its_signal) {
    struct row {
        platform::exit_status exit;
        bool forced;
        std::uint32_t expected;
    };
    const platform::os_error unreadable{10, "waitid"};
    const row rows[] = {
        {{true, true, 0, {}}, false, 0},
        {{true, true, 3, {}}, false, 3},
        {{true, false, 9, {}}, false, 137}, // as the shell reports a kill
        {{true, false, 9, {}}, true, 0},    // ended by us at a stop: not a failure
        {{true, true, 0, unreadable}, false, 0},
        {{true, false, 0, unreadable}, false, 0}, // unknown is a clean end, no restart
    };
    for (const auto& r : rows)
        EXPECT_EQ(exit_code_of(r.exit, r.forced), r.expected)
            << r.exit.exited << " " << r.exit.code << " " << r.forced;
}
