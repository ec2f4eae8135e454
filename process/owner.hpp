// What a process needs of whoever owns it: a loop to run on, a set to live in,
// the decision on its end, a voice, and the patterns. The daemon is the one
// owner in the program; a test brings its own. The owner must outlive every
// process it adopted and every handler they left on its loop.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include <boost/asio/io_context.hpp>

#include "ipc/patterns.hpp"
#include "platform/platform.hpp"

namespace torvad {

class process;

// What a process reads of the run it belongs to, as it is at the time.
struct run_facts {
    std::string program_name;  // for the version packet
    bool verbose = false;      // -v: the packet trace and log_verbose lines
    bool background = false;   // the service path: no console, no process groups
    bool trace_colour = false; // the trace may colour its text
};

class process_owner {
  public:
    virtual boost::asio::io_context& loop() = 0;
    // The set that owns every process from its creation to remove().
    virtual void adopt(std::shared_ptr<process> child) = 0;
    virtual void remove(const std::shared_ptr<process>& child) = 0;
    // A launched child has ended with status (its pipes are still open): the
    // owner logs it and decides whether it starts again.
    virtual void child_ended(const process& child, std::uint32_t status) = 0;
    // A child said on its pipe that it serves; an owner that doesn't ask ignores it.
    virtual void child_ready(const process& /*child*/) {}
    virtual const pattern_lists& patterns() const = 0;
    virtual const run_facts& facts() const = 0;
    // One line: on the console, and in the event log where the run asked for it.
    virtual void write_log(platform::event_type type, const char* text) = 0;

    // The front ends of write_log, in printf's manner; a text is cut to 4095
    // characters. log_verbose formats nothing without -v.
    void log_error(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_warning(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_info(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void log_verbose(const char* format, ...) __attribute__((format(printf, 2, 3)));

  protected:
    ~process_owner() = default;
};

} // namespace torvad
