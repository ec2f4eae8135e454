// The standard library's own matcher recurses once per character and may take
// exponential time, so it cannot be run on a text a child chooses. Its compiler
// is used as it is, on a stack its caller makes large enough; the matching is
// done by the bounded searches, which give the library's answer whenever they
// finish in time.
#include "matcher/bounded_regex.hpp"

#include <algorithm>
#include <limits>
#include <new>
#include <regex>

#include "matcher/search.hpp"

namespace torvad {

namespace {

// The library's compiler recurses once per term of a sequence, and terms are
// limited by its 100,000 states, and once per nesting level, each of which
// begins with a parenthesis. Measured: up to 100 bytes per term and 500 per
// level, and five times as much in sanitizer builds, which these allow for.
// The stack is only reserved: pages are touched as deep as the compiler goes.
constexpr std::size_t compile_stack_base = std::size_t{1} << 20;
constexpr std::size_t compile_stack_per_term = 1024;
constexpr std::size_t compile_stack_per_parenthesis = 4096;
constexpr std::size_t max_terms = 100000;

std::string compile_error(const std::regex_error& failure) {
    if (failure.code() == std::regex_constants::error_space)
        return "too large to compile (more than 100000 automaton states)";
    return failure.what();
}

} // namespace

std::size_t compile_stack_bytes(std::string_view source) {
    auto parentheses = static_cast<std::size_t>(std::count(source.begin(), source.end(), '('));
    return compile_stack_base + std::min(source.size(), max_terms) * compile_stack_per_term +
           parentheses * compile_stack_per_parenthesis;
}

bounded_regex::bounded_regex(std::shared_ptr<const regex::automaton> compiled)
    : compiled_(std::move(compiled)) {}

std::optional<bounded_regex> bounded_regex::compile(std::string_view source, std::string& error) {
    if (regex::has_oversized_number(source)) {
        error = "a repeat count or back-reference number is too large";
        return std::nullopt;
    }
    try {
        return bounded_regex(std::make_shared<regex::automaton>(regex::compile_automaton(source)));
    } catch (const std::regex_error& failure) {
        error = compile_error(failure);
    } catch (const std::bad_alloc&) {
        error = "too large to compile (out of memory)";
    } catch (const std::exception& failure) {
        error = failure.what();
    } catch (...) {
        error = "cannot be compiled";
    }
    return std::nullopt;
}

match_verdict bounded_regex::match(std::string_view text, match_clock clock) const {
    // The backtracking search keeps positions in 32 bits.
    if (text.size() > static_cast<std::size_t>(std::numeric_limits<std::int32_t>::max()))
        return match_verdict::undecided;
    try {
        regex::budget meter{clock, std::chrono::milliseconds(regex_time_bound_ms)};
        bool whole = compiled_->has_backrefs ? regex::match_by_backtracking(*compiled_, text, meter)
                                             : regex::match_by_state_sets(*compiled_, text, meter);
        return whole ? match_verdict::match : match_verdict::no_match;
    } catch (...) {
        // Out of budget, or out of memory for the sets of states.
        return match_verdict::undecided;
    }
}

} // namespace torvad
