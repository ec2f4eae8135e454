// Whole-text matching by backtracking, step for step in the order of the
// standard library's own search, so that a back-reference sees the groups as
// that order leaves them. Its quirks are kept on purpose: a group is restored
// to its old bounds only when the pass that set them is undone, and a
// lookahead's groups stay set after the search backtracks past it.
#include <cstring>
#include <memory>

#include "matcher/search.hpp"

namespace torvad::regex {

namespace {

// The steps still to be undone, over all nested searches: 16 bytes each.
constexpr std::size_t max_frames = std::size_t{1} << 21;

struct capture {
    std::int32_t first = -1, second = -1;
    bool matched = false;
};

// The library enters a repeat at most twice at one position, which ends loops
// that consume nothing.
struct entries {
    std::int32_t at = -1;
    std::int32_t count = 0;
};

enum class step : std::uint8_t {
    visit,
    lazy_pass,
    restore_first,
    restore_group,
    restore_entries,
    restore_position,
    back_off, // a greedy run of one character set: go on one character shorter
};

struct frame {
    step what;
    bool matched;
    std::int32_t id;   // the node
    std::int32_t a, b; // what a restore puts back
};

// One search: the whole text, or one lookahead begun at begin.
struct search {
    std::int32_t begin = 0, at = 0;
    bool whole = true;
    std::vector<capture> groups;
    std::vector<entries> repeats;
    std::vector<frame> frames;
};

class backtracker {
  public:
    backtracker(const automaton& compiled, std::string_view text, budget& meter)
        : compiled_(compiled), text_(text), meter_(meter) {}

    bool match_whole() {
        search& top = search_at(0);
        top.groups.assign(compiled_.groups, capture{});
        top.repeats.assign(compiled_.repeats, entries{});
        return run(top, compiled_.start, 0);
    }

  private:
    search& search_at(unsigned depth);
    bool run(search& s, std::int32_t start, unsigned depth);
    bool visit(search& s, std::int32_t id, unsigned depth);
    bool holds(search& s, const node& assertion, unsigned depth);
    void pass_once_more(search& s, std::int32_t id);
    bool take_greedy_run(search& s, std::int32_t id);
    void back_off(search& s, const frame& f);
    void repeat_group(search& s, std::int32_t id);
    bool lookahead(search& s, const node& assertion, unsigned depth);

    void push(search& s, frame f) {
        if (s.frames.size() + outer_frames_ >= max_frames)
            throw out_of_budget{};
        s.frames.push_back(f);
    }
    void push_visit(search& s, std::int32_t id) {
        if (id >= 0)
            push(s, {step::visit, false, id, 0, 0});
    }

    const automaton& compiled_;
    std::string_view text_;
    budget& meter_;
    std::vector<std::unique_ptr<search>> searches_;
    std::size_t outer_frames_ = 0; // held by the searches a lookahead is nested in
};

search& backtracker::search_at(unsigned depth) {
    if (depth >= max_lookahead_depth)
        throw out_of_budget{};
    while (searches_.size() <= depth)
        searches_.push_back(std::make_unique<search>());
    return *searches_[depth];
}

bool backtracker::run(search& s, std::int32_t start, unsigned depth) {
    s.frames.clear();
    push_visit(s, start);
    while (!s.frames.empty()) {
        frame f = s.frames.back();
        s.frames.pop_back();
        meter_.charge(1);
        const node& n = compiled_.nodes[f.id];
        switch (f.what) {
        case step::visit:
            if (visit(s, f.id, depth))
                return true;
            break;
        case step::lazy_pass:
            pass_once_more(s, f.id);
            break;
        case step::restore_first:
            s.groups[n.index].first = f.a;
            break;
        case step::restore_group:
            s.groups[n.index] = {f.a, f.b, f.matched};
            break;
        case step::restore_entries:
            s.repeats[n.index] = {f.a, f.b};
            break;
        case step::restore_position:
            s.at = f.a;
            break;
        case step::back_off:
            back_off(s, f);
            break;
        }
    }
    return false;
}

// One node entered; what it leads to is pushed so that the top of the stack
// is what the library would try first. True at an accepting state.
bool backtracker::visit(search& s, std::int32_t id, unsigned depth) {
    const node& n = compiled_.nodes[id];
    switch (n.kind) {
    case node_kind::repeat:
        if (n.negated) {
            push(s, {step::lazy_pass, false, id, 0, 0});
            push_visit(s, n.next);
        } else if (!take_greedy_run(s, id)) {
            push_visit(s, n.next);
            pass_once_more(s, id);
        }
        break;
    case node_kind::alternative:
        push_visit(s, n.next);
        push_visit(s, n.alt);
        break;
    case node_kind::group_begin:
        push(s, {step::restore_first, false, id, s.groups[n.index].first, 0});
        s.groups[n.index].first = s.at;
        push_visit(s, n.next);
        break;
    case node_kind::group_end: {
        capture& group = s.groups[n.index];
        push(s, {step::restore_group, group.matched, id, group.first, group.second});
        group.second = s.at;
        group.matched = true;
        push_visit(s, n.next);
        break;
    }
    case node_kind::match:
        if (static_cast<std::size_t>(s.at) < text_.size() &&
            compiled_.sets[n.index].test(static_cast<unsigned char>(text_[s.at]))) {
            push(s, {step::restore_position, false, id, s.at, 0});
            ++s.at;
            push_visit(s, n.next);
        }
        break;
    case node_kind::backref:
        repeat_group(s, id);
        break;
    case node_kind::accept:
        return !s.whole || static_cast<std::size_t>(s.at) == text_.size();
    case node_kind::unused:
        break;
    default:
        if (holds(s, n, depth))
            push_visit(s, n.next);
    }
    return false;
}

bool backtracker::holds(search& s, const node& assertion, unsigned depth) {
    switch (assertion.kind) {
    case node_kind::line_begin:
        return s.at == s.begin;
    case node_kind::line_end:
        return static_cast<std::size_t>(s.at) == text_.size();
    case node_kind::word_boundary:
        return at_word_boundary(compiled_, text_, s.at, s.begin) != assertion.negated;
    case node_kind::lookahead:
        return lookahead(s, assertion, depth) != assertion.negated;
    default:
        return true;
    }
}

void backtracker::pass_once_more(search& s, std::int32_t id) {
    const node& n = compiled_.nodes[id];
    entries& entered = s.repeats[n.index];
    bool again_here = entered.count != 0 && entered.at == s.at;
    if (again_here && entered.count >= 2)
        return;
    push(s, {step::restore_entries, false, id, entered.at, entered.count});
    if (again_here)
        ++entered.count;
    else
        entered = {s.at, 1};
    push_visit(s, n.alt);
}

// A greedy repeat of one character set, such as .* over a long argument,
// would cost five frames per character. Its passes touch no group, so the
// whole run is taken at once, and the positions the library would go back to
// are tried from the longest down, each with the repeat's entries as that
// pass left them. The shortest, zero passes, is what the frames pushed here
// try last: the repeat's way out at the position where it began.
bool backtracker::take_greedy_run(search& s, std::int32_t id) {
    const node& n = compiled_.nodes[id];
    const node& body = compiled_.nodes[n.alt];
    if (body.kind != node_kind::match || body.next != id)
        return false;
    const entries& entered = s.repeats[n.index];
    if (entered.count != 0 && entered.at == s.at)
        return false; // a pass again at one position: the general way keeps count
    const auto& set = compiled_.sets[body.index];
    std::int32_t end = s.at;
    while (static_cast<std::size_t>(end) < text_.size() &&
           set.test(static_cast<unsigned char>(text_[end])))
        ++end;
    meter_.charge((end - s.at) / 64);
    if (end == s.at)
        return false;
    push_visit(s, n.next);
    push(s, {step::restore_entries, false, id, entered.at, entered.count});
    push(s, {step::restore_position, false, id, s.at, 0});
    push(s, {step::back_off, false, id, s.at, end});
    return true;
}

// Leaves the repeat after the passes up to f.b, with one pass fewer to try next.
void backtracker::back_off(search& s, const frame& f) {
    const node& n = compiled_.nodes[f.id];
    if (f.b - 1 > f.a)
        push(s, {step::back_off, false, f.id, f.a, f.b - 1});
    s.at = f.b;
    s.repeats[n.index] = {f.b - 1, 1};
    push_visit(s, n.next);
}

// A back-reference to a group that has not matched fails, as in the library.
void backtracker::repeat_group(search& s, std::int32_t id) {
    const node& n = compiled_.nodes[id];
    const capture& group = s.groups[n.index];
    if (!group.matched || group.first < 0 || group.first > group.second)
        return;
    std::int32_t length = group.second - group.first;
    meter_.charge(length / 64);
    if (text_.size() - s.at < static_cast<std::size_t>(length) ||
        std::memcmp(text_.data() + group.first, text_.data() + s.at, length) != 0)
        return;
    if (length > 0) {
        push(s, {step::restore_position, false, id, s.at, 0});
        s.at += length;
    }
    push_visit(s, n.next);
}

// The library searches a lookahead as a new search begun here, with fresh
// repeat counts and a copy of the groups; the groups it matched are kept.
bool backtracker::lookahead(search& s, const node& assertion, unsigned depth) {
    search& inner = search_at(depth + 1);
    inner.begin = inner.at = s.at;
    inner.whole = false;
    inner.groups = s.groups;
    inner.repeats.assign(compiled_.repeats, entries{});
    meter_.charge(static_cast<std::int64_t>(inner.groups.size() + inner.repeats.size()));
    outer_frames_ += s.frames.size();
    bool found = run(inner, assertion.alt, depth + 1);
    outer_frames_ -= s.frames.size();
    if (found)
        for (std::size_t i = 0; i < s.groups.size(); ++i)
            if (inner.groups[i].matched)
                s.groups[i] = inner.groups[i];
    return found;
}

} // namespace

bool match_by_backtracking(const automaton& compiled, std::string_view text, budget& meter) {
    return backtracker(compiled, text, meter).match_whole();
}

} // namespace torvad::regex
