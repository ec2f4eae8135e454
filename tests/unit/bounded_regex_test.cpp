// The bounded matcher against answers of std::regex_match, quirks included,
// and on lines where the library's own matcher overflows the stack or never ends.
#include <gtest/gtest.h>

#include "matcher/bounded_regex.hpp"
#include "platform/platform.hpp"

using namespace torvad;
using namespace std::string_literals;

namespace {

constexpr auto yes = match_verdict::match;
constexpr auto no = match_verdict::no_match;
constexpr auto undecided = match_verdict::undecided;

match_verdict verdict(const std::string& pattern, const std::string& text) {
    std::string error;
    auto compiled = bounded_regex::compile(pattern, error);
    EXPECT_TRUE(compiled) << error;
    return compiled ? compiled->match(text, platform::thread_cpu_nanoseconds) : undecided;
}

// The longest argument a request can carry after "/bin/echo\0x".
const std::string long_argument(65520 - 11, 'y');

} // namespace

TEST(bounded_regex, decides_as_the_library_does_or_gives_up_within_the_bound) {
    const std::tuple<std::string, std::string, match_verdict> rows[] = {
        // The whole text: items joined by NUL bytes, written \0 in a pattern.
        {R"(/bin/echo\0.*)", "/bin/echo\0hello\0world"s, yes},
        {R"(/bin/echo\0.*)", "/bin/echo", no},
        {R"(/bin/echo\0.*)", "/bin/echox\0a"s, no},
        {R"(tool\.exe\0-x)", "tool.exe\0-x"s, yes},
        {R"(tool\.exe\0-x)", "toolXexe\0-x"s, no},
        {R"(tool\.exe\0-x)", "tool.exe\0-x\0-y"s, no},
        {R"(tool\.exe\0-x)", "xtool.exe\0-x"s, no},
        {"Tool", "tool", no},
        {"[a-z]+", "Tool", no},
        // Where the library's matcher overflows the stack or takes ages.
        {R"(/bin/echo\0x.*)", "/bin/echo\0x"s + long_argument, yes},
        {R"(/usr/bin/printf(\0.*)*)", "/usr/bin/printf\0%s\0"s + std::string(60000, 'z'), yes},
        {"(a|a)*b", std::string(65520, 'a'), no},
        {"(a|a)*b", std::string(40, 'a') + "b", yes},
        {R"(([^\0]*)\0\1\0.*)", "/bin/sh\0/bin/sh\0"s + long_argument, yes},
        // Back-references, lookaheads and boundaries, as the library has them.
        {R"(([^\0]*)\0\1)", "ab\0ba"s, no},
        {R"((a)|\1b)", "b", no},              // a group that never matched fails
        {R"((?:(a)|b)*\1)", "aba", yes},      // a later pass does not clear a group
        {R"((?=(a+))a*b\1)", "aaabaaa", yes}, // a lookahead sets groups
        {R"((?=(a+))a*b\1)", "aaaba", no},    // once and for all
        {R"((a*)*b\1)", "aabaa", yes},        // an empty pass ends a loop
        {R"(a(?=^b)b)", "ab", yes},           // a lookahead begins where it is
        {R"(a(?=\bb)b)", "ab", yes},          // and sees nothing before that
        {R"(.\bx)", "ax", no},
        {R"((?!rm\0).*)", "rm\0-rf"s, no},
        {"(a|ab)(c|bcd)(d*)", "abcd", yes},
        // Given up within the bound: exponential for backtracking, which
        // back-references need; twenty thousand states alive at each position.
        {R"((a|a)*\1b)", std::string(40, 'a'), undecided},
        {"(?:a|b?){5000}", std::string(65520, 'a'), undecided},
    };
    for (const auto& [pattern, text, expected] : rows)
        EXPECT_EQ(verdict(pattern, text), expected) << pattern;
}

TEST(bounded_regex, refuses_what_the_library_refuses) {
    for (std::string bad :
         {"(", "a)", "[a", "a{2,1}", "*a", R"(\1(a))", "x{100000}", "x{99999999999999999999}"}) {
        std::string error;
        EXPECT_FALSE(bounded_regex::compile(bad, error)) << bad;
        EXPECT_FALSE(error.empty()) << bad;
    }
}

// As the daemon loads them: on the stack their deepest line asks for.
TEST(bounded_regex, compiles_lines_deeper_than_a_default_stack) {
    const std::pair<std::string, std::string> rows[] = {
        {std::string(30000, '(') + "a" + std::string(30000, ')'), "a"},
        {std::string(99000, 'a'), std::string(99000, 'a')},
    };
    for (const auto& [line, text] : rows) {
        match_verdict result = undecided;
        ASSERT_TRUE(platform::run_on_large_stack(compile_stack_bytes(line),
                                                 [&] { result = verdict(line, text); }));
        EXPECT_EQ(result, yes);
    }
}
