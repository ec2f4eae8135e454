#include "entry/first_line.hpp"

#include <algorithm>
#include <cstring>

namespace torvad {

namespace {
// The length of the piece that belongs to the first line, and whether the
// line ends in it.
std::size_t line_part(const char* data, std::size_t size, bool& line_ends) {
    const void* feed = std::memchr(data, '\n', size);
    line_ends = feed != nullptr;
    return line_ends ? static_cast<std::size_t>(static_cast<const char*>(feed) - data) : size;
}
} // namespace

void first_line_reader::feed(const char* data, std::size_t size) {
    if (complete_)
        return;
    std::size_t part = line_part(data, size, complete_);
    for (std::size_t i = 0; i < part && text_.size() < cap_; ++i)
        if (data[i] != '\r' || !drop_carriage_returns_)
            text_ += data[i];
}

void first_line_search::feed(const char* data, std::size_t size) {
    if (complete_ || found_)
        return;
    std::size_t part = line_part(data, size, complete_);
    std::string window = tail_;
    window.append(data, part);
    found_ = window.find(word_) != std::string::npos;
    std::size_t keep = std::min(window.size(), word_.empty() ? 0 : word_.size() - 1);
    tail_ = window.substr(window.size() - keep);
}

} // namespace torvad
