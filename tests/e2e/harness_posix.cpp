// Linux: torvad runs in a session of its own with its output on a raw
// pseudo-terminal or a pipe; its exit is watched through a pidfd.
#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <poll.h>
#include <pty.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <termios.h>
#include <unistd.h>

#include "tests/e2e/harness.hpp"

namespace e2e {

struct daemon_run::system_part {
    int out_fd = -1;
};

namespace {

using clock = std::chrono::steady_clock;

int remaining_ms(clock::time_point deadline) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - clock::now());
    return left.count() > 0 ? static_cast<int>(left.count()) : 0;
}

// Makes the output end of the test: a raw pty (no \r\n translation) or a pipe.
void open_output(bool terminal, int& ours, int& theirs) {
    if (terminal) {
        if (openpty(&ours, &theirs, nullptr, nullptr, nullptr) == -1)
            std::abort();
        termios mode{};
        tcgetattr(theirs, &mode);
        cfmakeraw(&mode);
        tcsetattr(theirs, TCSANOW, &mode);
    } else {
        int fds[2];
        if (pipe(fds) == -1)
            std::abort();
        ours = fds[0];
        theirs = fds[1];
    }
    fcntl(ours, F_SETFD, FD_CLOEXEC);
}

// In a session of its own, so that a signal to its group reaches only it
// and what it starts.
[[noreturn]] void exec_daemon(const std::vector<std::string>& args, const options& how, int out) {
    setsid();
    unsetenv("NOTIFY_SOCKET");
    std::string null_node = how.dev + "/null";
    if (!how.dev.empty() &&
        (unshare(CLONE_NEWNS) == -1 ||
         mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == -1 ||
         mount("/dev/null", null_node.c_str(), nullptr, MS_BIND, nullptr) == -1 ||
         mount(how.dev.c_str(), "/dev", nullptr, MS_BIND | MS_REC, nullptr) == -1))
        _exit(125);
    int null_fd = open("/dev/null", O_RDONLY);
    dup2(null_fd, 0);
    if (how.close_stdin)
        close(0);
    if (how.ignore_sigchld)
        signal(SIGCHLD, SIG_IGN);
    if (how.fd_limit != 0) {
        rlimit limit{rlim_t(how.fd_limit), rlim_t(how.fd_limit)};
        setrlimit(RLIMIT_NOFILE, &limit);
    }
    for (const auto& variable : how.env)
        putenv(const_cast<char*>(variable.c_str()));
    dup2(out, 1);
    dup2(out, 2);
    for (int fd = 3; fd < 1024; ++fd)
        if (fd != how.inherit)
            close(fd);
    fcntl(static_cast<int>(how.inherit), F_SETFD, 0);
    if (!how.directory.empty() && chdir(how.directory.c_str()) == -1)
        _exit(126);
    std::vector<char*> argv{const_cast<char*>(torvad_binary)};
    for (const auto& arg : args)
        argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);
    execv(torvad_binary, argv.data());
    _exit(127);
}

} // namespace

const int event_wait_ms = 10000;
const int dispatcher_refusal_ms = 10000;

bool holds_here(systems where) {
    return where != systems::windows_only;
}

daemon_run::daemon_run(const std::vector<std::string>& args, const options& how)
    : system_(std::make_unique<system_part>()) {
    int theirs = -1;
    open_output(how.terminal, system_->out_fd, theirs);
    // A fork whose child is the first process of a new PID namespace.
    pid_ = how.pid_namespace
               ? static_cast<pid_t>(syscall(SYS_clone, CLONE_NEWPID | SIGCHLD, 0, 0, 0, 0))
               : fork();
    if (pid_ == 0)
        exec_daemon(args, how, theirs);
    close(theirs);
}

daemon_run::~daemon_run() {
    if (!exited_) {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    close(system_->out_fd);
}

bool daemon_run::read_some(int timeout_ms) {
    if (eof_)
        return false;
    pollfd ready{system_->out_fd, POLLIN, 0};
    if (poll(&ready, 1, timeout_ms) <= 0)
        return false;
    char buffer[4096];
    ssize_t got = read(system_->out_fd, buffer, sizeof buffer);
    if (got <= 0) {
        eof_ = true; // a pty gives EIO once every writer has gone
        return false;
    }
    output_.append(buffer, got);
    return true;
}

int daemon_run::wait_exit(int timeout_ms) {
    auto deadline = clock::now() + std::chrono::milliseconds(timeout_ms);
    int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid_, 0));
    while (!exited_) {
        // Output keeps flowing while we wait, and must be drained for a pty.
        pollfd ready[2] = {{pidfd, POLLIN, 0}, {eof_ ? -1 : system_->out_fd, POLLIN, 0}};
        if (poll(ready, 2, remaining_ms(deadline)) <= 0)
            break;
        if (ready[1].revents != 0)
            read_some(0);
        int status = 0;
        if (ready[0].revents != 0 && waitpid(pid_, &status, 0) == pid_) {
            exited_ = true;
            exit_code_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
        }
    }
    close(pidfd);
    while (read_some(0)) {
    }
    return exited_ ? exit_code_ : -1;
}

void daemon_run::signal(int signal_number) {
    kill(pid_, signal_number);
}

void daemon_run::interrupt_group() {
    kill(-pid_, SIGINT);
}

void kill_process(int pid, int signal_number) {
    kill(pid, signal_number);
}

bool make_link_pair(int& ours, long& theirs) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == -1)
        return false;
    ours = fds[0];
    theirs = fds[1];
    return true;
}

bool running_as_root() {
    return geteuid() == 0;
}

int bound_datagram_socket(const std::string& path) {
    int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    if (bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == -1)
        ADD_FAILURE() << "bind " << path;
    return fd;
}

notify_socket::notify_socket() : fd_(bound_datagram_socket(dir_.path + "/notify")) {}

notify_socket::~notify_socket() {
    close(fd_);
}

std::string notify_socket::next(int timeout_ms) {
    pollfd ready{fd_, POLLIN, 0};
    char message[256];
    ssize_t got = poll(&ready, 1, timeout_ms) == 1 ? recv(fd_, message, sizeof message, 0) : 0;
    return std::string(message, got > 0 ? got : 0);
}

step_hook service_steps(notify_socket& manager) {
    return [&manager](const std::string& step, daemon_run& run) {
        if (step == "!USR2") {
            run.signal(SIGUSR2);
        } else if (step == "@*") {
            while (!manager.next(0).empty()) {
            }
        } else if (step[0] == '@') {
            EXPECT_EQ(manager.next(), step.substr(1)) << run.output();
        }
        return step == "!USR2" || step[0] == '@';
    };
}

reachable_child::reachable_child() : path(dir.path + "/test_child") {
    std::filesystem::permissions(dir.path, std::filesystem::perms(0755));
    std::filesystem::copy(child_binary, path);
}

long peak_memory_kib(int pid) {
    std::string status = read_file("/proc/" + std::to_string(pid) + "/status");
    auto peak = status.find("VmHWM:");
    return peak == std::string::npos ? -1 : std::atol(status.c_str() + peak + 6);
}

int zombie_children(int pid) {
    std::ifstream children("/proc/" + std::to_string(pid) + "/task/" + std::to_string(pid) +
                           "/children");
    int zombies = 0;
    for (pid_t child; children >> child;) {
        std::string stat = read_file("/proc/" + std::to_string(child) + "/stat");
        zombies += stat.find(") Z ") != std::string::npos;
    }
    return zombies;
}

} // namespace e2e
