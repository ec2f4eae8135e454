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

void run_while_persistent() {
    if (!the_daemon.any_persistent())
        return;
    boost::system::error_code error;
    the_daemon.io_context::run(error);
    if (error)
        throw boost::system::system_error(error);
}
} // namespace

void run_service() {
    using platform::service_state;
    platform::report_service_state(service_state::start_pending);
    the_daemon.start();
    // Running holds whatever the start did; a failed start shows in the log.
    platform::report_service_state(service_state::running);
    run_while_persistent();
    {
        // A stop still on its way has stopped the loop before this point, and
        // the restart below clears that; one that comes later finds the flag.
        std::lock_guard<std::mutex> lock(first_run_guard);
        first_run_over = true;
    }
    platform::report_service_state(service_state::stop_pending);
    the_daemon.stop();
    the_daemon.restart();
    run_while_persistent();
    platform::report_service_state(service_state::stopped);
}

void service_control_stop() {
    std::lock_guard<std::mutex> lock(first_run_guard);
    if (!first_run_over)
        the_daemon.io_context::stop();
}

} // namespace torvad
