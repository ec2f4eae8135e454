// The program a process launched: its pid, the watch on its exit, and what its
// end counts as. A part of its process: its wait holds the process alive, and
// the end it sees is reported to the process's life.
#pragma once

#include <cstdint>
#include <memory>

#include "platform/platform.hpp"

namespace torvad {

// The code a reaped child's end counts as: its exit status, 128 + the signal
// of a death by signal (0 when we forced it), and 0 when it can't be read.
std::uint32_t exit_code_of(const platform::exit_status& exit, bool forced);

class process;

class launched_child {
  public:
    explicit launched_child(boost::asio::io_context& loop) : watch_(loop) {}

    std::uint32_t pid() const { return pid_; }
    // A pipe served for another program stands for that program's pid.
    void set_pid(std::uint32_t pid) { pid_ = pid; }
    // Binds the launch's process handle to the watch. On failure the child
    // is ended at once: one we can't see end must not run on unwatched.
    platform::os_error watch(platform::launch_result& launched);
    bool watched() const { return watch_.is_open(); }
    // Waits for the child's end, holding self, and reports it to self as
    // exited with what it counts as. A closed watch ends the wait silently.
    void await_end(std::shared_ptr<process> self);
    // Kills the child; its end then counts as clean.
    platform::os_error end_by_force();
    // A child the terminal stopped (it read the terminal from the background)
    // is continued, so that it can take a sigterm; remembered for the log.
    void continue_if_stopped();
    bool stopped_by_terminal() const { return stopped_by_terminal_; }
    void close();

  private:
    void on_end(const boost::system::error_code& error, std::shared_ptr<process> self);

    std::uint32_t pid_ = 0;
    platform::exit_watch watch_;
    bool forced_ = false;              // ended by force: its end counts as 0
    bool stopped_by_terminal_ = false; // found stopped at the last stop request
};

} // namespace torvad
