// The service manager on Linux: we count as started by it when NOTIFY_SOCKET
// is set; states go out through sd_notify and SIGTERM is its stop control.
#include "platform/platform.hpp"

#include <atomic>
#include <csignal>
#include <cstdlib>
#include <pthread.h>
#include <systemd/sd-daemon.h>
#include <thread>

namespace torvad::platform {

namespace {
// Sent by the service thread to the first thread when it has reported stopped.
// It counts only then: one sent from outside wakes the first thread for nothing.
constexpr int service_ended_signal = SIGUSR2;
} // namespace

bool run_service_dispatcher(const std::function<void()>& service_main,
                            const std::function<void()>& on_stop) {
    if (std::getenv("NOTIFY_SOCKET") == nullptr)
        return false;
    sigset_t waited;
    sigemptyset(&waited);
    sigaddset(&waited, SIGTERM);
    sigaddset(&waited, service_ended_signal);
    // Blocked before the thread starts, so both threads leave these to sigwait.
    pthread_sigmask(SIG_BLOCK, &waited, nullptr);
    std::atomic<bool> service_ended = false;
    pthread_t first_thread = pthread_self();
    std::thread service([&] {
        service_main();
        service_ended = true;
        pthread_kill(first_thread, service_ended_signal);
    });
    while (!service_ended) {
        int signal_number = 0;
        if (sigwait(&waited, &signal_number) == 0 && signal_number == SIGTERM)
            on_stop();
    }
    service.join();
    // Both stay blocked: the process is ending, and a stop request that comes
    // now must not end it by the default action before the PID file is gone.
    return true;
}

void report_service_state(service_state state) {
    switch (state) {
    case service_state::start_pending:
        sd_notify(0, "STATUS=starting");
        break;
    case service_state::running:
        sd_notify(0, "READY=1");
        break;
    case service_state::stop_pending:
        sd_notify(0, "STOPPING=1");
        break;
    case service_state::stopped:
        sd_notify(0, "STATUS=stopped");
        break;
    }
}

} // namespace torvad::platform
