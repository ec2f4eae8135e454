// Launching, watching and ending children on Linux: fork and exec with a
// close-on-exec status pipe, pidfds for the exit, accounts resolved up front.
#include "platform/platform.hpp"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <strings.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

extern char** environ;

namespace torvad::platform {

namespace {

// What the child reports through the status pipe when it can't reach exec.
struct child_failure {
    int step;
    int error;
};

std::string local_account_name(const std::string& user, bool& this_machine) {
    auto slash = user.find('\\');
    std::string domain = slash == std::string::npos ? std::string() : user.substr(0, slash);
    std::string name = slash == std::string::npos ? user : user.substr(slash + 1);
    bool nt_authority = strcasecmp(domain.c_str(), "NT Authority") == 0;
    this_machine = domain.empty() || domain == "." || nt_authority;
    // The built-in service accounts of the other system map to local ones.
    if (nt_authority && (strcasecmp(name.c_str(), "LocalService") == 0 ||
                         strcasecmp(name.c_str(), "NetworkService") == 0))
        return "nobody";
    if ((nt_authority && strcasecmp(name.c_str(), "System") == 0) ||
        (domain.empty() && strcasecmp(name.c_str(), "LocalSystem") == 0))
        return "root";
    return name;
}

} // namespace

int resolve_account(const std::string& user, account& out) {
    bool this_machine = false;
    std::string name = local_account_name(user, this_machine);
    if (!this_machine)
        return ENOENT;
    std::vector<char> buffer(16384);
    passwd entry{};
    passwd* found = nullptr;
    int error = getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
    if (found == nullptr)
        return error != 0 ? error : ENOENT;
    out.uid = entry.pw_uid;
    out.gid = entry.pw_gid;
    out.change = entry.pw_uid != geteuid() || entry.pw_gid != getegid();
    if (!out.change)
        return 0;
    if (geteuid() != 0)
        return EPERM;
    int count = 64;
    std::vector<gid_t> groups(count);
    while (getgrouplist(name.c_str(), entry.pw_gid, groups.data(), &count) == -1)
        groups.resize(count);
    out.groups.assign(groups.begin(), groups.begin() + count);
    return 0;
}

namespace {

[[noreturn]] void fail_in_child(int status_fd, launch_step step) {
    child_failure failure{static_cast<int>(step), errno};
    ssize_t written = write(status_fd, &failure, sizeof failure);
    (void)written;
    _exit(127);
}

void reset_signals() {
    sigset_t empty;
    sigemptyset(&empty);
    sigprocmask(SIG_SETMASK, &empty, nullptr);
    struct sigaction default_action {};
    default_action.sa_handler = SIG_DFL;
    for (int signal_number = 1; signal_number < NSIG; ++signal_number)
        sigaction(signal_number, &default_action, nullptr);
}

void close_range_or_loop(int first, int last) {
    if (first > last)
        return;
    if (close_range(first, last, 0) == 0)
        return;
    for (int fd = first; fd <= last; ++fd)
        close(fd);
}

// Leaves open exactly 0, 1, 2 and the descriptors in keep (ascending, -1 for
// none). The loop fallback only serves kernels without close_range.
void close_other_descriptors(const int (&keep)[2], int max_fd) {
    int next = 3;
    for (int fd : keep) {
        if (fd < next)
            continue;
        close_range_or_loop(next, fd - 1);
        next = fd + 1;
    }
    close_range_or_loop(next, max_fd);
}

// Runs in the child between fork and exec: system calls only, no allocation.
[[noreturn]] void become_child(const launch_request& request, char* const* argv, int null_fd,
                               int status_fd, int max_fd) {
    reset_signals();
    if (request.user.change) {
        const auto& groups = request.user.groups;
        if (setgroups(groups.size(), reinterpret_cast<const gid_t*>(groups.data())) == -1)
            fail_in_child(status_fd, launch_step::logon);
        if (setgid(request.user.gid) == -1)
            fail_in_child(status_fd, launch_step::logon);
        if (setuid(request.user.uid) == -1)
            fail_in_child(status_fd, launch_step::logon);
    }
    if (!request.working_directory.empty() && chdir(request.working_directory.c_str()) == -1)
        fail_in_child(status_fd, launch_step::exec);
    for (int target = 0; target < 3; ++target) {
        int source = request.stdio == stdio_source::descriptors   ? request.stdio_fds[target]
                     : request.stdio == stdio_source::null_device ? null_fd
                                                                  : target;
        if (source != target && dup2(source, target) == -1)
            fail_in_child(status_fd, launch_step::exec);
    }
    // The status pipe stays close-on-exec, so exec itself closes it and the
    // parent reads end-of-file as success.
    int low = std::min(request.ipc_fd, status_fd), high = std::max(request.ipc_fd, status_fd);
    close_other_descriptors({low, high}, max_fd);
    if (request.ipc_fd > 2 && fcntl(request.ipc_fd, F_SETFD, 0) == -1)
        fail_in_child(status_fd, launch_step::exec);
    execve(request.executable.c_str(), argv, environ);
    fail_in_child(status_fd, launch_step::exec);
}

// Waits for the child's report: end-of-file means exec succeeded.
bool read_child_failure(int status_fd, child_failure& failure) {
    for (;;) {
        ssize_t got = read(status_fd, &failure, sizeof failure);
        if (got == -1 && errno == EINTR)
            continue;
        return got == static_cast<ssize_t>(sizeof failure);
    }
}

int highest_descriptor() {
    long limit = sysconf(_SC_OPEN_MAX);
    return limit > 0 && limit < INT_MAX ? static_cast<int>(limit) - 1 : 65535;
}

} // namespace

launch_result launch_child(const launch_request& request) {
    static_assert(sizeof(unsigned) == sizeof(gid_t));
    std::vector<char*> argv;
    for (const auto& argument : request.argv)
        argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);
    int max_fd = highest_descriptor();

    int null_fd = -1;
    if (request.stdio == stdio_source::null_device) {
        null_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
        if (null_fd == -1)
            return {0, -1, launch_step::exec, errno};
    }
    int status_pipe[2];
    if (pipe2(status_pipe, O_CLOEXEC) == -1) {
        int error = errno;
        close_descriptor(null_fd);
        return {0, -1, launch_step::exec, error};
    }
    pid_t pid = fork();
    if (pid == 0) {
        close(status_pipe[0]);
        become_child(request, argv.data(), null_fd, status_pipe[1], max_fd);
    }
    int fork_error = errno;
    close(status_pipe[1]);
    close_descriptor(null_fd);
    if (pid == -1) {
        close(status_pipe[0]);
        return {0, -1, launch_step::exec, fork_error};
    }
    child_failure failure{};
    bool failed = read_child_failure(status_pipe[0], failure);
    close(status_pipe[0]);
    if (failed) {
        waitpid(pid, nullptr, 0);
        return {0, -1, static_cast<launch_step>(failure.step), failure.error};
    }
    int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
    if (pidfd == -1) {
        // Without a pidfd we could never see its exit; don't leave it unwatched.
        int error = errno;
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
        return {0, -1, launch_step::exec, error};
    }
    return {static_cast<int>(pid), pidfd, launch_step::none, 0};
}

exit_status reap_child(int pidfd) {
    siginfo_t info{};
    int reaped;
    do
        reaped = waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(pidfd), &info,
                        WEXITED | WNOHANG);
    while (reaped == -1 && errno == EINTR);
    if (reaped == -1)
        return {true, true, 0};
    if (info.si_pid == 0)
        return {false, false, 0};
    return {true, info.si_code == CLD_EXITED, info.si_status};
}

void kill_child(int pidfd) {
    syscall(SYS_pidfd_send_signal, pidfd, SIGKILL, nullptr, 0);
}

} // namespace torvad::platform
