// Splits a line into tokens. The characters are those of the "C" locale,
// whatever the machine's: a digit is 0 to 9, a hex digit adds a to f.
#include "matcher/scanner.hpp"

namespace torvad::regex {

namespace {

bool is_digit(char c) {
    return c >= '0' && c <= '9';
}

bool is_hex_digit(char c) {
    return is_digit(c) || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
}

int hex_value(char c) {
    if (is_digit(c))
        return c - '0';
    return (c | 0x20) - 'a' + 10;
}

} // namespace

void scanner::fail(const char* reason, std::size_t at) const {
    throw bad_pattern{reason, at};
}

void scanner::advance() {
    at_ = next_;
    negated_ = false;
    // The end of the line ends every mode: an open bracket or brace is the
    // parser's to refuse.
    if (next_ == source_.size()) {
        kind_ = token::end;
        return;
    }
    char c = source_[next_++];
    if (mode_ == mode::in_bracket)
        scan_in_bracket(c);
    else if (mode_ == mode::in_brace)
        scan_in_brace(c);
    else
        scan_normal(c);
}

void scanner::scan_normal(char c) {
    kind_ = token::character;
    character_ = c;
    switch (c) {
    case '\\':
        if (next_ == source_.size())
            fail("\\ at the end", at_);
        scan_escape();
        break;
    case '(':
        kind_ = token::group;
        if (next_ == source_.size() || source_[next_] != '?')
            break;
        if (++next_ == source_.size())
            fail("(? at the end", at_);
        switch (source_[next_++]) {
        case ':':
            kind_ = token::plain_group;
            break;
        case '=':
            kind_ = token::lookahead;
            break;
        case '!':
            kind_ = token::lookahead;
            negated_ = true;
            break;
        default:
            fail("(? not followed by :, = or !", at_);
        }
        break;
    case ')':
        kind_ = token::group_end;
        break;
    case '[':
        mode_ = mode::in_bracket;
        kind_ = token::bracket;
        if (next_ != source_.size() && source_[next_] == '^') {
            negated_ = true;
            ++next_;
        }
        break;
    case '{':
        mode_ = mode::in_brace;
        kind_ = token::brace;
        break;
    default:
        // ] and } are plain characters here.
        static constexpr std::string_view operators = "^$.*+?|";
        static constexpr token kinds[] = {token::line_begin, token::line_end, token::any,
                                          token::star,       token::plus,     token::optional,
                                          token::alternation};
        if (std::size_t i = operators.find(c); i != std::string_view::npos)
            kind_ = kinds[i];
    }
}

void scanner::scan_in_bracket(char c) {
    kind_ = token::character;
    character_ = c;
    if (c == '-') {
        kind_ = token::dash;
    } else if (c == ']') {
        kind_ = token::bracket_end;
        mode_ = mode::normal;
    } else if (c == '\\') {
        if (next_ == source_.size())
            fail("\\ at the end", at_);
        scan_escape();
    } else if (c == '[') {
        if (next_ == source_.size())
            fail("unmatched [", at_);
        char kind = source_[next_];
        if (kind == '.')
            scan_bracket_name(token::collating, kind);
        else if (kind == ':')
            scan_bracket_name(token::class_name, kind);
        else if (kind == '=')
            scan_bracket_name(token::equivalence, kind);
    }
}

void scanner::scan_in_brace(char c) {
    if (is_digit(c)) {
        --next_;
        kind_ = token::count;
        text_ = digits();
    } else if (c == ',') {
        kind_ = token::comma;
    } else if (c == '}') {
        kind_ = token::brace_end;
        mode_ = mode::normal;
    } else {
        fail("bad repeat count", at_);
    }
}

// The backslash is read; the escape is the character at next_. \b is a
// backspace inside brackets, \c stands for the character after it, and
// \x and \u keep the low byte of their value.
void scanner::scan_escape() {
    char c = source_[next_++];
    kind_ = token::character;
    static constexpr std::string_view letters = "0fnrtv", meanings("\0\f\n\r\t\v", 6);
    if (std::size_t i = letters.find(c); i != std::string_view::npos) {
        character_ = meanings[i];
        return;
    }
    switch (c) {
    case 'b':
    case 'B':
        if (c == 'b' && mode_ == mode::in_bracket) {
            character_ = '\b';
            return;
        }
        kind_ = token::word_boundary;
        negated_ = c == 'B';
        return;
    case 'd':
    case 'D':
    case 's':
    case 'S':
    case 'w':
    case 'W':
        kind_ = token::quoted_class;
        character_ = c;
        return;
    case 'c':
        if (next_ == source_.size())
            fail("\\c at the end", at_);
        character_ = source_[next_++];
        return;
    case 'x':
    case 'u': {
        int value = 0;
        for (int left = c == 'x' ? 2 : 4; left > 0; --left, ++next_) {
            if (next_ == source_.size() || !is_hex_digit(source_[next_]))
                fail(c == 'x' ? "\\x needs two hex digits" : "\\u needs four hex digits", at_);
            value = value * 16 + hex_value(source_[next_]);
        }
        character_ = static_cast<char>(value & 0xff);
        return;
    }
    default:
        if (is_digit(c)) {
            --next_;
            kind_ = token::backref;
            text_ = digits();
            return;
        }
        character_ = c;
    }
}

// [:name:], [.name.] or [=name=]: next_ is at the character after the [.
void scanner::scan_bracket_name(token kind, char closing) {
    std::size_t first = ++next_;
    std::size_t last = source_.find(closing, first);
    if (last == std::string_view::npos || last + 1 >= source_.size() || source_[last + 1] != ']')
        fail(kind == token::class_name ? "unclosed [: in brackets"
                                       : "unclosed [. or [= in brackets",
             at_);
    kind_ = kind;
    text_ = source_.substr(first, last - first);
    next_ = last + 2;
}

std::string_view scanner::digits() {
    std::size_t first = next_;
    while (next_ != source_.size() && is_digit(source_[next_]))
        ++next_;
    return source_.substr(first, next_ - first);
}

} // namespace torvad::regex
