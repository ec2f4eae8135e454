// The service manager on Linux: we count as started by it when NOTIFY_SOCKET
// is set; states go out as notify datagrams and SIGTERM is its stop control.
#include "platform/platform.hpp"

#include <atomic>
#include <csignal>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <pthread.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>

namespace torvad::platform {

namespace {
// Sent by the service thread to the first thread when it has reported stopped.
// It counts only then: one sent from outside wakes the first thread for nothing.
constexpr int service_ended_signal = SIGUSR2;
} // namespace

void hold_stop_requests() {
    sigset_t stop;
    sigemptyset(&stop);
    sigaddset(&stop, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &stop, nullptr);
}

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
    std::thread service;
    try {
        service = std::thread([&] {
            service_main();
            service_ended = true;
            pthread_kill(first_thread, service_ended_signal);
        });
    } catch (const std::system_error&) {
        // No thread, no service: as if the manager had not started us.
        return false;
    }
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

namespace {

// The notify protocol is one datagram of text to the socket the manager
// named; that is all the supervisor needs of the manager's client library,
// which would bring six more libraries into every run.
void notify_service_manager(const char* state) {
    const char* path = std::getenv("NOTIFY_SOCKET");
    sockaddr_un address{};
    std::size_t length = path == nullptr ? 0 : std::strlen(path);
    if (length == 0 || length >= sizeof address.sun_path)
        return;
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path, length);
    if (address.sun_path[0] == '@')
        address.sun_path[0] = '\0'; // an abstract socket
    int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd == -1)
        return;
    sendto(fd, state, std::strlen(state), MSG_NOSIGNAL, reinterpret_cast<sockaddr*>(&address),
           static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + length));
    close(fd);
}

} // namespace

void report_service_state(service_state state) {
    static const char* const messages[] = {"STATUS=starting", "READY=1", "STOPPING=1",
                                           "STATUS=stopped"};
    notify_service_manager(messages[static_cast<int>(state)]);
}

} // namespace torvad::platform
