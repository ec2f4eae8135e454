// Boost.Regex against std::regex_match, as a candidate for the bounded
// matcher: std::regex decides which lines are valid, and Boost.Regex, set to
// ECMAScript's whole-text reading as closely as its flags allow, must give
// the same answer wherever std::regex gives one. Inputs as for fuzz_regex.
// With FUZZ_REGEX_DIFFERENCES naming a file, each difference is appended to
// it and the run goes on, to survey them; else the first one stops the run.
// Kept to repeat the trial, which the bounded matcher won: Boost.Regex
// refuses lines std::regex takes (a?* , (?=) , \p), reads Perl escapes
// (\A \z \e \' \l) and octal, ends . at a form feed, keeps no lookahead
// quirk of libstdc++, and its bound on states gives up on (a|a)*b over 24 bytes.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <regex>
#include <string>

#include <boost/regex.hpp>

#include "fuzz/quick_library.hpp"
#include "fuzz/shown.hpp"
#include "matcher/automaton.hpp"
#include "platform/platform.hpp"

namespace {

constexpr std::size_t max_pattern = 64;
constexpr std::size_t max_text = 64;

// ^ and $ at the ends of the text only (no Perl m), and . not across a line
// end (no Perl s). NUL is an ordinary character to both.
constexpr auto boost_syntax =
    boost::regex::ECMAScript | boost::regex::no_mod_m | boost::regex::no_mod_s;

// "match", "no match", or why Boost.Regex gave no answer.
std::string boost_answer(const std::string& pattern, const std::string& text) {
    std::optional<boost::regex> expression;
    try {
        expression.emplace(pattern, boost_syntax);
    } catch (const std::exception& failure) {
        return std::string("refused: ") + failure.what();
    }
    try {
        return boost::regex_match(text, *expression, boost::match_default) ? "match" : "no match";
    } catch (const std::exception& failure) {
        // Its bound on states, or on the memory of its backtracking stack.
        return std::string("undecided: ") + failure.what();
    }
}

void report(const std::string& pattern, const std::string& text, bool library,
            const std::string& boost) {
    std::string line = "pattern '" + shown(pattern) + "' text '" + shown(text) + "': std::regex " +
                       (library ? "match" : "no match") + ", Boost.Regex " + boost + "\n";
    const char* survey = std::getenv("FUZZ_REGEX_DIFFERENCES");
    std::FILE* out = survey != nullptr ? std::fopen(survey, "a") : stderr;
    if (out != nullptr) {
        std::fputs(line.c_str(), out);
        if (out != stderr)
            std::fclose(out);
    }
    if (survey == nullptr)
        __builtin_trap();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    auto input = fuzz::split_regex_input(data, size, max_pattern, max_text);
    if (!input)
        return 0;
    const std::string &pattern = input->pattern, &text = input->text;
    // The library compiles and matches by recursion: a stack as large as its
    // steps can fill, as in fuzz_regex.
    std::optional<bool> library;
    auto ask_library = [&] {
        try {
            library = fuzz::library_answer(std::regex(pattern, std::regex::ECMAScript), text);
        } catch (const std::regex_error&) {
        }
    };
    if (!fuzz::on_large_stack(ask_library))
        __builtin_trap();
    if (!library)
        return 0; // not a valid line, or std::regex gives no answer in time
    std::string boost = boost_answer(pattern, text);
    if (boost != (*library ? "match" : "no match"))
        report(pattern, text, *library, boost);
    return 0;
}
