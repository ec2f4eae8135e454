// The service path: the same daemon, run on the service thread between the
// state reports, with a second run of the loop for the children's orderly end.
#include "entry/service.hpp"

#include "daemon/daemon.hpp"
#include "platform/platform.hpp"

namespace torvad {

void run_service() {
    using platform::service_state;
    platform::report_service_state(service_state::start_pending);
    the_daemon.start();
    // Running holds whatever the start did; a failed start shows in the log.
    platform::report_service_state(service_state::running);
    the_daemon.run();
    platform::report_service_state(service_state::stop_pending);
    the_daemon.stop();
    the_daemon.restart();
    the_daemon.run();
    platform::report_service_state(service_state::stopped);
}

void service_control_stop() {
    // Only the first run of the loop ends here; run_service does the rest.
    the_daemon.io_context::stop();
}

} // namespace torvad
