#include "matcher/char_classes.hpp"

#include <string>

namespace torvad::regex {

namespace {

char_set span(unsigned first, unsigned last) {
    char_set members;
    for (unsigned c = first; c <= last; ++c)
        members.set(c);
    return members;
}

const char_set digit = span('0', '9');
const char_set lower = span('a', 'z');
const char_set upper = span('A', 'Z');
const char_set alpha = lower | upper;
const char_set alnum = alpha | digit;
const char_set space = span('\t', '\r') | span(' ', ' ');
const char_set graph = span('!', '~');

// The names of the 128 characters of the portable set, in code order and
// apart by blanks; a letter is its own name, a digit is not.
constexpr std::string_view element_names =
    "NUL SOH STX ETX EOT ENQ ACK alert backspace tab newline vertical-tab form-feed "
    "carriage-return SO SI DLE DC1 DC2 DC3 DC4 NAK SYN ETB CAN EM SUB ESC IS4 IS3 IS2 IS1 "
    "space exclamation-mark quotation-mark number-sign dollar-sign percent-sign ampersand "
    "apostrophe left-parenthesis right-parenthesis asterisk plus-sign comma hyphen period "
    "slash zero one two three four five six seven eight nine colon semicolon less-than-sign "
    "equals-sign greater-than-sign question-mark commercial-at A B C D E F G H I J K L M N O "
    "P Q R S T U V W X Y Z left-square-bracket backslash right-square-bracket circumflex "
    "underscore grave-accent a b c d e f g h i j k l m n o p q r s t u v w x y z "
    "left-curly-bracket vertical-line right-curly-bracket tilde DEL";

char lower_case(char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

} // namespace

std::optional<char_set> named_class(std::string_view name) {
    std::string key;
    for (char c : name)
        key += lower_case(c);
    if (key == "d" || key == "digit")
        return digit;
    if (key == "w")
        return alnum | span('_', '_');
    if (key == "s" || key == "space")
        return space;
    if (key == "alnum")
        return alnum;
    if (key == "alpha")
        return alpha;
    if (key == "blank")
        return span('\t', '\t') | span(' ', ' ');
    if (key == "cntrl")
        return span(0, 31) | span(127, 127);
    if (key == "graph")
        return graph;
    if (key == "lower")
        return lower;
    if (key == "print")
        return graph | span(' ', ' ');
    if (key == "punct")
        return graph & ~alnum;
    if (key == "upper")
        return upper;
    if (key == "xdigit")
        return digit | span('a', 'f') | span('A', 'F');
    return std::nullopt;
}

std::optional<char> collating_element(std::string_view name) {
    std::size_t first = 0;
    for (int code = 0; code < 128; ++code) {
        std::size_t blank = element_names.find(' ', first);
        if (element_names.substr(first, blank - first) == name)
            return static_cast<char>(code);
        first = blank + 1;
    }
    return std::nullopt;
}

char_set equivalents(char element) {
    char_set members;
    for (unsigned c = 0; c < 256; ++c)
        if (lower_case(static_cast<char>(c)) == lower_case(element))
            members.set(c);
    return members;
}

} // namespace torvad::regex
