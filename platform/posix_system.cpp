// The supervisor's own process, files, descriptors and the event log on Linux.
#include "platform/platform.hpp"

#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include <boost/filesystem/operations.hpp>

namespace torvad::platform {

const char* const exe_suffix = "";

int current_process_id() {
    return static_cast<int>(getpid());
}

bool stdout_is_terminal() {
    return isatty(STDOUT_FILENO) == 1;
}

void ensure_standard_descriptors() {
    for (int fd = 0; fd < 3; ++fd) {
        if (fcntl(fd, F_GETFD) != -1)
            continue;
        // open gives the lowest free number, which is fd itself here.
        int null_fd = open("/dev/null", O_RDWR);
        if (null_fd != -1 && null_fd != fd)
            close(null_fd);
    }
}

void ignore_broken_pipes() {
    signal(SIGPIPE, SIG_IGN);
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

std::string absolute_path(const std::string& path) {
    boost::system::error_code error;
    auto absolute = boost::filesystem::absolute(path, boost::filesystem::current_path(error));
    return error ? path : absolute.lexically_normal().string();
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

int make_ipc_pair(int& ours, int& theirs) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == -1)
        return errno;
    ours = fds[0];
    theirs = fds[1];
    return 0;
}

bool descriptor_is_open(int fd) {
    return fd >= 0 && fcntl(fd, F_GETFD) != -1;
}

} // namespace torvad::platform
