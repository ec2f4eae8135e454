// The supervisor's own process, files, descriptors and the event log on Linux.
#include "platform/platform.hpp"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include <boost/filesystem/operations.hpp>
#include <boost/process/search_path.hpp>

namespace torvad::platform {

const char* const exe_suffix = "";

std::string describe(const os_error& error) {
    return std::string(error.call) + ": " + std::strerror(error.code);
}

void prepare_own_process() {
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
    signal(SIGCHLD, SIG_DFL);
    signal(SIGPIPE, SIG_IGN);
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
}

int current_process_id() {
    return static_cast<int>(getpid());
}

bool stdout_is_terminal() {
    return isatty(STDOUT_FILENO) == 1;
}

bool change_directory(const std::string& path) {
    return chdir(path.c_str()) == 0;
}

std::tm local_time_now() {
    std::time_t now = std::time(nullptr);
    std::tm local{};
    localtime_r(&now, &local);
    return local;
}

bool write_pid_file(const std::string& path, int pid) {
    std::FILE* file = std::fopen(path.c_str(), "w");
    if (file == nullptr)
        return false;
    std::fprintf(file, "%d\n", pid);
    return std::fclose(file) == 0;
}

void remove_file(const std::string& path) {
    std::remove(path.c_str());
}

std::string absolute_path(const std::string& path, os_error& error) {
    // An absolute name needs no current directory, which may have been deleted.
    if (boost::filesystem::path(path).is_absolute())
        return boost::filesystem::path(path).lexically_normal().string();
    boost::system::error_code failure;
    auto directory = boost::filesystem::current_path(failure);
    if (failure) {
        error = {failure.value(), "getcwd"};
        return path;
    }
    return boost::filesystem::absolute(path, directory).lexically_normal().string();
}

std::string search_path(const std::string& name) {
    return boost::process::search_path(name).string();
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

void close_descriptor(int fd) {
    if (fd >= 0)
        close(fd);
}

os_error make_ipc_pair(int& ours, int& theirs) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == -1)
        return {errno, "socketpair"};
    ours = fds[0];
    theirs = fds[1];
    return {};
}

os_error make_pipe(int& read_end, int& write_end) {
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) == -1)
        return {errno, "pipe2"};
    read_end = fds[0];
    write_end = fds[1];
    return {};
}

bool descriptor_is_open(int fd) {
    return fd >= 0 && fcntl(fd, F_GETFD) != -1;
}

} // namespace torvad::platform
