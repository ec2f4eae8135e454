// The service manager on Linux: we count as started by it when NOTIFY_SOCKET
// is set, or when we are the first process of a PID namespace, a container's
// entrypoint, whose runtime stands for the manager. States go out as notify
// datagrams where there is a socket, and SIGTERM is the stop control.
#include "platform/platform.hpp"

#include <atomic>
#include <csignal>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <pthread.h>
#include <string>
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

os_error hold_stop_requests() {
    sigset_t stop;
    sigemptyset(&stop);
    sigaddset(&stop, SIGTERM);
    if (int error = pthread_sigmask(SIG_BLOCK, &stop, nullptr))
        return {error, "pthread_sigmask"};
    return {};
}

// The manager knows us by the unit, not by a name we give.
bool run_service_dispatcher(const std::string& /*name*/, const std::function<void()>& service_main,
                            const std::function<void()>& on_stop) {
    if (std::getenv("NOTIFY_SOCKET") == nullptr && getpid() != 1)
        return false;
    sigset_t waited;
    sigemptyset(&waited);
    sigaddset(&waited, SIGTERM);
    sigaddset(&waited, service_ended_signal);
    // Blocked before the thread starts, so both threads leave these to sigwait;
    // unblocked, the stop would end us by its default action: no service then.
    if (pthread_sigmask(SIG_BLOCK, &waited, nullptr) != 0)
        return false;
    std::atomic<bool> service_ended = false;
    pthread_t first_thread = pthread_self();
    std::thread service;
    try {
        service = std::thread([&] {
            service_main();
            service_ended = true;
            // Sent to the process instead, it waits, blocked, for the sigwait.
            if (pthread_kill(first_thread, service_ended_signal) != 0 &&
                kill(getpid(), service_ended_signal) == -1)
                std::abort(); // nothing else could wake the first thread
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
os_error notify_service_manager(const char* state) {
    const char* path = std::getenv("NOTIFY_SOCKET");
    sockaddr_un address{};
    std::size_t length = path == nullptr ? 0 : std::strlen(path);
    if (length == 0 || length >= sizeof address.sun_path)
        return {};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path, length);
    if (address.sun_path[0] == '@')
        address.sun_path[0] = '\0'; // an abstract socket
    owned_handle fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    if (!fd.valid())
        return {errno, "socket"};
    if (sendto(fd.get(), state, std::strlen(state), MSG_NOSIGNAL,
               reinterpret_cast<sockaddr*>(&address),
               static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + length)) == -1)
        return {errno, "sendto"};
    return {};
}

// The state last reported and the persistent children last counted: the
// status text names both, as the manager shows it to the operator.
service_state reported_state = service_state::start_pending;
std::size_t counted_children = 0;

std::string children_text(std::size_t count) {
    return std::to_string(count) + (count == 1 ? " child" : " children");
}

// What the operator reads beside the state, e.g. "running, 2 children".
std::string status_text(service_state state) {
    switch (state) {
    case service_state::start_pending:
        return "starting";
    case service_state::running:
        return "running, " + children_text(counted_children);
    case service_state::stop_pending:
        return "stopping, waiting for " + children_text(counted_children);
    case service_state::stopped:
        break;
    }
    return "stopped";
}

} // namespace

os_error report_service_state(service_state state, std::size_t children) {
    static const char* const changes[] = {"", "READY=1\n", "STOPPING=1\n", ""};
    reported_state = state;
    counted_children = children;
    return notify_service_manager(
        (changes[static_cast<int>(state)] + ("STATUS=" + status_text(state))).c_str());
}

os_error report_service_children(std::size_t count) {
    if (count == counted_children)
        return {};
    counted_children = count;
    if (reported_state != service_state::running && reported_state != service_state::stop_pending)
        return {};
    return notify_service_manager(("STATUS=" + status_text(reported_state)).c_str());
}

os_error report_start_progress() {
    return {};
}

} // namespace torvad::platform
