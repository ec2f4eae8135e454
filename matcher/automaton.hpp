// The automaton of one expression, in a flat form that the bounded searches
// walk without recursion.
#pragma once

#include <bitset>
#include <cstdint>
#include <string_view>
#include <vector>

namespace torvad::regex {

enum class node_kind : std::uint8_t {
    alternative,   // alt first, then next
    repeat,        // one more pass through alt, or leave by next; negated when lazy
    backref,       // the text of group index once more
    line_begin,    // ^
    line_end,      // $
    word_boundary, // \b, or \B when negated
    lookahead,     // the assertion that starts at alt holds here (fails here when negated)
    group_begin,   // group index opens
    group_end,     // group index closes
    match,         // one character of set index
    accept,
    unused, // a placeholder left where the reading made it, never reached
};

struct node {
    node_kind kind = node_kind::unused;
    bool negated = false;
    std::int32_t next = -1;
    std::int32_t alt = -1;
    // The group, the character set, or the repeat's slot among the repeats.
    std::uint32_t index = 0;
};

struct automaton {
    std::vector<node> nodes;
    std::vector<std::bitset<256>> sets;
    std::bitset<256> word; // the characters \b counts as part of a word
    std::int32_t start = 0;
    std::uint32_t groups = 0; // group 0, the whole match, included
    std::uint32_t repeats = 0;
    bool has_backrefs = false;
};

// Reads source as an ECMAScript expression, exactly as std::regex accepts
// it; throws bad_pattern (matcher/scanner.hpp), also when the automaton would
// have more than 100,000 nodes.
automaton compile_automaton(std::string_view source);

// \b as the library decides it: the character before counts only when the
// search, or the lookahead being searched, began before it.
inline bool at_word_boundary(const automaton& compiled, std::string_view text, std::size_t at,
                             std::size_t begin) {
    bool before = at != begin && compiled.word.test(static_cast<unsigned char>(text[at - 1]));
    bool after = at != text.size() && compiled.word.test(static_cast<unsigned char>(text[at]));
    return before != after;
}

} // namespace torvad::regex
