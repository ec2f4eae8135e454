// The service path: the same daemon, run on the service thread between the
// state reports, with a second run of the loop for the children's orderly end.
#include "entry/service.hpp"

#include "daemon/daemon.hpp"
#include "platform/platform.hpp"

namespace torvad {

void service_run::report(platform::service_state state, std::size_t children) {
    // The manager not hearing us changes nothing we could do; -v says so.
    if (platform::os_error error = platform::report_service_state(state, children))
        daemon_.log_verbose("%s", platform::describe(error).c_str());
}

void service_run::main() {
    using platform::service_state;
    report(service_state::start_pending, 0);
    daemon_.start();
    // Running holds whatever the start did; a failed start shows in the log
    // and in the number of children the status names.
    report(service_state::running, daemon_.persistent_count());
    daemon_.run();
    {
        // A stop still on its way has stopped the loop before this point, and
        // the next run starts it again; one that comes later finds the flag.
        std::lock_guard<std::mutex> lock(first_run_guard_);
        first_run_over_ = true;
    }
    report(service_state::stop_pending, daemon_.persistent_count());
    daemon_.stop_and_run_to_end();
    report(service_state::stopped, 0);
}

void service_run::control_stop() {
    std::lock_guard<std::mutex> lock(first_run_guard_);
    if (!first_run_over_)
        daemon_.stop_loop();
}

} // namespace torvad
