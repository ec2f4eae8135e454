// The bounded matcher against std::regex_match on short patterns and texts.
// An input is the pattern, a newline, then the text; each is cut to 64 bytes.
#include <cstdint>
#include <optional>
#include <regex>
#include <string>

#include "fuzz/quick_library.hpp"
#include "matcher/bounded_regex.hpp"
#include "platform/platform.hpp"

using torvad::bounded_regex;
using torvad::match_verdict;

namespace {

constexpr std::size_t max_pattern = 64;
constexpr std::size_t max_text = 64;
#if defined(_GLIBCXX_RELEASE) && _GLIBCXX_RELEASE == 12
constexpr bool library_is_libstdcxx_12 = true;
#else
constexpr bool library_is_libstdcxx_12 = false;
#endif

// Only counted repeats, lookaheads and back-references make the work grow
// beyond text length times pattern length; without them, even in a sanitizer
// build, the bound is never near, and undecided is a fault.
bool must_decide(const std::string& pattern) {
    if (pattern.find('{') != std::string::npos || pattern.find("(?") != std::string::npos)
        return false;
    for (std::size_t i = 0; i + 1 < pattern.size(); ++i)
        if (pattern[i] == '\\' && pattern[i + 1] >= '1' && pattern[i + 1] <= '9')
            return false;
    return true;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    auto input = fuzz::split_regex_input(data, size, max_pattern, max_text);
    if (!input)
        return 0;
    const std::string &pattern = input->pattern, &text = input->text;
    std::string error;
    std::optional<bounded_regex> bounded = bounded_regex::compile(pattern, error);
    std::optional<std::regex> library;
    try {
        library.emplace(pattern, std::regex::ECMAScript);
    } catch (const std::regex_error&) {
    }
    // A line the library refuses is refused. The parser reads lines as
    // libstdc++ 12 does; another library may accept more.
    if (bounded && !library)
        __builtin_trap();
    if (!bounded) {
        if (library && library_is_libstdcxx_12)
            __builtin_trap();
        return 0;
    }

    match_verdict verdict = bounded->match(text, torvad::platform::thread_cpu_nanoseconds);
    if (verdict == match_verdict::undecided) {
        if (must_decide(pattern))
            __builtin_trap();
        return 0;
    }
    bool differs = false;
    auto ask_library = [&] {
        differs = fuzz::library_is_quick(*library, text) &&
                  (verdict == match_verdict::match) != std::regex_match(text, *library);
    };
    if (!fuzz::on_large_stack(ask_library) || differs)
        __builtin_trap();
    return 0;
}
