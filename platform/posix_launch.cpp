// Launching, watching and ending children on Linux. A launch is one clone
// that shares our memory and suspends us until the child has called exec or
// given up (as posix_spawn does), with the pidfd made by the same call: no
// status pipe, no race between the pid and its pidfd. The child shares our
// descriptor table too, and copies only its lowest few when it drops the
// rest: a launch costs the same however many descriptors we hold.
#include "platform/platform.hpp"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <linux/close_range.h>
#include <sched.h>
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
    int stdio_sources[3]; // what becomes the child's 0, 1 and 2
    int ipc_source;       // what becomes its ipc end, or -1
    int last_kept;        // the child copies our descriptors up to this one
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
void reset_signals(child_plan& plan) {
    struct sigaction default_action = {};
    default_action.sa_handler = SIG_DFL;
    // SIGKILL, SIGSTOP and the C library's own numbers refuse with EINVAL,
    // and are left as they are.
    for (int signal_number = 1; signal_number < NSIG; ++signal_number)
        if (sigaction(signal_number, &default_action, nullptr) == -1 && errno != EINVAL)
            give_up(plan, launch_step::create, "sigaction");
    sigset_t empty;
    sigemptyset(&empty);
    if (sigprocmask(SIG_SETMASK, &empty, nullptr) == -1)
        give_up(plan, launch_step::create, "sigprocmask");
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

// Until the first call here our descriptor table is the child's too, and
// nothing in it may change. The unsharing close copies only what lies below
// the range it closes: the low numbers, where launch_child put what the child
// keeps. Leaves open exactly 0, 1, 2 and the ipc end, at child_ipc_handle.
void keep_own_descriptors(child_plan& plan) {
    if (close_range(plan.last_kept + 1, ~0U, CLOSE_RANGE_UNSHARE) == -1)
        give_up(plan, launch_step::create, "close_range");
    for (int target = 0; target < 3; ++target) {
        int source = plan.stdio_sources[target];
        if (source != target && dup2(source, target) == -1)
            give_up(plan, launch_step::create, "dup2");
    }
    if (plan.ipc_source == child_ipc_handle) {
        // dup2 onto itself would leave close-on-exec set.
        if (fcntl(child_ipc_handle, F_SETFD, 0) == -1)
            give_up(plan, launch_step::create, "fcntl");
    } else if (plan.ipc_source != -1 && dup2(plan.ipc_source, child_ipc_handle) == -1) {
        give_up(plan, launch_step::create, "dup2");
    }
    int first_closed = plan.ipc_source == -1 ? 3 : child_ipc_handle + 1;
    if (first_closed <= plan.last_kept && close_range(first_closed, plan.last_kept, 0) == -1)
        give_up(plan, launch_step::create, "close_range");
}

// Runs in the child between clone and exec: system calls only, no allocation.
int become_child(void* argument) {
    child_plan& plan = *static_cast<child_plan*>(argument);
    const launch_request& request = *plan.request;
    reset_signals(plan);
    if (request.own_process_group && setpgid(0, 0) == -1)
        give_up(plan, launch_step::create, "setpgid");
    if (plan.user->change)
        switch_account(plan);
    if (!request.working_directory.empty() && chdir(request.working_directory.c_str()) == -1)
        give_up(plan, launch_step::create, "chdir");
    keep_own_descriptors(plan);
    execve(request.executable.c_str(), plan.argv, plan.envp);
    give_up(plan, launch_step::create, "execve");
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
    child_registry& registry = child_registry::instance();
    os_error stack_error;
    char* stack = registry.child_stack(stack_error);
    if (stack == nullptr)
        return failed_launch(launch_step::create, stack_error);
    sigset_t all, saved;
    sigfillset(&all);
    if (int error = pthread_sigmask(SIG_SETMASK, &all, &saved))
        return failed_launch(launch_step::create, {error, "pthread_sigmask"});
    // Noted before the hold goes: an orphan reap must never see it unnoted.
    std::unique_lock<std::mutex> held = registry.hold();
    int pidfd = -1;
    pid_t pid = clone(become_child, stack,
                      CLONE_VM | CLONE_FILES | CLONE_VFORK | CLONE_PIDFD | SIGCHLD, &plan, &pidfd);
    int clone_error = errno;
    int restore_error = pthread_sigmask(SIG_SETMASK, &saved, nullptr);
    if (pid == -1)
        return failed_launch(launch_step::create, {clone_error, "clone"});
    // Our signals stay blocked: that launch fails, its child ended, unless it
    // can't be ended, and then it is supervised as any other.
    bool undo = restore_error != 0 && plan.failed_step == launch_step::none;
    if (undo && syscall(SYS_pidfd_send_signal, pidfd, SIGKILL, nullptr, 0) == 0) {
        plan.failed_step = launch_step::create;
        plan.error = {restore_error, "pthread_sigmask"};
    }
    if (plan.failed_step == launch_step::none) {
        registry.note_supervised(static_cast<int>(pid), held);
        launch_result result;
        result.pid = static_cast<int>(pid);
        result.process.reset(pidfd);
        return result;
    }
    // It has called _exit already; reap it so that no zombie stays behind.
    // Its pid was never noted, and the guard we hold keeps it from the orphans.
    siginfo_t info{};
    while (waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(pidfd), &info, WEXITED) == -1 &&
           errno == EINTR) {
    }
    close(pidfd);
    return failed_launch(plan.failed_step, plan.error);
}

} // namespace

launch_result launch_child(const launch_request& request) {
    static_assert(sizeof(unsigned) == sizeof(gid_t));
    account user;
    if (!request.user.empty())
        if (os_error refused = resolve_account(request.user, user))
            return failed_launch(launch_step::logon, refused);
    std::vector<char*> argv;
    for (const auto& argument : request.argv)
        argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);
    std::vector<char*> envp = child_environment();
    child_registry& registry = child_registry::instance();
    // The slots are emptied once the launch is over, whatever its end.
    struct refill_after {
        child_registry& registry;
        ~refill_after() { registry.refill(); }
    } refill{registry};
    placed_descriptors placed;
    if (os_error error = registry.place(request, placed))
        return failed_launch(launch_step::create, error);
    child_plan plan{&request,
                    &user,
                    argv.data(),
                    envp.data(),
                    {placed.stdio[0], placed.stdio[1], placed.stdio[2]},
                    placed.ipc,
                    placed.last_kept,
                    launch_step::none,
                    {}};
    return clone_child(plan);
}

exit_status exit_status_of(exit_watch& watch) {
    siginfo_t info{};
    if (child_registry::instance().wait_supervised(watch.native_handle(), info,
                                                   WEXITED | WNOHANG) == -1)
        return {true, false, 0, {errno, "waitid"}};
    if (info.si_pid == 0)
        return {};
    return {true, info.si_code == CLD_EXITED, info.si_status, {}};
}

namespace {
os_error signal_child(int pidfd, int signal_number) {
    if (syscall(SYS_pidfd_send_signal, pidfd, signal_number, nullptr, 0) == -1)
        return {errno, "pidfd_send_signal"};
    return {};
}
} // namespace

os_error end_by_force(exit_watch& watch) {
    return signal_child(watch.native_handle(), SIGKILL);
}

bool continue_if_stopped(exit_watch& watch) {
    // WNOWAIT leaves the stop to be seen again: the next stop request asks
    // anew. Not through wait_supervised, which takes what it sees for an end.
    siginfo_t info{};
    int waited;
    do
        waited = waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(watch.native_handle()),
                        &info, WSTOPPED | WNOHANG | WNOWAIT);
    while (waited == -1 && errno == EINTR);
    if (waited == -1)
        return false;
    if (info.si_pid == 0 || info.si_code != CLD_STOPPED)
        return false;
    // A stop an operator asked for (SIGSTOP) is theirs to end.
    if (info.si_status != SIGTTIN && info.si_status != SIGTTOU && info.si_status != SIGTSTP)
        return false;
    return !signal_child(watch.native_handle(), SIGCONT);
}

void end_now(owned_handle& process) {
    // A child we can't watch is one we never started as far as anyone knows:
    // a failed kill leaves nothing better to do than reap what we can, without
    // waiting for one that may run on.
    int options = signal_child(process.get(), SIGKILL) ? WEXITED | WNOHANG : WEXITED;
    siginfo_t info{};
    if (child_registry::instance().wait_supervised(process.get(), info, options) == -1)
        info.si_pid = 0;
    process.reset();
}

} // namespace torvad::platform
