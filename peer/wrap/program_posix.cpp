#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <optional>
#include <poll.h>
#include <spawn.h>
#include <string_view>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include "peer/wrap/program.hpp"

extern char** environ;

namespace torvad::wrap {

int signal_by_name(const std::string& name) {
    std::string_view word = name;
    if (word.starts_with("SIG"))
        word.remove_prefix(3);
    for (int number = 1; number < NSIG; ++number) {
        const char* abbreviation = sigabbrev_np(number);
        if ((abbreviation != nullptr && word == abbreviation) || word == std::to_string(number))
            return number;
    }
    return -1;
}

int default_stop_signal() {
    return SIGTERM;
}

void keep_link_from_program(long link) {
    int fd = static_cast<int>(link);
    int flags = fcntl(fd, F_GETFD);
    if (flags != -1)
        fcntl(fd, F_SETFD, flags | FD_CLOEXEC);
}

// The program starts as a program started by a shell would: default signal
// actions, nothing blocked, though we ignore Ctrl-C and hold our stop signals.
int start_program(const std::vector<std::string>& command, const std::string& notify_address,
                  int stop_signal, running_program& out) {
    out.stop_signal = stop_signal;
    if (notify_address.empty() ? unsetenv("NOTIFY_SOCKET") == -1
                               : setenv("NOTIFY_SOCKET", notify_address.c_str(), 1) == -1)
        return errno;
    posix_spawnattr_t attributes;
    if (int error = posix_spawnattr_init(&attributes))
        return error;
    sigset_t none, all;
    sigemptyset(&none);
    sigfillset(&all);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETPGROUP | POSIX_SPAWN_SETSIGMASK |
                                              POSIX_SPAWN_SETSIGDEF);
    posix_spawnattr_setpgroup(&attributes, 0);
    posix_spawnattr_setsigmask(&attributes, &none);
    posix_spawnattr_setsigdefault(&attributes, &all);
    std::vector<char*> argv;
    for (const auto& item : command)
        argv.push_back(const_cast<char*>(item.c_str()));
    argv.push_back(nullptr);
    pid_t pid = 0;
    int error = posix_spawnp(&pid, argv[0], nullptr, &attributes, argv.data(), environ);
    posix_spawnattr_destroy(&attributes);
    out.pid = pid;
    return error;
}

// A group already gone has nothing left to stop: its end is on its way.
stop_failure stop_program(const running_program& program) {
    if (kill(-static_cast<pid_t>(program.pid), program.stop_signal) == -1 && errno != ESRCH)
        return {errno, "kill"};
    return {};
}

std::string error_text(int error) {
    return std::strerror(error);
}

// An abstract address the kernel picks (autobind): unique, and gone with us.
notify_socket open_notify_socket() {
    int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd == -1)
        return {-1, {}, errno};
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    socklen_t length = sizeof address.sun_family;
    if (bind(fd, reinterpret_cast<sockaddr*>(&address), length) == -1 ||
        (length = sizeof address,
         getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length) == -1)) {
        int error = errno;
        close(fd);
        return {-1, {}, error};
    }
    std::string name(address.sun_path + 1, length - sizeof address.sun_family - 1);
    return {fd, "@" + name, 0};
}

long receive_notification(const notify_socket& socket, char* buffer, std::size_t size,
                          bool& too_long) {
    for (;;) {
        ssize_t got = recv(static_cast<int>(socket.fd), buffer, size, MSG_TRUNC);
        if (got == -1 && errno == EINTR)
            continue;
        too_long = got > static_cast<ssize_t>(size);
        return got;
    }
}

namespace {

// Our stop requests and the program's end: blocked but while serve waits,
// so that none is lost, and each only noted by its handler.
sigset_t held_signals() {
    sigset_t held;
    sigemptyset(&held);
    for (int number : {SIGTERM, SIGHUP, SIGCHLD})
        sigaddset(&held, number);
    return held;
}

volatile std::sig_atomic_t stop_asked = 0;
void note_stop(int) {
    stop_asked = 1;
}
// The end is read by reap itself: the signal only ends the wait.
void note_end(int) {}

// The program's end once it has ended; with WNOHANG nothing while it runs.
std::optional<program_end> reap(const running_program& program, int options) {
    int status = 0;
    pid_t pid = waitpid(static_cast<pid_t>(program.pid), &status, options);
    if (pid == 0 || (pid == -1 && errno == EINTR))
        return std::nullopt;
    if (pid == -1)
        return program_end{128, 0};
    if (WIFEXITED(status))
        return program_end{WEXITSTATUS(status), 0};
    return program_end{128 + WTERMSIG(status), WTERMSIG(status)};
}

} // namespace

void hold_own_stop_requests() {
    signal(SIGINT, SIG_IGN);
    sigset_t held = held_signals();
    sigprocmask(SIG_BLOCK, &held, nullptr);
    struct sigaction stop = {}, end = {};
    stop.sa_handler = note_stop;
    end.sa_handler = note_end;
    end.sa_flags = SA_NOCLDSTOP; // a program stopped at the terminal hasn't ended
    sigaction(SIGTERM, &stop, nullptr);
    sigaction(SIGHUP, &stop, nullptr);
    sigaction(SIGCHLD, &end, nullptr);
}

// One thread waits for everything, so that the wrapper starts and ends as a
// single thread does: a restart through it costs little more than a
// process's start and end. The held signals come in only during ppoll, whose
// wait they end.
program_end serve(const running_program& program, long link, const notify_socket& socket,
                  const handlers& on) {
    sigset_t waiting;
    sigprocmask(SIG_BLOCK, nullptr, &waiting);
    for (int number : {SIGTERM, SIGHUP, SIGCHLD})
        sigdelset(&waiting, number);
    pollfd waits[] = {{static_cast<int>(link), POLLIN, 0},
                      {static_cast<int>(socket.fd), POLLIN, 0}};
    for (;;) {
        if (auto end = reap(program, WNOHANG))
            return *end;
        if (stop_asked) {
            stop_asked = 0;
            on.on_stop();
        }
        if (ppoll(waits, 2, nullptr, &waiting) == -1) {
            // Interrupted by a held signal, noted above; past any other
            // failure the wrapper can still end with its program.
            if (errno == EINTR)
                continue;
            for (;;)
                if (auto end = reap(program, 0))
                    return *end;
        }
        if (waits[0].revents != 0 && !on.on_link())
            waits[0].fd = -1;
        if (waits[1].revents != 0 && !on.on_notification())
            waits[1].fd = -1;
    }
}

} // namespace torvad::wrap
