#include "tests/e2e/harness.hpp"

#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <poll.h>
#include <pty.h>
#include <sstream>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <termios.h>
#include <unistd.h>

namespace e2e {

const char* const torvad_binary = TORVAD_BINARY;
const char* const child_binary = TEST_CHILD_BINARY;

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
    fcntl(how.inherit, F_SETFD, 0);
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

daemon_run::daemon_run(const std::vector<std::string>& args, const options& how) {
    int theirs = -1;
    open_output(how.terminal, out_fd_, theirs);
    pid_ = fork();
    if (pid_ == 0)
        exec_daemon(args, how, theirs);
    close(theirs);
}

daemon_run::~daemon_run() {
    if (!exited_) {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    close(out_fd_);
}

bool daemon_run::read_some(int timeout_ms) {
    if (eof_)
        return false;
    pollfd ready{out_fd_, POLLIN, 0};
    if (poll(&ready, 1, timeout_ms) <= 0)
        return false;
    char buffer[4096];
    ssize_t got = read(out_fd_, buffer, sizeof buffer);
    if (got <= 0) {
        eof_ = true; // a pty gives EIO once every writer has gone
        return false;
    }
    output_.append(buffer, got);
    return true;
}

bool daemon_run::wait_for(const std::string& text, int timeout_ms) {
    auto deadline = clock::now() + std::chrono::milliseconds(timeout_ms);
    for (;;) {
        auto found = output_.find(text, cursor_);
        if (found != std::string::npos) {
            cursor_ = found + text.size();
            return true;
        }
        if (!read_some(remaining_ms(deadline)) && (eof_ || remaining_ms(deadline) == 0))
            return false;
    }
}

bool daemon_run::wait_anywhere(const std::string& text, int timeout_ms) {
    std::size_t kept = cursor_;
    cursor_ = 0;
    bool found = wait_for(text, timeout_ms);
    cursor_ = kept;
    return found;
}

std::string daemon_run::wait_value(const std::string& key, int timeout_ms) {
    if (!wait_for(key + "=", timeout_ms))
        return {};
    std::size_t end = cursor_;
    while (end < output_.size() && !std::isspace(static_cast<unsigned char>(output_[end])))
        ++end;
    std::string value = output_.substr(cursor_, end - cursor_);
    cursor_ = end;
    return value;
}

int daemon_run::wait_exit(int timeout_ms) {
    auto deadline = clock::now() + std::chrono::milliseconds(timeout_ms);
    int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid_, 0));
    while (!exited_) {
        // Output keeps flowing while we wait, and must be drained for a pty.
        pollfd ready[2] = {{pidfd, POLLIN, 0}, {eof_ ? -1 : out_fd_, POLLIN, 0}};
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

void run_scenario(const std::vector<std::string>& args, const std::vector<std::string>& steps,
                  const options& how, const step_hook& hook) {
    daemon_run run(args, how);
    int child = -1;
    for (const auto& step : steps) {
        std::string text = step.substr(1);
        if (hook && hook(step, run))
            continue;
        if (step[0] == '?')
            EXPECT_TRUE(run.wait_for(text)) << "waited for: " << text << "\n" << run.output();
        else if (step == "!GROUP")
            kill(-run.pid(), SIGINT);
        else if (step[0] == '!')
            run.signal(text == "INT" ? SIGINT : SIGTERM);
        else if (step[0] == 'M')
            EXPECT_LT(peak_memory_kib(run.pid()), std::atoi(text.c_str()) * 1024);
        else if (step[0] == '#')
            child = std::atoi(run.wait_value(text).c_str());
        else if (step.rfind("kill ", 0) == 0 && child > 0)
            kill(child, std::atoi(step.c_str() + 5));
        else if (step[0] == '=')
            EXPECT_EQ(run.wait_exit(), std::atoi(text.c_str())) << run.output();
        else if (step == "Z")
            EXPECT_EQ(zombie_children(run.pid()), 0);
        else if (step[0] == '&')
            EXPECT_TRUE(run.wait_anywhere(text)) << "waited for: " << text << "\n" << run.output();
        else if (step[0] == '+')
            EXPECT_NE(run.output().find(text), std::string::npos) << text << "\n" << run.output();
        else if (step[0] == '-')
            EXPECT_EQ(run.output().find(text), std::string::npos) << text << "\n" << run.output();
        else
            ADD_FAILURE() << "bad step " << step;
    }
}

scratch_dir::scratch_dir() {
    char name[] = "/tmp/torvad-test-XXXXXX";
    path = mkdtemp(name);
}

scratch_dir::~scratch_dir() {
    std::filesystem::remove_all(path);
}

bool file_exists(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

std::string read_file(const std::string& path) {
    std::ifstream file(path);
    std::stringstream text;
    text << file.rdbuf();
    return text.str();
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

long peak_memory_kib(pid_t pid) {
    std::string status = read_file("/proc/" + std::to_string(pid) + "/status");
    auto peak = status.find("VmHWM:");
    return peak == std::string::npos ? -1 : std::atol(status.c_str() + peak + 6);
}

int zombie_children(pid_t pid) {
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
