// The launched program's watch and end.
#include "process/launched_child.hpp"

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

void launched_child::close() {
    boost::system::error_code ignored;
    watch_.close(ignored);
}

} // namespace torvad
