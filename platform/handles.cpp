// What both systems do alike with the handles the seam gives out.
#include "platform/platform.hpp"

namespace torvad::platform {

// Asio's object for a pidfd and for a process handle take a handle the same
// way: the watch owns it from here on.
os_error watch_exit(exit_watch& watch, owned_handle& process) {
    return adopt_handle(watch, process);
}

} // namespace torvad::platform
