// The standard library compiles the expression, which keeps its syntax and its
// automaton exactly those of std::regex; only the walk over that automaton is
// ours. Its compiler and states are library internals, read here and nowhere else.
#include "matcher/automaton.hpp"

#include <array>
#include <map>
#include <regex>

static_assert(_GLIBCXX_RELEASE == 12, "the automaton is read as libstdc++ 12 lays it out");

namespace torvad::regex {

namespace {

using library_traits = std::regex_traits<char>;
using library_automaton = std::__detail::_NFA<library_traits>;
using library_state = library_automaton::_StateT;

// Character sets are kept once each: most expressions repeat a few of them.
class set_table {
  public:
    explicit set_table(std::vector<std::bitset<256>>& sets) : sets_(sets) {}

    std::uint32_t index_of(const library_state& state) {
        std::bitset<256> set;
        std::array<std::uint64_t, 4> key{};
        for (unsigned c = 0; c < 256; ++c)
            if (state._M_matches(static_cast<char>(c))) {
                set.set(c);
                key[c / 64] |= std::uint64_t{1} << (c % 64);
            }
        auto [place, added] = known_.emplace(key, static_cast<std::uint32_t>(sets_.size()));
        if (added)
            sets_.push_back(set);
        return place->second;
    }

  private:
    std::vector<std::bitset<256>>& sets_;
    std::map<std::array<std::uint64_t, 4>, std::uint32_t> known_;
};

node translate(const library_state& state, set_table& sets, automaton& into) {
    using namespace std::__detail;
    node out;
    out.next = static_cast<std::int32_t>(state._M_next);
    switch (state._M_opcode()) {
    case _S_opcode_alternative:
        out.kind = node_kind::alternative;
        out.alt = static_cast<std::int32_t>(state._M_alt);
        break;
    case _S_opcode_repeat:
        out.kind = node_kind::repeat;
        out.alt = static_cast<std::int32_t>(state._M_alt);
        out.negated = state._M_neg;
        out.index = into.repeats++;
        break;
    case _S_opcode_subexpr_lookahead:
        out.kind = node_kind::lookahead;
        out.alt = static_cast<std::int32_t>(state._M_alt);
        out.negated = state._M_neg;
        break;
    case _S_opcode_word_boundary:
        out.kind = node_kind::word_boundary;
        out.negated = state._M_neg;
        break;
    case _S_opcode_backref:
        out.kind = node_kind::backref;
        out.index = static_cast<std::uint32_t>(state._M_backref_index);
        into.has_backrefs = true;
        break;
    case _S_opcode_subexpr_begin:
    case _S_opcode_subexpr_end:
        out.kind = state._M_opcode() == _S_opcode_subexpr_begin ? node_kind::group_begin
                                                                : node_kind::group_end;
        out.index = static_cast<std::uint32_t>(state._M_subexpr);
        break;
    case _S_opcode_line_begin_assertion:
        out.kind = node_kind::line_begin;
        break;
    case _S_opcode_line_end_assertion:
        out.kind = node_kind::line_end;
        break;
    case _S_opcode_match:
        out.kind = node_kind::match;
        out.index = sets.index_of(state);
        break;
    case _S_opcode_accept:
        out.kind = node_kind::accept;
        break;
    default:
        break;
    }
    return out;
}

// The word characters as the library's search asks its traits for them.
std::bitset<256> word_characters(const library_traits& traits) {
    static const char name[] = "w";
    auto word_class = traits.lookup_classname(name, name + 1);
    std::bitset<256> word;
    for (unsigned c = 0; c < 256; ++c)
        word[c] = traits.isctype(static_cast<char>(c), word_class);
    return word;
}

} // namespace

bool has_oversized_number(std::string_view source) {
    constexpr std::size_t safe_digits = 18;
    std::size_t digits = 0;
    for (std::size_t i = 0; i < source.size(); ++i) {
        digits = source[i] >= '0' && source[i] <= '9' ? digits + 1 : 0;
        // Digits behind a backslash, a brace or a comma may be read as a number.
        if (digits > safe_digits && i >= digits &&
            std::string_view("\\{,").find(source[i - digits]) != std::string_view::npos)
            return true;
    }
    return false;
}

automaton compile_automaton(std::string_view source) {
    // The same compiler, locale and flag as std::regex(source, std::regex::ECMAScript).
    static const char empty[] = "";
    const char* first = source.empty() ? empty : source.data();
    std::__detail::_Compiler<library_traits> compiler(first, first + source.size(), std::locale(),
                                                      std::regex_constants::ECMAScript);
    auto library = compiler._M_get_nfa();
    automaton compiled;
    set_table sets(compiled.sets);
    compiled.nodes.reserve(library->size());
    for (const auto& state : *library)
        compiled.nodes.push_back(translate(state, sets, compiled));
    compiled.word = word_characters(library->_M_traits);
    compiled.start = static_cast<std::int32_t>(library->_M_start());
    compiled.groups = static_cast<std::uint32_t>(library->_M_sub_count());
    return compiled;
}

} // namespace torvad::regex
