// The supervisor's own process, its files and the event log on Linux.
#include "platform/platform.hpp"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <syslog.h>
#include <unistd.h>

namespace torvad::platform {

const char* const exe_suffix = "";
const int error_not_found = ENOENT;

std::string describe(const os_error& error) {
    return std::string(error.call) + ": " + std::strerror(error.code);
}

os_error prepare_own_process() {
    os_error first;
    for (int fd = 0; fd < 3; ++fd) {
        if (fcntl(fd, F_GETFD) != -1)
            continue;
        // open gives the lowest free number, which is fd itself here.
        int null_fd = open("/dev/null", O_RDWR);
        if (null_fd != -1 && null_fd != fd)
            close(null_fd);
    }
    // An inherited SIGCHLD ignore would have the kernel reap our children
    // before we could read how they ended.
    if (signal(SIGCHLD, SIG_DFL) == SIG_ERR)
        first = {errno, "signal"};
    if (signal(SIGPIPE, SIG_IGN) == SIG_ERR && !first)
        first = {errno, "signal"};
    sigset_t none;
    sigemptyset(&none);
    if (sigprocmask(SIG_SETMASK, &none, nullptr) == -1 && !first)
        first = {errno, "sigprocmask"};
    return first;
}

int current_process_id() {
    return static_cast<int>(getpid());
}

void unbuffer_output() {
    // A line is worth seeing at once, also when stdout is a pipe or a journal.
    std::setvbuf(stdout, nullptr, _IOLBF, 0);
}

bool stdout_is_terminal() {
    return isatty(STDOUT_FILENO) == 1;
}

// A terminal takes them; nothing needs to be switched on.
bool console_takes_colour() {
    return stdout_is_terminal();
}

bool change_directory(const std::string& path) {
    return chdir(path.c_str()) == 0;
}

std::tm local_time_now() {
    std::time_t now = std::time(nullptr);
    std::tm local{};
    // A time that can't be broken down is stamped with zeros.
    if (localtime_r(&now, &local) == nullptr)
        return {};
    return local;
}

os_error read_file(const std::string& path, std::string& content) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd == -1)
        return {errno, "open"};
    char buffer[65536];
    for (;;) {
        ssize_t got = read(fd, buffer, sizeof buffer);
        if (got > 0) {
            content.append(buffer, static_cast<std::size_t>(got));
            continue;
        }
        if (got == -1 && errno == EINTR)
            continue;
        os_error error = got == -1 ? os_error{errno, "read"} : os_error{};
        close(fd);
        return error;
    }
}

void write_event_record(event_type type, const char* text) {
    // Opened once, by whichever thread logs first; the static's guard makes
    // the others wait for it.
    static const bool opened = [] {
        openlog("torvad", LOG_PID, LOG_DAEMON);
        return true;
    }();
    (void)opened;
    int priority = type == event_type::error     ? LOG_ERR
                   : type == event_type::warning ? LOG_WARNING
                                                 : LOG_INFO;
    syslog(priority, "%s", text);
}

void close_handle(native_handle handle) {
    close(handle);
}

} // namespace torvad::platform
