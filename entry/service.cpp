#include "entry/service.hpp"

#include "daemon/daemon.hpp"
#include "platform/platform.hpp"

namespace torvad {

namespace {
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
    platform::report_service_state(service_state::stop_pending);
    the_daemon.stop();
    the_daemon.restart();
    run_while_persistent();
    platform::report_service_state(service_state::stopped);
}

void service_control_stop() {
    the_daemon.io_context::stop();
}

} // namespace torvad
