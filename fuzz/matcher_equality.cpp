// The parser's automaton against the one libstdc++ 12's own std::regex
// compiler builds, node for node, for every line given: the regex fuzzer's
// inputs (their first line, cut as the fuzzer cuts it), the items of its
// dictionary, and a set of lines made here that try every byte in every
// place of the grammar. The library's automaton is read as torvad read it
// before it had a parser, from the compiler's private state: this builds
// only with libstdc++ 12.
//   matcher_equality FILE-OR-FOLDER...
#include <array>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "fuzz/shown.hpp"
#include "matcher/automaton.hpp"
#include "matcher/scanner.hpp"

static_assert(_GLIBCXX_RELEASE == 12,
              "the library's automaton is read as libstdc++ 12 lays it out");

namespace {

using namespace torvad::regex;
using library_traits = std::regex_traits<char>;
using library_state = std::__detail::_NFA<library_traits>::_StateT;

constexpr std::size_t max_pattern = 64; // as fuzz_regex cuts its inputs

// --- the library's automaton, as torvad used to read it -----------------------

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

std::bitset<256> word_characters(const library_traits& traits) {
    static const char name[] = "w";
    auto word_class = traits.lookup_classname(name, name + 1);
    std::bitset<256> word;
    for (unsigned c = 0; c < 256; ++c)
        word[c] = traits.isctype(static_cast<char>(c), word_class);
    return word;
}

// The refusal that kept numbers too long for the library's compiler from it.
bool has_oversized_number(std::string_view source) {
    constexpr std::size_t safe_digits = 18;
    std::size_t digits = 0;
    for (std::size_t i = 0; i < source.size(); ++i) {
        digits = source[i] >= '0' && source[i] <= '9' ? digits + 1 : 0;
        if (digits > safe_digits && i >= digits &&
            std::string_view("\\{,").find(source[i - digits]) != std::string_view::npos)
            return true;
    }
    return false;
}

// None when the line is refused. source is a std::string: the library's
// scanner reads the byte after a final (.
std::optional<automaton> library_automaton(const std::string& source) {
    if (has_oversized_number(source))
        return std::nullopt;
    try {
        const char* first = source.c_str();
        std::__detail::_Compiler<library_traits> compiler(
            first, first + source.size(), std::locale(), std::regex_constants::ECMAScript);
        auto library = compiler._M_get_nfa();
        automaton compiled;
        set_table sets(compiled.sets);
        for (const auto& state : *library)
            compiled.nodes.push_back(translate(state, sets, compiled));
        compiled.word = word_characters(library->_M_traits);
        compiled.start = static_cast<std::int32_t>(library->_M_start());
        compiled.groups = static_cast<std::uint32_t>(library->_M_sub_count());
        return compiled;
    } catch (const std::regex_error&) {
        return std::nullopt;
    }
}

// --- the comparison ------------------------------------------------------------

std::optional<automaton> parsed_automaton(const std::string& source) {
    try {
        return compile_automaton(source);
    } catch (const bad_pattern&) {
        return std::nullopt;
    }
}

bool same_node(const node& a, const node& b) {
    return a.kind == b.kind && a.negated == b.negated && a.next == b.next && a.alt == b.alt &&
           a.index == b.index;
}

// Empty when the two agree, else what differs first.
std::string difference(const std::optional<automaton>& ours,
                       const std::optional<automaton>& library) {
    if (ours.has_value() != library.has_value())
        return ours ? "the library refuses it, the parser accepts it"
                    : "the parser refuses it, the library accepts it";
    if (!ours)
        return {};
    if (ours->nodes.size() != library->nodes.size())
        return "node counts " + std::to_string(ours->nodes.size()) + " and " +
               std::to_string(library->nodes.size());
    for (std::size_t i = 0; i < ours->nodes.size(); ++i)
        if (!same_node(ours->nodes[i], library->nodes[i]))
            return "node " + std::to_string(i);
    if (ours->sets != library->sets)
        return "the sets";
    if (ours->word != library->word || ours->start != library->start ||
        ours->groups != library->groups || ours->repeats != library->repeats ||
        ours->has_backrefs != library->has_backrefs)
        return "word set, start, groups, repeats or back-references";
    return {};
}

struct tally {
    std::size_t compared = 0, valid = 0, different = 0;

    void compare(const std::string& line) {
        ++compared;
        auto ours = parsed_automaton(line);
        auto library = library_automaton(line);
        valid += ours.has_value() && library.has_value();
        std::string differs = difference(ours, library);
        if (!differs.empty() && ++different <= 20)
            std::printf("differs on '%s': %s\n", shown(line).c_str(), differs.c_str());
    }
};

// --- the lines -------------------------------------------------------------------

std::string first_line(const std::string& input) {
    return input.substr(0, std::min(input.find('\n'), max_pattern));
}

// A dictionary entry: name="value", with \\, \" and \xHH inside the quotes.
std::optional<std::string> dictionary_item(const std::string& entry) {
    std::size_t open = entry.find('"'), close = entry.rfind('"');
    if (entry.empty() || entry[0] == '#' || open == std::string::npos || close <= open)
        return std::nullopt;
    std::string item;
    for (std::size_t i = open + 1; i < close; ++i) {
        if (entry[i] == '\\' && entry[i + 1] == 'x') {
            item += static_cast<char>(std::stoi(entry.substr(i + 2, 2), nullptr, 16));
            i += 3;
        } else {
            item += entry[i] == '\\' ? entry[++i] : entry[i];
        }
    }
    return item;
}

void compare_path(const std::filesystem::path& path, tally& counts) {
    if (std::filesystem::is_directory(path)) {
        for (const auto& entry : std::filesystem::directory_iterator(path))
            compare_path(entry.path(), counts);
        return;
    }
    std::ifstream in(path, std::ios::binary);
    std::stringstream content;
    content << in.rdbuf();
    if (path.extension() != ".dict") {
        counts.compare(first_line(content.str()));
        return;
    }
    std::string entry;
    while (std::getline(content, entry))
        if (auto item = dictionary_item(entry))
            counts.compare(*item);
}

// Every byte alone, escaped, in brackets, as a range's end, as a named
// element or class, and the counts near their limits.
std::vector<std::string> made_lines() {
    std::vector<std::string> lines;
    std::vector<std::string> names = {"alnum", "ALPHA", "blank",  "cntrl", "digit", "graph",
                                      "lower", "print", "punct",  "space", "Upper", "xdigit",
                                      "d",     "w",     "s",      "W",     "x",     "",
                                      "NUL",   "tab",   "hyphen", "zero",  "a",     "DEL"};
    for (const auto& name : names)
        for (const char* form : {"[[:%:]]", "[[.%.]]", "[[=%=]]", "[^[:%:]x]", "[[.%.]-z]"}) {
            std::string line = form;
            lines.push_back(line.replace(line.find('%'), 1, name));
        }
    for (int c = 0; c < 256; ++c) {
        std::string one(1, static_cast<char>(c));
        for (std::string line :
             {one, "\\" + one, "[" + one + "]", "[^\\" + one + "]", "\\c" + one,
              "[[." + one + ".]]", "[[=" + one + "=]]", "a" + one + "b", "(" + one + ")",
              "[a-" + one + "]", "[" + one + "-\\x80]", "[\\" + one + "-z]", "x{" + one + "}"})
            lines.push_back(line);
        char hex[16];
        std::snprintf(hex, sizeof hex, "\\x%02x", c);
        lines.push_back(hex);
        std::snprintf(hex, sizeof hex, "\\u%04X", c * 257);
        lines.push_back(hex);
        std::snprintf(hex, sizeof hex, "[\\x%02x-\\xff]", c);
        lines.push_back(hex);
    }
    for (const char* count :
         {"{2147483647}", "{2147483648}", "{4294967295}", "{4294967297}", "{999999999999999999}",
          "{1,2147483648}", "{0,4294967297}", "{3,2}", "{99999}", "{49999,}", "{0,50000}"})
        for (const char* body : {"a", "(a)", "(?:a|b)", "a*"})
            lines.push_back(body + std::string(count));
    for (const char* deep : {"(", "(?:", "(?=", "(a|"}) {
        std::string line;
        for (int i = 0; i < 3000; ++i)
            line += deep;
        lines.push_back(line + "a");
    }
    return lines;
}

} // namespace

int main(int argc, char** argv) {
    tally counts;
    for (const auto& line : made_lines())
        counts.compare(line);
    std::size_t made = counts.compared;
    for (int i = 1; i < argc; ++i)
        if (std::filesystem::exists(argv[i]))
            compare_path(argv[i], counts);
    std::printf("matcher equality: %zu lines compared (%zu made here, %zu from files), %zu valid "
                "in both, %zu different\n",
                counts.compared, made, counts.compared - made, counts.valid, counts.different);
    return counts.different == 0 ? 0 : 1;
}
