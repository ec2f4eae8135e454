// The standard library's own matcher recurses once per character and may take
// exponential time, so it cannot be run on a text a child chooses. The line is
// read by our own parser into the automaton std::regex would build; the
// matching is done by the bounded searches, which give the library's answer
// whenever they finish in time.
#include "matcher/bounded_regex.hpp"

#include <limits>
#include <new>

#include "matcher/scanner.hpp"
#include "matcher/search.hpp"

namespace torvad {

bounded_regex::bounded_regex(std::shared_ptr<const regex::automaton> compiled)
    : compiled_(std::move(compiled)) {}

std::optional<bounded_regex> bounded_regex::compile(std::string_view source, std::string& error) {
    try {
        return bounded_regex(std::make_shared<regex::automaton>(regex::compile_automaton(source)));
    } catch (const regex::bad_pattern& fault) {
        error = fault.reason;
        if (fault.at != std::string_view::npos)
            error += " at " + std::to_string(fault.at + 1);
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
