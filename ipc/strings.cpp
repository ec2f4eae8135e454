#include "ipc/strings.hpp"

namespace torvad {

std::vector<std::string> split_strings(const char* data, std::size_t size, char separator) {
    std::vector<std::string> items;
    std::size_t start = 0;
    for (;;) {
        std::size_t end = start;
        while (end < size && data[end] != separator)
            ++end;
        items.emplace_back(data + start, end - start);
        if (end >= size)
            return items;
        start = end + 1;
    }
}

std::string join_strings(const std::vector<std::string>& items) {
    std::string text;
    for (std::size_t i = 0; i < items.size(); ++i) {
        if (i != 0)
            text += '\0';
        text += items[i];
    }
    return text;
}

std::string quote_argument(std::string_view text, std::string_view escape_set) {
    std::string quoted = "\"";
    for (char c : text) {
        if (escape_set.find(c) != std::string_view::npos)
            quoted += '\\';
        quoted += c;
    }
    quoted += '"';
    return quoted;
}

} // namespace torvad
