// The service path: the same daemon, run on the service thread between the
// state reports, with a second run of the loop for the children's orderly end.
#include "entry/service.hpp"

#include "daemon/daemon.hpp"
#include "platform/platform.hpp"

namespace torvad {

service_run::service_run(daemon& supervisor) : daemon_(supervisor), progress_(supervisor.loop()) {}

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
    // and in the number of children the status names. With -r it waits for
    // the children's word, and the start shows progress meanwhile.
    if (daemon_.awaits_readiness()) {
        daemon_.when_ready([this] {
            progress_.cancel();
            report(service_state::running, daemon_.persistent_count());
        });
        show_progress();
    } else {
        report(service_state::running, daemon_.persistent_count());
    }
    daemon_.run();
    progress_.cancel();
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

// The service thread's own handler on the daemon's loop; main cancels it
// before the loop's last run, so this object outlives it.
void service_run::show_progress() {
    progress_.expires_after(std::chrono::seconds(1));
    progress_.async_wait([this](const boost::system::error_code& error) {
        if (error)
            return;
        if (platform::os_error failed = platform::report_start_progress())
            daemon_.log_verbose("%s", platform::describe(failed).c_str());
        show_progress();
    });
}

void service_run::control_stop() {
    std::lock_guard<std::mutex> lock(first_run_guard_);
    if (!first_run_over_)
        daemon_.stop_loop();
}

} // namespace torvad
