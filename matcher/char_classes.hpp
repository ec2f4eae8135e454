// The named sets of characters a line may use, as the "C" locale defines
// them: no byte above 127 belongs to any class.
#pragma once

#include <bitset>
#include <optional>
#include <string_view>

namespace torvad::regex {

using char_set = std::bitset<256>;

// [:name:], and d, s and w of \d \s \w; the name in any case. None when unknown.
std::optional<char_set> named_class(std::string_view name);

// The character [.name.] stands for: a letter, or a name such as "hyphen" or "NUL".
std::optional<char> collating_element(std::string_view name);

// The characters [=name=] stands for: the element and its other case.
char_set equivalents(char element);

} // namespace torvad::regex
