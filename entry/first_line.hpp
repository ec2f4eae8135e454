// The first line of a program's output, taken as the output arrives. All the
// rest is read and dropped, so the program never waits on a full pipe and what
// we keep stays small whatever it writes.
#pragma once

#include <cstddef>
#include <string>

namespace torvad {

// Keeps the first line, without its line feed, up to a cap.
class first_line_reader {
  public:
    // With drop_carriage_returns every CR is deleted as it comes, before the
    // cap counts, so a line of CRs in front of a name still yields the name.
    first_line_reader(std::size_t cap, bool drop_carriage_returns)
        : cap_(cap), drop_carriage_returns_(drop_carriage_returns) {}
    void feed(const char* data, std::size_t size);
    const std::string& text() const { return text_; }

  private:
    std::size_t cap_;
    bool drop_carriage_returns_;
    bool complete_ = false;
    std::string text_;
};

// Tells whether a word stands in the first line. The line is looked at in full
// however long it is, while only a word's length of it is kept.
class first_line_search {
  public:
    explicit first_line_search(std::string word) : word_(std::move(word)) {}
    void feed(const char* data, std::size_t size);
    bool found() const { return found_; }

  private:
    std::string word_;
    std::string tail_; // the end of what was seen, in case the word spans two pieces
    bool complete_ = false;
    bool found_ = false;
};

} // namespace torvad
