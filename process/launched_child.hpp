// The program a process launched: its pid, the watch on its exit, and what its
// end counts as. A part of its process, which keeps it alive for its waits.
#pragma once

#include <cstdint>

#include "platform/platform.hpp"

namespace torvad {

// The code a reaped child's end counts as: its exit status, 128 + the signal
// of a death by signal (0 when we forced it), and 0 when it can't be read.
std::uint32_t exit_code_of(const platform::exit_status& exit, bool forced);

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
    // Completes once the child may have ended; a closed watch ends it with an error.
    template <class Handler> void await_end(Handler&& handler) {
        platform::await_exit(watch_, std::forward<Handler>(handler));
    }
    // The child's end, reaped, when it has ended; ended is false on a stale wake.
    platform::exit_status take_end() { return platform::exit_status_of(watch_); }
    std::uint32_t code_of(const platform::exit_status& exit) const {
        return exit_code_of(exit, forced_);
    }
    // Kills the child; its end then counts as clean.
    platform::os_error end_by_force();
    // A child the terminal stopped (it read the terminal from the background)
    // is continued, so that it can take a sigterm; true when it was stopped.
    bool continue_if_stopped();
    void close();

    // The child has ended and a read of its output was on its way: the status
    // waits here until that read has landed and the pipes are drained.
    void begin_ending(std::uint32_t status) {
        ending_ = true;
        ended_status_ = status;
    }
    bool ending() const { return ending_; }
    std::uint32_t end_ending() {
        ending_ = false;
        return ended_status_;
    }

  private:
    std::uint32_t pid_ = 0;
    platform::exit_watch watch_;
    bool forced_ = false; // ended by force: its end counts as 0
    bool ending_ = false;
    std::uint32_t ended_status_ = 0;
};

} // namespace torvad
