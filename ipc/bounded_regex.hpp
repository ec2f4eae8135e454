// A pattern line compiled once, matched against child-chosen text with a
// bound on time and stack.
#pragma once

#include <memory>
#include <optional>
#include <regex>
#include <string>
#include <string_view>

namespace torvad {

enum class match_verdict { match, no_match, undecided };

class bounded_regex {
  public:
    static std::optional<bounded_regex> compile(std::string_view source, std::string& error);
    match_verdict match(std::string_view text) const;

  private:
    std::shared_ptr<const std::regex> expression_;
};

constexpr int regex_time_bound_ms = 50;

} // namespace torvad
