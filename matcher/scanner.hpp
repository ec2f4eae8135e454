// The tokens of a pattern line. A line is read as std::regex reads an
// ECMAScript expression, quirks included: which lines load, and what each
// one matches, must stay what they were when std::regex compiled them.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace torvad::regex {

// A line that is not a valid expression, and where in it the fault is.
struct bad_pattern {
    std::string reason;
    std::size_t at; // from 0
};

enum class token : std::uint8_t {
    any,           // .
    character,     // one character, however it was written
    backref,       // \ and digits
    quoted_class,  // \d \D \s \S \w \W
    group,         // (
    plain_group,   // (?:
    lookahead,     // (?= or, negated, (?!
    group_end,     // )
    bracket,       // [ or, negated, [^
    bracket_end,   // ] inside brackets
    dash,          // - inside brackets
    class_name,    // [:name:] inside brackets
    collating,     // [.name.] inside brackets
    equivalence,   // [=name=] inside brackets
    star,          // *
    plus,          // +
    optional,      // ?
    brace,         // {
    count,         // digits inside braces
    comma,         // , inside braces
    brace_end,     // } inside braces
    alternation,   // |
    line_begin,    // ^
    line_end,      // $
    word_boundary, // \b or, negated, \B
    end,
};

class scanner {
  public:
    explicit scanner(std::string_view source) : source_(source) { advance(); }

    // The current token and what it carries.
    token kind() const { return kind_; }
    bool negated() const { return negated_; }
    char character() const { return character_; }   // also the letter of a quoted class
    std::string_view text() const { return text_; } // digits, or a name inside brackets
    std::size_t at() const { return at_; }

    void advance();

  private:
    enum class mode : std::uint8_t { normal, in_bracket, in_brace };

    void scan_normal(char c);
    void scan_in_bracket(char c);
    void scan_in_brace(char c);
    void scan_escape();
    void scan_bracket_name(token kind, char closing);
    std::string_view digits();
    [[noreturn]] void fail(const char* reason, std::size_t at) const;

    std::string_view source_;
    std::size_t next_ = 0;
    mode mode_ = mode::normal;
    token kind_ = token::end;
    bool negated_ = false;
    char character_ = 0;
    std::string_view text_;
    std::size_t at_ = 0;
};

} // namespace torvad::regex
