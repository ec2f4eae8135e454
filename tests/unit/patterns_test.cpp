// The patterns file and the decisions made over it: what a line permits is
// exactly what the operator wrote, and a bad line never permits more.
#include <gtest/gtest.h>

#include "ipc/execute.hpp"
#include "ipc/strings.hpp"
#include "platform/platform.hpp"

using namespace torvad;

namespace {

const char* const denied = "permission to execute denied";
const char* const user_denied = "permission to change user denied";

std::string decided(const pattern_lists& lists, const std::string& wanted,
                    const std::vector<std::string>& items) {
    permission result =
        decide_permission(lists, "svc", wanted, items, platform::thread_cpu_nanoseconds);
    return result.refusal == nullptr ? "permitted" : result.refusal;
}

} // namespace

TEST(patterns, lines_permit_exactly_what_they_say) {
    std::vector<skipped_line> skipped;
    const pattern_lists lists = parse_patterns("# a comment\n"
                                               "/bin/echo\\0.*\n"
                                               " #not a comment\n"
                                               "(all) /usr/bin/id\r\n"
                                               "(all)x\n"
                                               "(all) ([bad\n"
                                               "\n"
                                               "/bin/true\r\n"
                                               "/bin/last\r",
                                               skipped);
    ASSERT_EQ(skipped.size(), 1u);
    EXPECT_EQ(describe_skipped(skipped[0], "exec.patterns")
                  .rfind("bad pattern on line 6 of 'exec.patterns' skipped: ", 0),
              0u);
    const std::tuple<std::string, std::vector<std::string>, std::string> rows[] = {
        {"svc", {"/bin/echo", "hi", ""}, "permitted"},
        {"svc", {"/bin/echo"}, denied},        // the line spells a second item
        {"svc", {"x/bin/echo", "hi"}, denied}, // whole text, no search
        {"svc", {"/bin/ECHO", "hi"}, denied},  // case counts
        {"svc", {" #not a comment"}, "permitted"},
        {"svc", {"#not a comment"}, denied},   // nothing trimmed
        {"svc", {"/usr/bin/id"}, "permitted"}, // an (all) line serves the own account too
        {"nobody", {"/usr/bin/id"}, "permitted"},
        {"nobody", {"/bin/echo", "hi"}, user_denied},
        {"", {"/usr/bin/id", "-u"}, user_denied}, // an empty name is another account
        {"svc", {"allx"}, "permitted"},           // "(all)x" has no blank: an ordinary line
        {"svc", {"/bin/true"}, "permitted"},      // CR before LF is not the line's
        {"svc", {"/bin/last\r"}, "permitted"},    // a last line without LF keeps its CR
        {"svc", {"/bin/last"}, denied},
        {"nobody", {"([bad"}, user_denied}, // the bad line permits nothing
    };
    for (const auto& [wanted, items, expected] : rows)
        EXPECT_EQ(decided(lists, wanted, items), expected) << wanted << " " << items[0];

    const pattern_lists open, closed = parse_patterns("# nothing\n", skipped);
    EXPECT_EQ(decided(open, "svc", {"anything"}), "permitted");
    EXPECT_EQ(decided(open, "nobody", {"anything"}), user_denied);
    EXPECT_EQ(decided(closed, "svc", {"anything"}), denied);
}

// The other refusals, with their statuses, run end to end in the hostile and
// product tests; these two show only here.
TEST(patterns, execute_requests_take_user_and_path_items_first) {
    std::vector<skipped_line> skipped;
    const pattern_lists lists = parse_patterns("(all) /usr/bin/id\n", skipped);
    auto decide = [&](std::uint32_t flags, const std::vector<std::string>& items) {
        std::string payload = join_strings(items);
        return decide_execute(flags, payload.data(), payload.size(), "svc", "/srv", lists,
                              platform::thread_cpu_nanoseconds);
    };
    execute_decision refused = decide(execute_user | execute_path, {"nobody", "/usr/bin/id"});
    EXPECT_STREQ(refused.refusal, "path not specified");
    EXPECT_EQ(refused.status, status_malformed);
    execute_request accepted =
        decide(execute_user | execute_path | execute_stdio_none, {"nobody", "", "/usr/bin/id"})
            .request;
    EXPECT_EQ(accepted.user, "nobody");
    EXPECT_EQ(accepted.working_directory, ""); // an empty path is ours
    EXPECT_EQ(accepted.command, std::vector<std::string>{"/usr/bin/id"});
    EXPECT_EQ(accepted.stdio_mode, stdio_none);
    EXPECT_FALSE(accepted.persistent);
}
