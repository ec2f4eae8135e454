// The first line of a program's output, fed in pieces as a pipe hands them out.
#include <gtest/gtest.h>

#include "entry/first_line.hpp"

using namespace torvad;

namespace {
// Feeds text in pieces of the given size.
template <typename reader> void feed(reader& into, const std::string& text, std::size_t piece) {
    for (std::size_t at = 0; at < text.size(); at += piece)
        into.feed(text.data() + at, std::min(piece, text.size() - at));
}
} // namespace

TEST(first_line, search_sees_the_word_across_pieces_and_only_on_the_first_line) {
    const struct {
        std::string text;
        bool found;
    } rows[] = {
        {"torvad version 1.1\n", true},
        {"subversion\n", true},
        {"Version 1\n", false},
        {"usage\nversion\n", false},
        {"versio\rn\n", false},
        {"", false},
        {std::string(100000, 'x') + "version", true},
    };
    for (const auto& r : rows)
        for (std::size_t piece : {1, 3, 4096}) {
            first_line_search search("version");
            feed(search, r.text, piece);
            EXPECT_EQ(search.found(), r.found) << r.text.substr(0, 40) << " in pieces of " << piece;
        }
}

TEST(first_line, reader_drops_carriage_returns_before_the_cap) {
    const struct {
        std::string text, kept;
    } rows[] = {
        {"nobody\r\nroot\n", "nobody"},
        {"\r\r\n", ""},
        {"\nnobody\n", ""},
        {"no\rbody", "nobody"},
        {std::string(10000, '\r') + "root\n", "root"},
        {std::string(10000, 'x'), std::string(8, 'x')},
    };
    for (const auto& r : rows)
        for (std::size_t piece : {1, 5, 4096}) {
            first_line_reader reader(8, true);
            feed(reader, r.text, piece);
            EXPECT_EQ(reader.text(), r.kept) << "in pieces of " << piece;
        }
}
