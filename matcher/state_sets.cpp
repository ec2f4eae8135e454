// Whole-text matching by sets of live states. Without back-references the
// library's answer depends only on whether some path through the automaton
// consumes the whole text, which this finds in any visiting order.
#include <memory>

#include "matcher/search.hpp"

namespace torvad::regex {

namespace {

class state_sets {
  public:
    state_sets(const automaton& compiled, std::string_view text, budget& meter)
        : compiled_(compiled), text_(text), meter_(meter) {}

    // Whether a path from start, entered at begin, reaches an accepting state:
    // at the end of the text when whole, anywhere for a lookahead.
    bool run(std::int32_t start, std::size_t begin, bool whole, unsigned depth);

  private:
    // The working sets of one search; a lookahead nested in it has its own.
    struct level {
        std::vector<std::uint32_t> seen; // the closure that last visited each state
        std::vector<std::int32_t> pending, waiting, seeds;
    };

    level& level_at(unsigned depth);
    bool close(level& sets, std::size_t at, std::size_t begin, bool whole, unsigned depth);
    bool holds(const node& assertion, std::size_t at, std::size_t begin, unsigned depth);

    const automaton& compiled_;
    std::string_view text_;
    budget& meter_;
    std::vector<std::unique_ptr<level>> levels_;
    // Each closure marks with a new number; the budget ends a search long
    // before this could wrap.
    std::uint32_t closures_ = 0;
};

state_sets::level& state_sets::level_at(unsigned depth) {
    if (depth >= max_lookahead_depth)
        throw out_of_budget{};
    while (levels_.size() <= depth) {
        levels_.push_back(std::make_unique<level>());
        levels_.back()->seen.assign(compiled_.nodes.size(), 0);
        meter_.charge(static_cast<std::int64_t>(compiled_.nodes.size() / 64));
    }
    return *levels_[depth];
}

bool state_sets::run(std::int32_t start, std::size_t begin, bool whole, unsigned depth) {
    level& sets = level_at(depth);
    sets.seeds.assign(1, start);
    for (std::size_t at = begin;; ++at) {
        if (close(sets, at, begin, whole, depth))
            return true;
        if (at == text_.size() || sets.waiting.empty())
            return false;
        auto c = static_cast<unsigned char>(text_[at]);
        sets.seeds.clear();
        for (std::int32_t id : sets.waiting) {
            const node& n = compiled_.nodes[id];
            if (compiled_.sets[n.index].test(c))
                sets.seeds.push_back(n.next);
        }
        meter_.charge(static_cast<std::int64_t>(sets.waiting.size()));
    }
}

// Follows every edge that consumes nothing from the seeds, collecting in
// waiting the states that consume the character at at.
bool state_sets::close(level& sets, std::size_t at, std::size_t begin, bool whole, unsigned depth) {
    const std::uint32_t mark = ++closures_;
    sets.waiting.clear();
    sets.pending.clear();
    sets.pending.swap(sets.seeds);
    while (!sets.pending.empty()) {
        std::int32_t id = sets.pending.back();
        sets.pending.pop_back();
        meter_.charge(1);
        if (id < 0 || sets.seen[id] == mark)
            continue;
        sets.seen[id] = mark;
        const node& n = compiled_.nodes[id];
        switch (n.kind) {
        case node_kind::alternative:
        case node_kind::repeat:
            sets.pending.push_back(n.next);
            sets.pending.push_back(n.alt);
            break;
        case node_kind::match:
            if (at < text_.size())
                sets.waiting.push_back(id);
            break;
        case node_kind::accept:
            if (!whole || at == text_.size())
                return true;
            break;
        case node_kind::backref:
        case node_kind::unused:
            break;
        default:
            if (holds(n, at, begin, depth))
                sets.pending.push_back(n.next);
        }
    }
    return false;
}

bool state_sets::holds(const node& assertion, std::size_t at, std::size_t begin, unsigned depth) {
    switch (assertion.kind) {
    case node_kind::line_begin:
        return at == begin;
    case node_kind::line_end:
        return at == text_.size();
    case node_kind::word_boundary:
        return at_word_boundary(compiled_, text_, at, begin) != assertion.negated;
    case node_kind::lookahead:
        // The library searches a lookahead as a new search begun here.
        return run(assertion.alt, at, false, depth + 1) != assertion.negated;
    default:
        return true; // a group's bounds, which only backtracking records
    }
}

} // namespace

bool match_by_state_sets(const automaton& compiled, std::string_view text, budget& meter) {
    state_sets search(compiled, text, meter);
    return search.run(compiled.start, 0, true, 0);
}

} // namespace torvad::regex
