// The bounded matcher where the library's own matcher overflows the stack or
// never ends, and where it gives up. On short lines and texts it answers as
// std::regex_match does, quirks included: the differential fuzzer holds that,
// from seeds that spell each quirk (fuzz/seeds_regex), which are replayed here.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <regex>

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

TEST(bounded_regex, decides_long_texts_or_gives_up_within_the_bound) {
    const std::tuple<std::string, std::string, match_verdict> rows[] = {
        // Where the library's matcher overflows the stack or takes ages.
        {R"(/bin/echo\0x.*)", "/bin/echo\0x"s + long_argument, yes},
        {R"(/usr/bin/printf(\0.*)*)", "/usr/bin/printf\0%s\0"s + std::string(60000, 'z'), yes},
        {"(a|a)*b", std::string(65520, 'a'), no},
        {R"(([^\0]*)\0\1\0.*)", "/bin/sh\0/bin/sh\0"s + long_argument, yes},
        // Given up within the bound: exponential for backtracking, which
        // back-references need; twenty thousand states alive at each position.
        {R"((a|a)*\1b)", std::string(40, 'a'), undecided},
        {"(?:a|b?){5000}", std::string(65520, 'a'), undecided},
    };
    for (const auto& [pattern, text, expected] : rows)
        EXPECT_EQ(verdict(pattern, text), expected) << pattern;
}

// A seed is a pattern, a line feed and a text (or the pattern alone). Where the
// library takes exponential time, or a stack deeper than a thread's, its answer
// (on a stack of a gigabyte) is written here.
TEST(bounded_regex, answers_the_fuzzers_seeds_as_the_library_does) {
    const std::map<std::string, match_verdict> known = {{"ambiguous", no},
                                                        {"library_recursion", yes}};
    for (const auto& seed : std::filesystem::directory_iterator(REGEX_SEEDS)) {
        std::ifstream file(seed.path(), std::ios::binary);
        std::string input{std::istreambuf_iterator<char>(file), {}},
            name = seed.path().filename().string();
        std::size_t cut = input.find('\n');
        std::string pattern = input.substr(0, cut),
                    text = cut == input.npos ? "" : input.substr(cut + 1);
        EXPECT_EQ(verdict(pattern, text), known.contains(name) ? known.at(name)
                                          : std::regex_match(text, std::regex(pattern)) ? yes
                                                                                        : no)
            << name;
    }
}

TEST(bounded_regex, refuses_what_the_library_refuses) {
    for (std::string bad :
         {"(", "a)", "[a", "a{2,1}", "*a", R"(\1(a))", "x{100000}", "x{99999999999999999999}"}) {
        std::string error;
        EXPECT_FALSE(bounded_regex::compile(bad, error)) << bad;
        EXPECT_FALSE(error.empty()) << bad;
    }
}

// Nesting and length cost the parser heap, not stack: these load on any thread.
TEST(bounded_regex, compiles_lines_deeper_than_a_default_stack) {
    const std::pair<std::string, std::string> rows[] = {
        {std::string(30000, '(') + "a" + std::string(30000, ')'), "a"},
        {std::string(99000, 'a'), std::string(99000, 'a')},
    };
    for (const auto& [line, text] : rows)
        EXPECT_EQ(verdict(line, text), yes);
}
