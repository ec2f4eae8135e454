// The one supervisor: the event loop, the owner of every process (through
// `children`), the execution patterns and the sink of all log lines. It is a
// global that outlives every process; a process refers to it by plain pointer.
#pragma once

#include <cstdarg>
#include <memory>
#include <regex>
#include <string>
#include <unordered_set>
#include <vector>

#include <boost/asio/io_context.hpp>
#include <boost/asio/signal_set.hpp>

#include "platform/platform.hpp"

namespace torvad {

class process;

extern bool verbose;      // -v: log_verbose lines and the packet trace
extern bool logging;      // -l: every line also goes to the event log
extern bool background;   // the service path: stdout is not a terminal, or -b
extern bool auto_restart; // cleared by -o and by any stop; never set again
extern const char* const daemon_version;

using event_type = platform::event_type;

// Colour numbers of the console line: the second digit of an ANSI foreground.
enum level_colour : int { colour_red = 1, colour_green = 2, colour_yellow = 3 };

class daemon : public boost::asio::io_context {
  public:
    daemon();
    virtual ~daemon();
    daemon(const daemon&) = delete;
    daemon& operator=(const daemon&) = delete;

    virtual void log_line(event_type type, int colour_number, const char* text);
    virtual void log_format(event_type type, int colour_number, const char* format, va_list args);
    void log_error(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_warning(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_info(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_verbose(const char* format, ...) __attribute__((format(printf, 2, 3)));

    // Names the service, loads the patterns (none: everything is allowed for
    // the child's own account) and arms the stop-signal wait. Called once.
    void configure(const std::string& name, const char* patterns_path);
    void start();
    void stop();
    void run();
    bool any_persistent() const;
    void remove(std::shared_ptr<process> child);
    void on_signal(const boost::system::error_code& error, int signal_number);

    bool colour;
    std::string service_name;
    std::string program_name;
    std::unordered_set<std::shared_ptr<process>> children;
    boost::asio::signal_set signals;
    bool allow_all = false;
    std::vector<std::regex> exec_patterns;
    std::vector<std::regex> all_patterns;

  private:
    void terminate_children();
    void arm_signal_wait();
};

// The supervisor of this program, built before main and gone after it.
extern daemon the_daemon;

} // namespace torvad
