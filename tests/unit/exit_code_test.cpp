// What a child's end counts as decides its restart and the code its requester
// sees: its status, or 128 + its signal unless we ended it; a status that
// can't be read is a clean end, no restart.
#include <gtest/gtest.h>

#include "process/process.hpp"

TEST(exit_code, an_end_counts_as_its_status_or_its_signal) {
    const torvad::platform::os_error unreadable{10, "waitid"};
    const std::tuple<torvad::platform::exit_status, bool, std::uint32_t> rows[] = {
        {{true, true, 3, {}}, false, 3},          {{true, false, 9, {}}, false, 137},
        {{true, false, 9, {}}, true, 0},          {{true, true, 3, unreadable}, false, 0},
        {{true, false, 9, unreadable}, false, 0},
    };
    for (const auto& [exit, forced, code] : rows)
        EXPECT_EQ(torvad::exit_code_of(exit, forced), code) << exit.code << " " << forced;
}
