// The printf front ends of an owner's log.
#include "process/owner.hpp"

#include <cstdarg>
#include <cstdio>

namespace torvad {

namespace {
constexpr std::size_t log_text_size = 4096;

void write_formatted(process_owner& owner, platform::event_type type, const char* format,
                     va_list args) {
    // A longer text is cut without a word about it.
    char text[log_text_size];
    std::vsnprintf(text, sizeof text, format, args);
    owner.write_log(type, text);
}
} // namespace

void process_owner::log_error(const char* format, ...) {
    va_list args;
    va_start(args, format);
    write_formatted(*this, platform::event_type::error, format, args);
    va_end(args);
}

void process_owner::log_warning(const char* format, ...) {
    va_list args;
    va_start(args, format);
    write_formatted(*this, platform::event_type::warning, format, args);
    va_end(args);
}

void process_owner::log_info(const char* format, ...) {
    va_list args;
    va_start(args, format);
    write_formatted(*this, platform::event_type::information, format, args);
    va_end(args);
}

void process_owner::log_verbose(const char* format, ...) {
    if (!facts().verbose)
        return;
    va_list args;
    va_start(args, format);
    write_formatted(*this, platform::event_type::information, format, args);
    va_end(args);
}

} // namespace torvad
