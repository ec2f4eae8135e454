// The first line of a program's output, fed in pieces as a pipe hands them out:
// whether "version" stands in it, and what is kept of it (CRs dropped, cap 8).
#include <gtest/gtest.h>

#include "entry/first_line.hpp"

using namespace torvad;

TEST(first_line, is_taken_whole_across_pieces_and_kept_within_its_cap) {
    const std::tuple<std::string, bool, std::string> rows[] = {
        {"a version\nb", true, "a versio"},
        {"Version\n", false, "Version"},
        {"usage\nversion\n", false, "usage"},
        {"versio\rn\n", false, "version"},
        {"\r\r\nroot\n", false, ""},
        {std::string(10000, '\r') + "root", false, "root"},
        {std::string(9999, 'x') + "version", true, "xxxxxxxx"},
    };
    for (const auto& [text, has_version, kept] : rows)
        for (std::size_t piece : {1, 3, 4096}) {
            first_line_search search("version");
            first_line_reader reader(8, true);
            for (std::size_t at = 0; at < text.size(); at += piece) {
                std::size_t size = std::min(piece, text.size() - at);
                search.feed(text.data() + at, size);
                reader.feed(text.data() + at, size);
            }
            EXPECT_EQ(search.found(), has_version) << text.substr(0, 20) << " by " << piece;
            EXPECT_EQ(reader.text(), kept) << text.substr(0, 20) << " by " << piece;
        }
}
