// The standard library's matcher, asked only where it answers quickly: it
// takes exponential time on some short inputs of the fuzzers.
#pragma once

#include <algorithm>
#include <cstdint>
#include <exception>
#include <functional>
#include <iterator>
#include <optional>
#include <pthread.h>
#include <regex>
#include <string>

#include "matcher/bounded_regex.hpp"

namespace fuzz {

// The library's matcher takes exponential time on some of these inputs, so
// its answer is asked for only when it comes quickly: this iterator counts
// the matcher's steps and gives up after a fixed number of them.
struct too_slow {};
inline long steps_left;

inline void step() {
    if (--steps_left < 0)
        throw too_slow{};
}

class counting_iterator {
  public:
    using iterator_category = std::bidirectional_iterator_tag;
    using value_type = char;
    using difference_type = std::ptrdiff_t;
    using pointer = const char*;
    using reference = const char&;

    counting_iterator() { step(); }
    explicit counting_iterator(const char* at) : at_(at) {}
    counting_iterator(const counting_iterator& other) : at_(other.at_) { step(); }
    counting_iterator& operator=(const counting_iterator& other) {
        step();
        at_ = other.at_;
        return *this;
    }
    reference operator*() const { return step(), *at_; }
    counting_iterator& operator++() { return step(), ++at_, *this; }
    counting_iterator& operator--() { return step(), --at_, *this; }
    counting_iterator operator++(int) { return step(), counting_iterator(at_++); }
    counting_iterator operator--(int) { return step(), counting_iterator(at_--); }
    bool operator==(const counting_iterator& other) const { return step(), at_ == other.at_; }

  private:
    const char* at_ = nullptr;
};

// The library's answer, or none when it doesn't come within a million steps.
inline std::optional<bool> library_answer(const std::regex& expression, const std::string& text) {
    steps_left = 1'000'000;
    try {
        const char* begin = text.data();
        return std::regex_match(counting_iterator(begin), counting_iterator(begin + text.size()),
                                expression);
    } catch (const too_slow&) {
        return std::nullopt;
    }
}

// An input of the regex fuzzers: a pattern, a line feed, a text, each cut to
// its most; null when torvad refuses the pattern for a number too long, on
// which the library's compiler may overflow a long.
struct regex_input {
    std::string pattern, text;
};
inline std::optional<regex_input> split_regex_input(const std::uint8_t* data, std::size_t size,
                                                    std::size_t max_pattern, std::size_t max_text) {
    std::string input(reinterpret_cast<const char*>(data), size);
    std::size_t cut = input.find('\n');
    regex_input split{input.substr(0, std::min(cut, max_pattern)),
                      cut == std::string::npos ? "" : input.substr(cut + 1, max_text)};
    std::string error;
    if (!torvad::bounded_regex::compile(split.pattern, error) &&
        error.find("number is too large") != std::string::npos)
        return std::nullopt;
    return split;
}

inline bool library_is_quick(const std::regex& expression, const std::string& text) {
    return library_answer(expression, text).has_value();
}

// The library's matcher recurses per step, up to the automaton's size even on
// an empty text: work runs on a thread whose 1 GiB stack is only reserved.
// What work throws is thrown here; false when no such thread could be had.
inline bool on_large_stack(const std::function<void()>& work) {
    struct task {
        const std::function<void()>& work;
        std::exception_ptr failure;
    } job{work, nullptr};
    auto run = [](void* argument) -> void* {
        auto* running = static_cast<task*>(argument);
        try {
            running->work();
        } catch (...) {
            running->failure = std::current_exception();
        }
        return nullptr;
    };
    pthread_attr_t attributes;
    pthread_t thread;
    if (pthread_attr_init(&attributes) != 0)
        return false;
    bool started = pthread_attr_setstacksize(&attributes, std::size_t{1} << 30) == 0 &&
                   pthread_create(&thread, &attributes, run, &job) == 0;
    pthread_attr_destroy(&attributes);
    if (!started)
        return false;
    pthread_join(thread, nullptr);
    if (job.failure)
        std::rethrow_exception(job.failure);
    return true;
}

} // namespace fuzz
