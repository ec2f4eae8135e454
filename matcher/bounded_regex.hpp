// One execution pattern line, matched within a fixed bound on time and stack:
// the text it is matched against is chosen by an untrusted child.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace torvad {

namespace regex {
struct automaton;
}

enum class match_verdict { match, no_match, undecided };

// A reading of the clock that bounds a match, in nanoseconds; only the
// difference of two readings counts. The caller chooses the clock, so that
// the matcher is plain code: the daemon gives the calling thread's CPU time,
// because a busy machine must not turn an ordinary request into a refusal.
using match_clock = std::int64_t (*)();

// One pattern line, compiled once at load. Copies share the compiled form.
class bounded_regex {
  public:
    // Compiles source as ECMAScript (case-sensitive, no other flag); nullopt and a short
    // reason in error, which says where in the line the fault is, when it is not a valid
    // expression (or too large to compile).
    static std::optional<bounded_regex> compile(std::string_view source, std::string& error);

    // Whole-text match, the same answer std::regex_match(text, std::regex(source,
    // std::regex::ECMAScript)) gives whenever that finishes; undecided when no answer can be
    // had within this matcher's bounds on time, as clock tells it, and stack.
    match_verdict match(std::string_view text, match_clock clock) const;

  private:
    explicit bounded_regex(std::shared_ptr<const regex::automaton> compiled);

    std::shared_ptr<const regex::automaton> compiled_;
};

// The bound on one call of match, in milliseconds of its clock. Unoptimized and sanitizer builds
// search thirty to sixty times slower; they allow forty times as long, so that every build decides
// the same lines.
#if defined(__OPTIMIZE__) && !defined(__SANITIZE_ADDRESS__)
constexpr int regex_time_bound_ms = 25;
#else
constexpr int regex_time_bound_ms = 1000;
#endif

} // namespace torvad
