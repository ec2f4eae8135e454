// torvad runs in a session of its own, its output on a pseudo-terminal or a
// pipe. Under Wine the terminal is its console: Wine draws on it and turns a
// typed Ctrl-C into the console's event.
#include "tests/e2e/harness.hpp"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <optional>
#include <poll.h>
#include <pty.h>
#include <regex>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <termios.h>
#include <thread>
#include <unistd.h>

namespace e2e {

namespace {

const char* const windows_build = std::getenv("TORVAD_WINDOWS_BUILD");
// The bound of a wait for an event; Wine moves every byte through its server.
const int event_wait_ms = windows_build ? 30000 : 10000;

std::string built(const char* here, const std::string& windows_name) {
    return windows_build ? windows_form(windows_build + ("/" + windows_name)) : here;
}

using clock = std::chrono::steady_clock;

int remaining_ms(clock::time_point deadline) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - clock::now());
    return left.count() > 0 ? static_cast<int>(left.count()) : 0;
}

// Appends to text the whole lines that Wine's console drew in raw, as they
// were written; gives how much of raw that took. A run of blanks is drawn as
// an erase and a move over it, a trailing blank as an erase, the cursor is
// hidden and shown around each change, and lines end in CR LF.
std::size_t console_text(const std::string& raw, std::string& text) {
    static const std::regex drawing("\x1b\\[\\?25[lh]|\x1b\\[K(?:\x1b\\[(\\d*)C|(?=\r))|\r(?=\n)");
    std::size_t end = raw.rfind('\n') + 1; // 0 when no line is whole yet
    auto from = raw.cbegin();
    for (std::sregex_iterator at(from, from + end, drawing), none; at != none; ++at) {
        const std::smatch& match = *at;
        text.append(match.prefix().first, match.prefix().second);
        if (match.str().starts_with("\x1b[K"))
            text.append(match[1].matched && match[1].length() > 0 ? std::stoul(match[1]) : 1, ' ');
        from = match.suffix().first;
    }
    text.append(from, raw.cbegin() + end);
    return end;
}

// The output end: a pipe, or a pty, raw (no \r\n); under Wine cooked, so that
// Ctrl-C is an interrupt, and wide enough that the console never wraps a line.
void open_output(bool terminal, int& ours, int& theirs) {
    winsize size{100, 8192, 0, 0};
    int ends[2];
    if (terminal ? openpty(&ends[0], &ends[1], nullptr, nullptr, &size) == -1 : pipe(ends) == -1)
        std::abort();
    ours = ends[0];
    theirs = ends[1];
    termios mode{};
    tcgetattr(theirs, &mode);
    if (under_wine)
        mode.c_lflag &= ~tcflag_t(ECHO), mode.c_oflag &= ~tcflag_t(ONLCR);
    else
        cfmakeraw(&mode);
    if (terminal)
        tcsetattr(theirs, TCSANOW, &mode);
    fcntl(ours, F_SETFD, FD_CLOEXEC);
}

// A signal to its session's group reaches only it and what it starts. Under
// Wine the terminal is its console, so also its stdin.
[[noreturn]] void exec_daemon(const std::vector<std::string>& args, const options& how, int out) {
    setsid();
    unsetenv("NOTIFY_SOCKET");
    bool console = under_wine && how.terminal;
    dup2(console ? out : open("/dev/null", O_RDONLY), 0);
    if (console)
        ioctl(0, TIOCSCTTY, 0);
    for (const auto& variable : how.env)
        putenv(const_cast<char*>(variable.c_str()));
    dup2(out, 1);
    dup2(out, 2);
    for (int fd = 3; fd < 1024; ++fd)
        close(fd);
    if (!how.directory.empty() && chdir(how.directory.c_str()) == -1)
        _exit(126);
    std::vector<std::string> command = {how.program.empty() ? torvad_binary : how.program};
    if (under_wine)
        command.insert(command.begin(), "wine");
    if (!how.shell.empty())
        command.insert(command.begin(), {"/bin/bash", "-c", how.shell + "; exec \"$@\"", "bash"});
    command.insert(command.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (auto& arg : command)
        argv.push_back(arg.data());
    argv.push_back(nullptr);
    execvp(argv[0], argv.data());
    _exit(127);
}

// torvad's run: its pid, the output read so far, and a cursor behind the last match.
struct daemon_run {
    daemon_run(const std::vector<std::string>& args, const options& how);
    ~daemon_run();
    daemon_run(const daemon_run&) = delete;

    // Reads until text appears behind the cursor (from, when given).
    bool wait_for(const std::string& text, std::size_t from = std::string::npos);
    // The exit code, or -1 when it didn't end in time (it is killed then).
    int wait_exit();
    // A stop request, to torvad or to its terminal's whole group.
    void signal(int signal_number, bool group = false);
    bool read_some(int timeout_ms); // false when nothing came in time

    int pid_ = -1, out_fd_ = -1, exit_code_ = -1;
    bool console_, eof_ = false, exited_ = false;
    std::string output_, drawn_; // drawn_: console bytes not yet told as text
    std::size_t cursor_ = 0;
};

// The service manager's end: a datagram socket that torvad reports its states to.
struct manager_socket {
    scratch_dir dir;
    int fd = bound_datagram_socket(dir.path + "/notify");
    ~manager_socket() { close(fd); }
    std::string next(int timeout_ms) { // "" when none comes in time
        pollfd ready{fd, POLLIN, 0};
        char message[256];
        ssize_t got = poll(&ready, 1, timeout_ms) == 1 ? recv(fd, message, sizeof message, 0) : 0;
        return std::string(message, got > 0 ? got : 0);
    }
};

} // namespace

const bool under_wine = windows_build != nullptr;
const std::string torvad_binary = built(TORVAD_BINARY, "torvad.exe");
const std::string child_binary = built(TEST_CHILD_BINARY, "tests/test_child");
const std::string child_file =
    windows_build ? std::string(windows_build) + "/tests/test_child.exe" : TEST_CHILD_BINARY;
const std::string tool_binary = built(TORVAD_PATTERNS_BINARY, "torvad-patterns.exe");
const std::string wrap_binary = built(TORVAD_WRAP_BINARY, "torvad-wrap.exe");
const std::string torvad_name = windows_build ? "torvad.exe" : "torvad";

bool holds_here(systems where) {
    return where != (under_wine ? systems::linux_only : systems::windows_only);
}

daemon_run::daemon_run(const std::vector<std::string>& args, const options& how)
    : console_(under_wine && how.terminal) {
    int theirs = -1;
    open_output(how.terminal, out_fd_, theirs);
    pid_ =
        how.first_process
            ? static_cast<int>(syscall(SYS_clone, CLONE_NEWPID | CLONE_NEWNS | SIGCHLD, 0, 0, 0, 0))
            : fork();
    if (pid_ == 0)
        exec_daemon(args, how, theirs);
    close(theirs);
}

daemon_run::~daemon_run() {
    if (!exited_ && kill(pid_, SIGKILL) == 0)
        waitpid(pid_, nullptr, 0);
    close(out_fd_);
}

bool daemon_run::read_some(int timeout_ms) {
    pollfd ready{out_fd_, POLLIN, 0};
    char buffer[4096];
    ssize_t got = 0;
    if (eof_ || poll(&ready, 1, timeout_ms) <= 0)
        return false;
    if ((got = read(out_fd_, buffer, sizeof buffer)) <= 0) {
        eof_ = true; // a pty gives EIO once every writer has gone
        return false;
    }
    if (console_)
        drawn_.append(buffer, got), drawn_.erase(0, console_text(drawn_, output_));
    else
        output_.append(buffer, got);
    return true;
}

int daemon_run::wait_exit() {
    auto deadline = clock::now() + std::chrono::milliseconds(event_wait_ms);
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
    // Wine's console may draw the last lines after the program has gone.
    while (read_some(under_wine ? 200 : 0)) {
    }
    return exited_ ? exit_code_ : -1;
}

// A console under Wine has one stop request, Ctrl-C, whatever was asked for.
// Typed, it is a SIGINT to the terminal's whole group, which holds any process
// Wine has forked for a launch and not yet started: its handler deadlocks on
// the allocator's lock, copied held, and torvad waits for the fork forever.
// So only !GROUP types it; the others send torvad alone the same signal.
// torvad itself can still take it inside such a fork and deadlock alike:
// that is Wine's handler, which no Windows program can mask.
void daemon_run::signal(int signal_number, bool group) {
    if (under_wine && group)
        (void)!write(out_fd_, "\x03", 1);
    else
        kill(group ? -pid_ : pid_, under_wine ? SIGINT : signal_number);
}

// Windows programs see the Linux root as drive Z:.
std::string windows_form(std::string path) {
    std::replace(path.begin(), path.end(), '/', '\\');
    return "Z:" + path;
}

bool daemon_run::wait_for(const std::string& text, std::size_t from) {
    auto deadline = clock::now() + std::chrono::milliseconds(event_wait_ms);
    std::size_t found;
    while ((found = output_.find(text, std::min(from, cursor_))) == std::string::npos)
        if (!read_some(remaining_ms(deadline)) && (eof_ || remaining_ms(deadline) == 0))
            return false;
    if (from == std::string::npos)
        cursor_ = found + text.size();
    return true;
}

namespace {

// A zombie is reaped by the loop's next turn; nothing tells us when that was.
bool no_zombie_within(int pid, int timeout_ms) {
    auto deadline = clock::now() + std::chrono::milliseconds(timeout_ms);
    for (;;) {
        std::ifstream children("/proc/" + std::to_string(pid) + "/task/" + std::to_string(pid) +
                               "/children");
        int zombies = 0;
        for (pid_t child; !under_wine && children >> child;)
            zombies += read_file("/proc/" + std::to_string(child) + "/stat").find(") Z ") !=
                       std::string::npos;
        if (zombies == 0 || clock::now() > deadline)
            return zombies == 0;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
}

} // namespace

void run_scenario(const std::vector<std::string>& args, const std::vector<std::string>& steps,
                  const options& how) {
    std::optional<manager_socket> manager;
    options given = how;
    if (how.manager)
        given.env.push_back("NOTIFY_SOCKET=" + manager.emplace().dir.path + "/notify");
    daemon_run run(args, given);
    const std::string& out = run.output_;
    int child = -1;
    for (const auto& step : steps) {
        std::string text = step.substr(1);
        if (step[0] == '?')
            EXPECT_TRUE(run.wait_for(text)) << "waited for: " << text << "\n" << out;
        else if (step == "!GROUP")
            run.signal(SIGINT, true);
        else if (step == "!USR2")
            kill(run.pid_, SIGUSR2);
        else if (step[0] == '!')
            run.signal(text == "INT" ? SIGINT : SIGTERM);
        else if (step == "@*" && manager)
            while (!manager->next(0).empty()) {
            }
        else if (std::string got; step[0] == '@' && manager)
            EXPECT_TRUE(std::regex_match(got = manager->next(text.empty() ? 0 : event_wait_ms),
                                         std::regex(text)))
                << text << " got " << got << "\n"
                << out;
        else if (step[0] == '#')
            child = run.wait_for(text + "=") ? std::atoi(out.c_str() + run.cursor_) : -1;
        else if (step.rfind("kill ", 0) == 0 && child > 0)
            kill(child, std::atoi(step.c_str() + 5));
        else if (step[0] == 'P') // under Wine the pid is Windows', which we don't see
            EXPECT_EQ(read_file(text),
                      std::to_string(under_wine ? std::atoi(read_file(text).c_str()) : run.pid_) +
                          "\n");
        else if (step[0] == '=')
            EXPECT_EQ(run.wait_exit(), std::atoi(text.c_str())) << out;
        else if (step[0] == '$')
            EXPECT_EQ(std::system(text.c_str()), 0) << text << "\n" << out;
        else if (step == "z")
            EXPECT_TRUE(no_zombie_within(run.pid_, event_wait_ms)) << out;
        else if (step[0] == '&')
            EXPECT_TRUE(run.wait_for(text, 0)) << "waited for: " << text << "\n" << out;
        else if (step[0] == '-')
            EXPECT_EQ(out.find(text), std::string::npos) << text << "\n" << out;
        else
            ADD_FAILURE() << "bad step " << step;
    }
}

void run_rows(const std::vector<row>& rows) {
    for (const auto& r : rows) {
        if (!holds_here(r.how.where) || (r.how.as_root && geteuid() != 0))
            continue;
        SCOPED_TRACE(::testing::PrintToString(r.args).substr(0, 200));
        run_scenario(r.args, r.steps, r.how);
    }
}

scratch_dir::scratch_dir() : path(std::filesystem::temp_directory_path() / "torvad-test-XXXXXX") {
    // Open to all, as a service account's child may have to enter it.
    if (mkdtemp(path.data()) == nullptr || chmod(path.c_str(), 0755) == -1)
        std::abort();
}

scratch_dir::~scratch_dir() {
    std::error_code ignored;
    std::filesystem::remove_all(path, ignored);
}

std::vector<std::string> child(std::vector<std::string> mode, std::vector<std::string> options) {
    options.insert(options.end(), {"--", child_binary});
    options.insert(options.end(), mode.begin(), mode.end());
    return options;
}

std::string read_file(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
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

} // namespace e2e
