// The two whole-text searches over an automaton, and the budget that bounds
// each of them in time. Neither recurses, but once per nested lookahead.
#pragma once

#include <chrono>
#include <cstdint>
#include <string_view>

#include "matcher/automaton.hpp"
#include "matcher/bounded_regex.hpp"

namespace torvad::regex {

struct out_of_budget {};

// Work is charged in units of one state visited or one step undone; the
// caller's clock is read only every few thousand units, so the bound is
// overrun by at most that much work.
class budget {
  public:
    budget(match_clock clock, std::chrono::nanoseconds allowed)
        : clock_(clock), deadline_(clock() + allowed.count()) {}

    // Throws out_of_budget once the time allowed has passed.
    void charge(std::int64_t units) {
        left_ -= units;
        if (left_ < 0)
            check();
    }

  private:
    static constexpr std::int64_t units_between_checks = 4096;

    void check() {
        if (clock_() >= deadline_)
            throw out_of_budget{};
        left_ = units_between_checks;
    }

    match_clock clock_;
    std::int64_t deadline_;
    std::int64_t left_ = units_between_checks;
};

// Lookaheads are searched by nested calls; deeper nests give up.
constexpr unsigned max_lookahead_depth = 32;

// Keeps the set of live states per text position: each state is visited at
// most once per position, so the work is at most text length times automaton
// size, and as much again for each lookahead searched. Only for automata
// without back-references. Throws out_of_budget.
bool match_by_state_sets(const automaton& compiled, std::string_view text, budget& meter);

// Backtracks in the order of the standard library's own search, which decides
// what back-references see; the steps still to be undone are kept on the heap.
// Texts must be shorter than 2^31 bytes. Throws out_of_budget.
bool match_by_backtracking(const automaton& compiled, std::string_view text, budget& meter);

} // namespace torvad::regex
