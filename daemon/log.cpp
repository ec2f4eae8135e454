// Console lines and event log records: the only voice of the supervisor.
#include "daemon/daemon.hpp"

#include <algorithm>
#include <cstdarg>
#include <cstdio>

namespace torvad {

namespace {
constexpr std::size_t log_buffer_size = 4096;
// The time, the name and the colours around the text.
constexpr std::size_t line_frame_size = 64;
// Colour numbers of the console line: the second digit of an ANSI foreground.
enum level_colour : int { colour_red = 1, colour_green = 2, colour_yellow = 3 };
} // namespace

void daemon::log_line(event_type type, int colour_number, const char* format, va_list args) {
    // A longer text is cut to 4095 characters without a word about it.
    char text[log_buffer_size];
    std::vsnprintf(text, sizeof text, format, args);
    std::tm now = platform::local_time_now();
    // The line goes out in one write, so that it stands whole beside what the
    // children write to the same console, on a runtime without line buffering too.
    char line[log_buffer_size + line_frame_size];
    int length = colour_ ? std::snprintf(line, sizeof line,
                                         "\x1b[3%dm%02d:%02d:%02d\x1b[36m torvad\x1b[0m %s\n",
                                         colour_number, now.tm_hour, now.tm_min, now.tm_sec, text)
                         : std::snprintf(line, sizeof line, "%02d:%02d:%02d torvad %s\n",
                                         now.tm_hour, now.tm_min, now.tm_sec, text);
    std::size_t size = std::min(static_cast<std::size_t>(std::max(length, 0)), sizeof line - 1);
    if (console_holds_ == 0)
        std::fwrite(line, 1, size, stdout);
    else
        held_lines_.append(line, size);
    if (logging)
        platform::write_event_record(type, text);
}

daemon::console_hold::~console_hold() {
    if (--owner_.console_holds_ != 0)
        return;
    std::fwrite(owner_.held_lines_.data(), 1, owner_.held_lines_.size(), stdout);
    owner_.held_lines_.clear();
}

void daemon::log_error(const char* format, ...) {
    va_list args;
    va_start(args, format);
    log_line(event_type::error, colour_red, format, args);
    va_end(args);
}

void daemon::log_warning(const char* format, ...) {
    va_list args;
    va_start(args, format);
    log_line(event_type::warning, colour_yellow, format, args);
    va_end(args);
}

void daemon::log_info(const char* format, ...) {
    va_list args;
    va_start(args, format);
    log_line(event_type::information, colour_green, format, args);
    va_end(args);
}

void daemon::log_verbose(const char* format, ...) {
    if (!verbose)
        return;
    va_list args;
    va_start(args, format);
    log_line(event_type::information, colour_green, format, args);
    va_end(args);
}

} // namespace torvad
