// Launching, watching and ending children on Linux. A launch is one clone
// that shares our memory and suspends us until the child has called exec or
// given up (as posix_spawn does), with the pidfd made by the same call: no
// status pipe, no race between the pid and its pidfd.
#include "platform/platform.hpp"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <sched.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/posix_children.hpp"

extern char** environ;

namespace torvad::platform {

namespace {

// Everything the child needs, made before the clone, and the one place the
// child writes back: its memory is ours until it calls exec.
struct child_plan {
    const launch_request* request;
    const account* user;
    char* const* argv;
    char* const* envp;
    int null_fd;
    launch_step failed_step = launch_step::none;
    os_error error;
};

[[noreturn]] void give_up(child_plan& plan, launch_step step, const char* call) {
    plan.failed_step = step;
    plan.error = {errno, call};
    _exit(127);
}

// Default dispositions before the mask opens, so no handler of ours can
// ever run in the child.
void reset_signals() {
    struct sigaction default_action {};
    default_action.sa_handler = SIG_DFL;
    for (int signal_number = 1; signal_number < NSIG; ++signal_number)
        sigaction(signal_number, &default_action, nullptr);
    sigset_t empty;
    sigemptyset(&empty);
    sigprocmask(SIG_SETMASK, &empty, nullptr);
}

// The raw system calls: glibc's wrappers of these would signal every thread
// of the process whose memory we share.
void switch_account(child_plan& plan) {
    const account& user = *plan.user;
    if (syscall(SYS_setgroups, user.groups.size(), user.groups.data()) == -1)
        give_up(plan, launch_step::logon, "setgroups");
    if (syscall(SYS_setgid, user.gid) == -1)
        give_up(plan, launch_step::logon, "setgid");
    if (syscall(SYS_setuid, user.uid) == -1)
        give_up(plan, launch_step::logon, "setuid");
}

void set_standard_descriptors(child_plan& plan) {
    const launch_request& request = *plan.request;
    for (int target = 0; target < 3; ++target) {
        int source = request.stdio == stdio_source::handles ? request.stdio_handles[target]
                     : request.stdio == stdio_source::none  ? plan.null_fd
                                                            : target;
        if (source != target && dup2(source, target) == -1)
            give_up(plan, launch_step::create, "dup2");
    }
}

// Leaves open exactly 0, 1, 2 and the ipc end, whatever the fd limit was
// when the others were opened.
void close_other_descriptors(child_plan& plan) {
    int ipc = plan.request->ipc;
    if (ipc > 2) {
        if (ipc > 3 && close_range(3, ipc - 1, 0) == -1)
            give_up(plan, launch_step::create, "close_range");
        if (fcntl(ipc, F_SETFD, 0) == -1)
            give_up(plan, launch_step::create, "fcntl");
    }
    if (close_range(ipc > 2 ? ipc + 1 : 3, ~0U, 0) == -1)
        give_up(plan, launch_step::create, "close_range");
}

// Runs in the child between clone and exec: system calls only, no allocation.
int become_child(void* argument) {
    child_plan& plan = *static_cast<child_plan*>(argument);
    const launch_request& request = *plan.request;
    reset_signals();
    if (request.own_process_group && setpgid(0, 0) == -1)
        give_up(plan, launch_step::create, "setpgid");
    if (plan.user->change)
        switch_account(plan);
    if (!request.working_directory.empty() && chdir(request.working_directory.c_str()) == -1)
        give_up(plan, launch_step::create, "chdir");
    set_standard_descriptors(plan);
    close_other_descriptors(plan);
    execve(request.executable.c_str(), plan.argv, plan.envp);
    give_up(plan, launch_step::create, "execve");
}

// The child's stack, made once: launches happen on one thread at a time.
constexpr std::size_t child_stack_size = 64 * 1024;
char* child_stack_top() {
    static char* top = [] {
        void* stack = mmap(nullptr, child_stack_size, PROT_READ | PROT_WRITE,
                           MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
        return stack == MAP_FAILED ? nullptr : static_cast<char*>(stack) + child_stack_size;
    }();
    return top;
}

// The service manager's socket is ours alone: a child that wrote to it
// would speak for the supervisor.
std::vector<char*> child_environment() {
    std::vector<char*> envp;
    for (char** entry = environ; *entry != nullptr; ++entry)
        if (std::strncmp(*entry, "NOTIFY_SOCKET=", 14) != 0)
            envp.push_back(*entry);
    envp.push_back(nullptr);
    return envp;
}

// Clones with every signal blocked, so that no handler of ours runs in the
// child before it has reset them; our own mask comes back after.
launch_result failed_launch(launch_step step, os_error error) {
    launch_result result;
    result.failed_step = step;
    result.error = error;
    return result;
}

launch_result clone_child(child_plan& plan) {
    char* stack = child_stack_top();
    if (stack == nullptr)
        return failed_launch(launch_step::create, {ENOMEM, "mmap"});
    sigset_t all, saved;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &saved);
    // Noted before the guard goes: an orphan reap must never see it unnoted.
    std::lock_guard<std::mutex> lock(supervised_guard);
    int pidfd = -1;
    pid_t pid =
        clone(become_child, stack, CLONE_VM | CLONE_VFORK | CLONE_PIDFD | SIGCHLD, &plan, &pidfd);
    int clone_error = errno;
    pthread_sigmask(SIG_SETMASK, &saved, nullptr);
    if (pid == -1)
        return failed_launch(launch_step::create, {clone_error, "clone"});
    if (plan.failed_step == launch_step::none) {
        note_supervised(static_cast<int>(pid));
        launch_result result;
        result.pid = static_cast<int>(pid);
        result.process.reset(pidfd);
        return result;
    }
    // It has called _exit already; reap it so that no zombie stays behind.
    // Its pid was never noted, and the guard we hold keeps it from the orphans.
    siginfo_t info{};
    waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(pidfd), &info, WEXITED);
    close(pidfd);
    return failed_launch(plan.failed_step, plan.error);
}

} // namespace

launch_result launch_child(const launch_request& request) {
    static_assert(sizeof(unsigned) == sizeof(gid_t));
    account user;
    if (!request.user.empty())
        if (int refused = resolve_account(request.user, user))
            return failed_launch(launch_step::logon, {refused, "resolve account"});
    std::vector<char*> argv;
    for (const auto& argument : request.argv)
        argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);
    std::vector<char*> envp = child_environment();
    child_plan plan{&request, &user, argv.data(), envp.data(), -1, launch_step::none, {}};
    if (request.stdio == stdio_source::none) {
        plan.null_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
        if (plan.null_fd == -1)
            return failed_launch(launch_step::create, {errno, "open"});
    }
    launch_result result = clone_child(plan);
    if (plan.null_fd != -1)
        close(plan.null_fd);
    return result;
}

os_error watch_exit(exit_watch& watch, owned_handle& process) {
    boost::system::error_code failure;
    watch.assign(process.get(), failure);
    if (failure)
        return {failure.value(), "assign"};
    process.release();
    return {};
}

exit_status exit_status_of(exit_watch& watch) {
    siginfo_t info{};
    if (wait_supervised(watch.native_handle(), info, WEXITED | WNOHANG) == -1)
        return {true, false, 0, {errno, "waitid"}};
    if (info.si_pid == 0)
        return {};
    return {true, info.si_code == CLD_EXITED, info.si_status, {}};
}

namespace {
void kill_child(int pidfd) {
    syscall(SYS_pidfd_send_signal, pidfd, SIGKILL, nullptr, 0);
}
} // namespace

void end_by_force(exit_watch& watch) {
    kill_child(watch.native_handle());
}

void end_now(owned_handle& process) {
    kill_child(process.get());
    siginfo_t info{};
    wait_supervised(process.get(), info, WEXITED);
    process.reset();
}

} // namespace torvad::platform
