// The one supervisor: the event loop, the owner of every process (through its
// set of children), the execution patterns and the sink of all log lines. It
// is a global that outlives every process; a process refers to it by plain
// pointer.
#pragma once

#include <memory>
#include <string>
#include <unordered_set>

#include <boost/asio/io_context.hpp>
#include <boost/asio/signal_set.hpp>

#include "ipc/patterns.hpp"
#include "platform/platform.hpp"

namespace torvad {

class process;

extern bool verbose;      // -v: log_verbose lines and the packet trace
extern bool logging;      // -l: every line also goes to the event log
extern bool background;   // the service path: stdout is not a terminal, or -b
extern bool auto_restart; // cleared by -o and by any stop; never set again
extern const char* const daemon_version;

using event_type = platform::event_type;

class daemon : public boost::asio::io_context {
  public:
    daemon();
    ~daemon();
    daemon(const daemon&) = delete;
    daemon& operator=(const daemon&) = delete;

    // The log front ends (daemon/log.cpp): one console line each, and one
    // event log record with -l. log_verbose formats nothing without -v.
    void log_error(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_warning(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_info(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_verbose(const char* format, ...) __attribute__((format(printf, 2, 3)));
    bool colour() const { return colour_; }
    void set_colour(bool colour) { colour_ = colour; }

    // Names the service, loads the patterns (none: everything is allowed for
    // the child's own account) and arms the stop-signal wait. Called once.
    void configure(const std::string& name, const char* patterns_path);
    // At a console a plain kill is a stop request too.
    void add_stop_signal(int signal_number);
    // Starts every child made so far and logs how that went.
    void start();
    // The stop of the supervised: log, terminate the children, no more
    // restarts. It hides io_context::stop on purpose: the loop itself is
    // stopped by io_context::stop, named in full wherever it is meant.
    void stop();
    // Runs the loop while a persistent child is left; hides io_context::run
    // in the same way.
    void run();
    bool any_persistent() const;
    // Reaps, from now on, the orphaned descendants the kernel hands us, never
    // a child we supervise. Called before any thread is started. (daemon/orphans.cpp)
    void take_orphans();
    std::size_t persistent_count() const;

    // What a process needs of its owner.
    void adopt(std::shared_ptr<process> child);
    void remove(const std::shared_ptr<process>& child);
    const pattern_lists& patterns() const { return patterns_; }
    const std::string& program_name() const { return program_name_; }
    void set_program_name(std::string name) { program_name_ = std::move(name); }
    const std::string& service_name() const { return service_name_; }

  private:
    void log_line(event_type type, int colour_number, const char* format, va_list args);
    void load_patterns(const char* path);
    void terminate_children();
    void name_awaited_children();
    void arm_signal_wait();
    void on_signal(const boost::system::error_code& error, int signal_number);
    void persistent_children_changed();
    void wait_for_orphans();
    void reap_orphans();

    bool colour_;
    std::string service_name_;
    std::string program_name_;
    std::unordered_set<std::shared_ptr<process>> children_;
    boost::asio::signal_set signals_;
    platform::stream orphan_watch_;
    pattern_lists patterns_;
    bool children_report_posted_ = false;
    bool stop_requested_ = false;
};

// The supervisor of this program, built before main and gone after it.
extern daemon the_daemon;

} // namespace torvad
