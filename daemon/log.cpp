// Console lines and event log records: the only voice of the supervisor.
#include "daemon/daemon.hpp"

#include <cstdio>

namespace torvad {

namespace {
constexpr std::size_t log_buffer_size = 4096;
}

void daemon::log_line(event_type type, int colour_number, const char* text) {
    std::tm now = platform::local_time_now();
    if (colour)
        std::printf("\x1b[3%dm%02d:%02d:%02d\x1b[36m torvad\x1b[0m %s\n", colour_number,
                    now.tm_hour, now.tm_min, now.tm_sec, text);
    else
        std::printf("%02d:%02d:%02d torvad %s\n", now.tm_hour, now.tm_min, now.tm_sec, text);
    if (logging)
        platform::write_event_record(type, text);
}

void daemon::log_format(event_type type, int colour_number, const char* format, va_list args) {
    // A longer text is cut to 4095 characters without a word about it.
    char buffer[log_buffer_size];
    std::vsnprintf(buffer, sizeof buffer, format, args);
    log_line(type, colour_number, buffer);
}

#define TORVAD_LOG_FRONT_END(name, type, colour_number)                                            \
    void daemon::name(const char* format, ...) {                                                   \
        va_list args;                                                                              \
        va_start(args, format);                                                                    \
        log_format(type, colour_number, format, args);                                             \
        va_end(args);                                                                              \
    }

TORVAD_LOG_FRONT_END(log_error, event_type::error, colour_red)
TORVAD_LOG_FRONT_END(log_warning, event_type::warning, colour_yellow)
TORVAD_LOG_FRONT_END(log_info, event_type::information, colour_green)
#undef TORVAD_LOG_FRONT_END

void daemon::log_verbose(const char* format, ...) {
    if (!verbose)
        return;
    va_list args;
    va_start(args, format);
    log_format(event_type::information, colour_green, format, args);
    va_end(args);
}

} // namespace torvad
