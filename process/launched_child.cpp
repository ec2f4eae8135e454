// The launched program's watch and end.
#include "process/launched_child.hpp"

#include "process/process.hpp"

namespace torvad {

std::uint32_t exit_code_of(const platform::exit_status& exit, bool forced) {
    // A status that can't be read is taken as the clean end it most likely
    // was; the log says it was not read.
    if (exit.error)
        return 0;
    if (!exit.exited)
        return forced ? 0 : platform::signal_status(exit.code);
    return static_cast<std::uint32_t>(exit.code);
}

platform::os_error launched_child::watch(platform::launch_result& launched) {
    pid_ = static_cast<std::uint32_t>(launched.pid);
    platform::os_error error = platform::watch_exit(watch_, launched.process);
    if (error)
        platform::end_now(launched.process);
    return error;
}

platform::os_error launched_child::end_by_force() {
    platform::os_error error = platform::end_by_force(watch_);
    // Only a kill that was made turns the coming end into a clean one.
    if (!error)
        forced_ = true;
    return error;
}

void launched_child::continue_if_stopped() {
    stopped_by_terminal_ = watch_.is_open() && platform::continue_if_stopped(watch_);
}

void launched_child::await_end(std::shared_ptr<process> self) {
    platform::await_exit(
        watch_, [this, self = std::move(self)](const boost::system::error_code& error) mutable {
            on_end(error, std::move(self));
        });
}

void launched_child::on_end(const boost::system::error_code& error, std::shared_ptr<process> self) {
    // Only a closing handle ends the wait with an error, and a wait that
    // completed as it closed finds it closed: either way the child is done with.
    if (error || !watch_.is_open())
        return;
    platform::exit_status exit = platform::exit_status_of(watch_);
    if (!exit.ended) {
        // Readiness is a hint: the loop can hand the stale readiness of a
        // descriptor closed in this turn to one opened after it. Only a reaped
        // status is the end of a child.
        await_end(std::move(self));
        return;
    }
    if (exit.error) {
        self->owner.log_error("failed to read the exit status of '%s'.", self->name.c_str());
        self->owner.log_verbose("%s", platform::describe(exit.error).c_str());
    }
    // All the child wrote is in its pipes now; its output is taken before its
    // end is told.
    self->on(life_event::exited, exit_code_of(exit, forced_));
}

void launched_child::close() {
    boost::system::error_code ignored;
    watch_.close(ignored);
}

} // namespace torvad
