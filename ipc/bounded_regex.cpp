// Placeholder until the bounded matcher lands.
#include "ipc/bounded_regex.hpp"

namespace torvad {

std::optional<bounded_regex> bounded_regex::compile(std::string_view source, std::string& error) {
    try {
        bounded_regex compiled;
        compiled.expression_ = std::make_shared<const std::regex>(source.begin(), source.end(),
                                                                  std::regex::ECMAScript);
        return compiled;
    } catch (const std::exception& failure) {
        error = failure.what();
        return std::nullopt;
    }
}

match_verdict bounded_regex::match(std::string_view text) const {
    try {
        return std::regex_match(text.begin(), text.end(), *expression_) ? match_verdict::match
                                                                        : match_verdict::no_match;
    } catch (const std::exception&) {
        return match_verdict::undecided;
    }
}

} // namespace torvad
