// The patterns file and the decisions made over it: what a line permits is
// exactly what the operator wrote, and a bad line never permits more.
#include <gtest/gtest.h>

#include "entry/patterns_tool.hpp"
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

// Two refusals that show only here; the others run end to end.
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
    auto r = decide(execute_user | execute_path | execute_stdio_none, {"nobody", "", "/usr/bin/id"})
                 .request; // an empty path is ours
    EXPECT_EQ(std::tie(r.user, r.working_directory, r.command, r.stdio_mode, r.persistent),
              std::tuple("nobody", "", std::vector<std::string>{"/usr/bin/id"}, stdio_none, false));
}

// What torvad-patterns check finds: each kind of line torvad skips, and the
// lines that load but are rarely meant.
TEST(patterns, check_names_skipped_lines_and_warns) {
    patterns_file file;
    file.lists = parse_patterns("# a comment\n"
                                "/bin/echo\\0.*\n"
                                "([bad\n"
                                "x{100000}\n"
                                "x{99999999999999999999}\n"
                                "/bin/true \n"
                                "(all) /bin/echo\\0.*\n"
                                "C:\\\\Tools\\\\PwSh\\.exe\\0-c\\0.*\n"
                                "(all) (cmd|x)(\\.exe)?\\0/c\\0dir\n"
                                "/usr/bin/cmdline\n",
                                file.skipped);
    patterns_tool::report report = patterns_tool::check("p", file);
    EXPECT_EQ(report.status, 1);
    for (const char* expected :
         {"p:3: skipped: ", "\n    ([bad\n", "p:4: skipped: too large to compile",
          "p:5: skipped: a repeat count or back-reference number is too large",
          "p:6: warning: a blank", "p:7: warning: repeats line 2",
          "p:8: warning: permits a command interpreter", "p:9: warning: permits a command",
          "p: 4 own-account and 2 any-account patterns, 3 lines skipped, 4 warnings"})
        EXPECT_NE(report.out.find(expected), std::string::npos) << expected << "\n" << report.out;
    file.skipped.clear();
    EXPECT_EQ(patterns_tool::check("p", file).status, 0);
    file.open_failure = "failed to open patterns file 'p'";
    EXPECT_EQ(patterns_tool::check("p", file).status, 2);
}

// What torvad-patterns explain says of a request, and its exit status: the
// line that permitted, or the refusal with every line tried.
TEST(patterns, explain_names_the_deciding_line_or_every_line_tried) {
    const std::string demo = "# own\nuname\\0-[a-z]+\n(all) id\\0-un\n";
    const std::tuple<std::string, std::vector<std::string>, std::string, int> rows[] = {
        {demo, {"--", "uname", "-a"}, "permitted by line 2: uname\\0-[a-z]+\n", 0},
        {demo,
         {"-r", "svc", "--", "uname", "-a", "-r"},
         "text: uname\\0-a\\0-r\nrefused: permission to execute denied\n"
         "    line 2 (no match): uname\\0-[a-z]+\n    line 3 (no match): (all) id\\0-un\n",
         13},
        {demo,
         {"-u", "nobody", "--", "uname", "-a"},
         "refused: permission to change user denied\n    line 3 (no match): (all) id\\0-un\n",
         13},
        {demo, {"-u", "nobody", "--", "id", "-un"}, "permitted by line 3: (all) id\\0-un", 0},
        {"/bin/echo\\0x(y|y)*\\1z\n",
         {"--", "/bin/echo", "x" + std::string(40, 'y')},
         "refused: undecided within the bounds\n    line 1 (undecided)",
         13},
        {demo, {"-u", "--", "id"}, "", -1},
        {demo, {"--"}, "", -1},
    };
    for (const auto& [patterns, request, explained, status] : rows) {
        std::vector<std::string> args = {"explain", "p"};
        args.insert(args.end(), request.begin(), request.end());
        patterns_tool::command_line parsed;
        ASSERT_EQ(patterns_tool::parse_command_line(args, parsed), status >= 0);
        if (status < 0)
            continue;
        patterns_file file;
        file.lists = parse_patterns(patterns, file.skipped);
        auto report = patterns_tool::explain(parsed, file, platform::thread_cpu_nanoseconds);
        EXPECT_NE(report.out.find(explained), std::string::npos) << report.out;
        EXPECT_EQ(report.status, status) << report.out;
    }
}
