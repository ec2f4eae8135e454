// The service manager on Linux: we count as started by it when NOTIFY_SOCKET
// is set; states go out through sd_notify and SIGTERM is its stop control.
#include "platform/platform.hpp"

#include <csignal>
#include <cstdlib>
#include <pthread.h>
#include <systemd/sd-daemon.h>
#include <thread>

namespace torvad::platform {

namespace {
// Sent by the service thread to the first thread when it has reported stopped.
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
    pthread_t first_thread = pthread_self();
    std::thread service([&] {
        service_main();
        pthread_kill(first_thread, service_ended_signal);
    });
    for (;;) {
        int signal_number = 0;
        if (sigwait(&waited, &signal_number) != 0 || signal_number == service_ended_signal)
            break;
        on_stop();
    }
    service.join();
    pthread_sigmask(SIG_UNBLOCK, &waited, nullptr);
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
