// Reads a line into its automaton, node for node as std::regex's own compiler
// built it when it compiled torvad's lines: the same nodes in the same order,
// the placeholders among them included, so that the searches, which follow
// that order, give the same answers. The grammar's nesting is kept in frames
// on the heap, not on the call stack, so a line may nest as deep as the
// limit on nodes allows.
#include <optional>
#include <unordered_map>
#include <vector>

#include "matcher/automaton.hpp"
#include "matcher/char_classes.hpp"
#include "matcher/scanner.hpp"

namespace torvad::regex {

namespace {

constexpr std::size_t max_nodes = 100000;
constexpr std::size_t max_number_digits = 18;
const char* const too_large = "too large to compile (more than 100000 automaton states)";

// A piece of the automaton: enter at start, leave by end's next.
struct piece {
    std::int32_t start, end;
};
piece single(std::int32_t id) {
    return {id, id};
}

// A group or lookahead being read, or the whole line.
struct frame {
    enum class kind : std::uint8_t { whole, group, plain_group, lookahead } what;
    bool negated = false;
    std::size_t at = 0;       // of the opening token
    std::int32_t opened = -1; // the group's first node
    std::vector<piece> terms; // of the alternative being read
    std::optional<piece> alternatives;
};

class parser {
  public:
    explicit parser(std::string_view source) : tokens_(source) {}
    automaton run();

  private:
    std::int32_t add(node_kind kind, std::int32_t next = -1, std::int32_t alt = -1,
                     std::uint32_t index = 0, bool negated = false);
    std::int32_t add_set(const char_set& members);
    void link(piece& to, std::int32_t id) { link(to, single(id)); }
    void link(piece& to, piece from);
    bool take(token kind);

    void open(frame::kind what, std::int32_t opened);
    piece end_alternative(frame& f);
    void close_frame();
    piece atom();
    char_set bracket();
    std::int32_t backref();
    void quantifiers(piece& term);
    void repeat_counted(piece& term, std::size_t at);
    piece copy(piece original);
    automaton finish();

    scanner tokens_;
    std::vector<node> nodes_;
    std::vector<char_set> sets_; // one per node that matches, copies sharing it
    std::vector<frame> frames_;
    std::vector<bool> open_groups_;
    std::uint32_t groups_ = 0;
    // The copy being made: for each node, the copy of it and the copy it belongs to.
    std::vector<std::int32_t> copy_of_, copy_mark_;
    std::int32_t copies_ = 0;
};

std::int32_t parser::add(node_kind kind, std::int32_t next, std::int32_t alt, std::uint32_t index,
                         bool negated) {
    if (nodes_.size() >= max_nodes)
        throw bad_pattern{too_large, std::string_view::npos};
    nodes_.push_back({kind, negated, next, alt, index});
    return static_cast<std::int32_t>(nodes_.size() - 1);
}

std::int32_t parser::add_set(const char_set& members) {
    sets_.push_back(members);
    return add(node_kind::match, -1, -1, static_cast<std::uint32_t>(sets_.size() - 1));
}

void parser::link(piece& to, piece from) {
    nodes_[to.end].next = from.start;
    to.end = from.end;
}

bool parser::take(token kind) {
    if (tokens_.kind() != kind)
        return false;
    tokens_.advance();
    return true;
}

automaton parser::run() {
    // The whole line is group 0.
    piece whole = single(add(node_kind::group_begin));
    open_groups_.push_back(true);
    groups_ = 1;
    frames_.push_back({frame::kind::whole, false, 0, 0, {}, {}});
    for (;;) {
        frame& top = frames_.back();
        std::size_t at = tokens_.at();
        switch (tokens_.kind()) {
        case token::line_begin:
        case token::line_end:
        case token::word_boundary: {
            node_kind kind = tokens_.kind() == token::line_begin ? node_kind::line_begin
                             : tokens_.kind() == token::line_end ? node_kind::line_end
                                                                 : node_kind::word_boundary;
            top.terms.push_back(single(add(kind, -1, -1, 0, tokens_.negated())));
            tokens_.advance();
            continue;
        }
        case token::lookahead:
            open(frame::kind::lookahead, -1);
            continue;
        case token::group: {
            std::int32_t opened = add(node_kind::group_begin, -1, -1, groups_++);
            open_groups_.push_back(true);
            open(frame::kind::group, opened);
            continue;
        }
        case token::plain_group:
            open(frame::kind::plain_group, add(node_kind::unused));
            continue;
        case token::any:
        case token::character:
        case token::backref:
        case token::quoted_class:
        case token::bracket: {
            piece term = atom();
            quantifiers(term);
            frames_.back().terms.push_back(term);
            continue;
        }
        default:
            break;
        }
        // No term starts here: the alternative ends.
        piece alternative = end_alternative(top);
        if (top.alternatives) {
            std::int32_t join = add(node_kind::unused);
            link(*top.alternatives, join);
            link(alternative, join);
            top.alternatives = piece{
                add(node_kind::alternative, alternative.start, top.alternatives->start), join};
        } else {
            top.alternatives = alternative;
        }
        if (take(token::alternation))
            continue;
        if (top.what == frame::kind::whole) {
            if (tokens_.kind() != token::end)
                throw bad_pattern{
                    tokens_.kind() == token::group_end ? "unmatched )" : "nothing to repeat", at};
            link(whole, *top.alternatives);
            link(whole, add(node_kind::group_end));
            link(whole, add(node_kind::accept));
            return finish();
        }
        if (tokens_.kind() != token::group_end)
            throw bad_pattern{tokens_.kind() == token::end ? "unmatched (" : "nothing to repeat",
                              tokens_.kind() == token::end ? top.at : at};
        tokens_.advance();
        close_frame();
    }
}

void parser::open(frame::kind what, std::int32_t opened) {
    frames_.push_back({what, tokens_.negated(), tokens_.at(), opened, {}, {}});
    tokens_.advance();
}

// The terms in a row, and a placeholder after the last.
piece parser::end_alternative(frame& f) {
    std::int32_t last = add(node_kind::unused);
    if (f.terms.empty())
        return single(last);
    piece row = f.terms.front();
    for (std::size_t i = 1; i < f.terms.size(); ++i)
        link(row, f.terms[i]);
    link(row, last);
    f.terms.clear();
    return row;
}

// The group's ) is read: the group becomes a term of the one around it.
void parser::close_frame() {
    frame done = std::move(frames_.back());
    frames_.pop_back();
    piece body = *done.alternatives;
    if (done.what == frame::kind::lookahead) {
        link(body, add(node_kind::accept));
        std::int32_t id = add(node_kind::lookahead, -1, body.start, 0, done.negated);
        frames_.back().terms.push_back(single(id));
        return;
    }
    piece term = single(done.opened);
    link(term, body);
    if (done.what == frame::kind::group) {
        std::uint32_t group = nodes_[done.opened].index;
        open_groups_[group] = false;
        link(term, add(node_kind::group_end, -1, -1, group));
    }
    quantifiers(term);
    frames_.back().terms.push_back(term);
}

piece parser::atom() {
    std::int32_t id = -1;
    switch (tokens_.kind()) {
    case token::any:
        id = add_set(~(char_set().set('\n').set('\r')));
        break;
    case token::character:
        id = add_set(char_set().set(static_cast<unsigned char>(tokens_.character())));
        break;
    case token::quoted_class: {
        char letter = tokens_.character();
        char_set members = *named_class(std::string_view(&letter, 1));
        id = add_set(letter >= 'A' && letter <= 'Z' ? ~members : members);
        break;
    }
    case token::backref:
        id = backref();
        break;
    default: // token::bracket
        return single(add_set(bracket()));
    }
    tokens_.advance();
    return single(id);
}

std::int32_t parser::backref() {
    std::int32_t number = 0;
    for (char digit : tokens_.text()) // eighteen digits at most: see too_long_number
        number = static_cast<std::int32_t>(static_cast<std::uint32_t>(number) * 10u +
                                           static_cast<std::uint32_t>(digit - '0'));
    if (number < 0 || static_cast<std::uint32_t>(number) >= groups_)
        throw bad_pattern{"back-reference to a missing group", tokens_.at()};
    if (open_groups_[number])
        throw bad_pattern{"back-reference inside its own group", tokens_.at()};
    return add(node_kind::backref, -1, -1, static_cast<std::uint32_t>(number));
}

std::int64_t count_value(std::string_view digits) {
    std::int64_t value = 0;
    for (char digit : digits)
        value = value * 10 + (digit - '0');
    // Kept to 32 bits, as a count has always been.
    return static_cast<std::int32_t>(static_cast<std::uint32_t>(value & 0xffffffff));
}

// [...]: a range's ends compare as signed chars, so [a-\xe9] is refused and
// [\x80-\xff] holds the upper half; a - is literal first, last, or right
// after a range.
char_set parser::bracket() {
    const std::size_t opened = tokens_.at();
    const bool negated = tokens_.negated();
    char_set members;
    enum class last { none, character, set } previous = last::none;
    char pending = 0;
    auto push_character = [&](char c) {
        if (previous == last::character)
            members.set(static_cast<unsigned char>(pending));
        previous = last::character;
        pending = c;
    };
    auto push_set = [&](const char_set& added) {
        if (previous == last::character)
            members.set(static_cast<unsigned char>(pending));
        previous = last::set;
        members |= added;
    };
    auto add_range = [&](char first, char last_char) {
        if (first > last_char)
            throw bad_pattern{"bad range in brackets", tokens_.at()};
        for (int c = first; c <= last_char; ++c)
            members.set(static_cast<unsigned char>(c));
        previous = last::none;
    };
    tokens_.advance();
    if (tokens_.kind() == token::character || tokens_.kind() == token::dash) {
        previous = last::character;
        pending = tokens_.kind() == token::dash ? '-' : tokens_.character();
        tokens_.advance();
    }
    for (;;) {
        const std::size_t at = tokens_.at();
        switch (tokens_.kind()) {
        case token::bracket_end:
            tokens_.advance();
            if (previous == last::character)
                members.set(static_cast<unsigned char>(pending));
            return negated ? ~members : members;
        case token::collating: {
            auto element = collating_element(tokens_.text());
            if (!element)
                throw bad_pattern{"unknown collating element", at};
            members.set(static_cast<unsigned char>(*element));
            push_character(*element);
            break;
        }
        case token::equivalence: {
            auto element = collating_element(tokens_.text());
            if (!element)
                throw bad_pattern{"unknown collating element", at};
            push_set(equivalents(*element));
            break;
        }
        case token::class_name:
        case token::quoted_class: {
            char letter = tokens_.character();
            bool quoted = tokens_.kind() == token::quoted_class;
            auto named = named_class(quoted ? std::string_view(&letter, 1) : tokens_.text());
            if (!named)
                throw bad_pattern{"unknown class name", at};
            push_set(quoted && letter >= 'A' && letter <= 'Z' ? ~*named : *named);
            break;
        }
        case token::character:
            push_character(tokens_.character());
            break;
        case token::dash:
            tokens_.advance();
            if (tokens_.kind() == token::bracket_end) {
                push_character('-');
                continue;
            }
            if (previous == last::set)
                throw bad_pattern{"range from a class in brackets", at};
            if (previous == last::none) {
                push_character('-');
                continue;
            }
            if (tokens_.kind() == token::character || tokens_.kind() == token::dash)
                add_range(pending, tokens_.kind() == token::dash ? '-' : tokens_.character());
            else
                throw bad_pattern{"bad range in brackets", at};
            break;
        case token::end:
            throw bad_pattern{"unmatched [", opened};
        default:
            throw bad_pattern{"not allowed in brackets", at};
        }
        tokens_.advance();
    }
}

// Each repeat is its own node; a counted one is made of copies of the term.
void parser::quantifiers(piece& term) {
    for (;;) {
        token kind = tokens_.kind();
        std::size_t at = tokens_.at();
        if (kind == token::brace) {
            repeat_counted(term, at);
            continue;
        }
        if (kind != token::star && kind != token::plus && kind != token::optional)
            return;
        tokens_.advance();
        bool lazy = take(token::optional);
        if (kind == token::star) {
            std::int32_t loop = add(node_kind::repeat, -1, term.start, 0, lazy);
            link(term, loop);
            term = {loop, loop};
        } else if (kind == token::plus) {
            link(term, add(node_kind::repeat, -1, term.start, 0, lazy));
        } else {
            std::int32_t after = add(node_kind::unused);
            std::int32_t choice = add(node_kind::repeat, -1, term.start, 0, lazy);
            link(term, after);
            term = {choice, after};
            nodes_[choice].next = after;
        }
    }
}

// {n}, {n,} and {n,m}: n copies, then a loop over one more copy, or m - n
// copies each of which may be left out.
void parser::repeat_counted(piece& term, std::size_t at) {
    tokens_.advance();
    if (tokens_.kind() != token::count)
        throw bad_pattern{"bad repeat count", at};
    piece original = term;
    piece result = single(add(node_kind::unused));
    std::int64_t least = count_value(tokens_.text());
    tokens_.advance();
    bool unbounded = false;
    std::int64_t optional_copies = 0;
    if (take(token::comma)) {
        if (tokens_.kind() == token::count) {
            optional_copies = count_value(tokens_.text()) - least;
            tokens_.advance();
        } else {
            unbounded = true;
        }
    }
    if (!take(token::brace_end))
        throw bad_pattern{"bad repeat count", at};
    bool lazy = take(token::optional);
    for (std::int64_t i = 0; i < least; ++i)
        link(result, copy(original));
    if (unbounded) {
        piece body = copy(original);
        std::int32_t loop = add(node_kind::repeat, -1, body.start, 0, lazy);
        link(body, loop);
        link(result, loop);
    } else {
        if (optional_copies < 0)
            throw bad_pattern{"bad repeat count", at};
        std::int32_t after = add(node_kind::unused);
        for (std::int64_t i = 0; i < optional_copies; ++i) {
            piece body = copy(original);
            // Taking the copy is tried first, or last when lazy.
            std::int32_t choice = add(node_kind::repeat, after, body.start, 0, lazy);
            link(result, piece{choice, body.end});
        }
        link(result, after);
    }
    term = result;
}

// Copies the nodes reachable from original.start, not past original.end, in
// the order of a depth-first walk that tries a node's alt before its next.
// A node put on the walk's stack twice is copied twice; the links are
// redirected to the copy made last, and the earlier copy stays unreached.
piece parser::copy(piece original) {
    std::int32_t mark = ++copies_;
    copy_of_.resize(nodes_.size(), -1);
    copy_mark_.resize(nodes_.size(), 0);
    auto copied = [&](std::int32_t id) {
        return copy_mark_[id] == mark;
    };
    std::vector<std::int32_t> stack{original.start}, reached;
    while (!stack.empty()) {
        std::int32_t id = stack.back();
        stack.pop_back();
        node twin = nodes_[id];
        nodes_.push_back(twin);
        if (nodes_.size() > max_nodes)
            throw bad_pattern{too_large, std::string_view::npos};
        if (!copied(id))
            reached.push_back(id);
        copy_mark_[id] = mark;
        copy_of_[id] = static_cast<std::int32_t>(nodes_.size() - 1);
        if (twin.alt >= 0 && !copied(twin.alt))
            stack.push_back(twin.alt);
        if (id != original.end && twin.next >= 0 && !copied(twin.next))
            stack.push_back(twin.next);
    }
    for (std::int32_t id : reached) {
        node& twin = nodes_[copy_of_[id]];
        if (twin.next >= 0 && copied(twin.next))
            twin.next = copy_of_[twin.next];
        if (twin.alt >= 0)
            twin.alt = copy_of_[twin.alt];
    }
    return {copy_of_[original.start], copy_of_[original.end]};
}

// Placeholders are skipped by every link, but keep their places; sets are
// kept once each, numbered in the order of the nodes, as are the repeats.
automaton parser::finish() {
    automaton out;
    auto past_placeholders = [&](std::int32_t id) {
        while (id >= 0 && nodes_[id].kind == node_kind::unused)
            id = nodes_[id].next;
        return id;
    };
    for (node& n : nodes_) {
        n.next = past_placeholders(n.next);
        n.alt = past_placeholders(n.alt);
    }
    std::unordered_map<char_set, std::uint32_t> known;
    for (node& n : nodes_) {
        if (n.kind == node_kind::match) {
            auto [place, added] =
                known.emplace(sets_[n.index], static_cast<std::uint32_t>(out.sets.size()));
            if (added)
                out.sets.push_back(sets_[n.index]);
            n.index = place->second;
        } else if (n.kind == node_kind::repeat) {
            n.index = out.repeats++;
        } else if (n.kind == node_kind::backref) {
            out.has_backrefs = true;
        }
    }
    out.nodes = std::move(nodes_);
    out.word = *named_class("w");
    out.groups = groups_;
    return out;
}

// A run of more than eighteen digits right after a backslash, a brace or a
// comma is refused wherever it stands, even where it would be read as
// characters: that has always been the rule, so which lines load stays as it
// was. Every number read is then far from overflowing 64 bits.
std::size_t too_long_number(std::string_view source) {
    std::size_t digits = 0;
    for (std::size_t i = 0; i < source.size(); ++i) {
        digits = source[i] >= '0' && source[i] <= '9' ? digits + 1 : 0;
        if (digits > max_number_digits && i >= digits &&
            std::string_view("\\{,").find(source[i - digits]) != std::string_view::npos)
            return i - digits + 1;
    }
    return std::string_view::npos;
}

} // namespace

automaton compile_automaton(std::string_view source) {
    if (std::size_t at = too_long_number(source); at != std::string_view::npos)
        throw bad_pattern{"a repeat count or back-reference number is too large", at};
    return parser(source).run();
}

} // namespace torvad::regex
