// Console lines and event log records: the only voice of the supervisor.
#include "daemon/daemon.hpp"

#include <algorithm>
#include <cstdio>

namespace torvad {

namespace {
constexpr std::size_t log_buffer_size = 4096;
// The time, the name and the colours around the text.
constexpr std::size_t line_frame_size = 64;

// The second digit of an ANSI foreground: red, yellow, green.
int colour_of(platform::event_type type) {
    switch (type) {
    case platform::event_type::error:
        return 1;
    case platform::event_type::warning:
        return 3;
    default:
        return 2;
    }
}
} // namespace

void daemon::write_log(platform::event_type type, const char* text) {
    std::tm now = platform::local_time_now();
    // The line goes out in one write, so that it stands whole beside what the
    // children write to the same console, on a runtime without line buffering too.
    char line[log_buffer_size + line_frame_size];
    int length = colour_ ? std::snprintf(line, sizeof line,
                                         "\x1b[3%dm%02d:%02d:%02d\x1b[36m torvad\x1b[0m %s\n",
                                         colour_of(type), now.tm_hour, now.tm_min, now.tm_sec, text)
                         : std::snprintf(line, sizeof line, "%02d:%02d:%02d torvad %s\n",
                                         now.tm_hour, now.tm_min, now.tm_sec, text);
    std::size_t size = std::min(static_cast<std::size_t>(std::max(length, 0)), sizeof line - 1);
    if (console_holds_ == 0)
        std::fwrite(line, 1, size, stdout);
    else
        held_lines_.append(line, size);
    if (settings_.logging)
        platform::write_event_record(type, text);
}

daemon::console_hold::~console_hold() {
    if (--owner_.console_holds_ != 0)
        return;
    std::fwrite(owner_.held_lines_.data(), 1, owner_.held_lines_.size(), stdout);
    owner_.held_lines_.clear();
}

} // namespace torvad
