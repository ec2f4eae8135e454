// The service path: the same daemon, run on the service thread between the
// state reports, with a second run of the loop for the children's orderly end.
#include "entry/service.hpp"

#include <mutex>

#include "daemon/daemon.hpp"
#include "platform/platform.hpp"

namespace torvad {

namespace {
// A stop control ends the first run of the loop only: the second run is the
// children's orderly end, and a repeated stop request must not cut it short.
std::mutex first_run_guard;
bool first_run_over = false;
} // namespace

void run_service() {
    using platform::service_state;
    platform::report_service_state(service_state::start_pending, 0);
    the_daemon.start();
    // Running holds whatever the start did; a failed start shows in the log
    // and in the number of children the status names.
    platform::report_service_state(service_state::running, the_daemon.persistent_count());
    the_daemon.run();
    {
        // A stop still on its way has stopped the loop before this point, and
        // the restart below clears that; one that comes later finds the flag.
        std::lock_guard<std::mutex> lock(first_run_guard);
        first_run_over = true;
    }
    platform::report_service_state(service_state::stop_pending, the_daemon.persistent_count());
    the_daemon.stop();
    the_daemon.restart();
    the_daemon.run();
    platform::report_service_state(service_state::stopped, 0);
}

void service_control_stop() {
    // Only the first run of the loop ends here; run_service does the rest.
    std::lock_guard<std::mutex> lock(first_run_guard);
    if (!first_run_over)
        the_daemon.io_context::stop();
}

} // namespace torvad
