// Launching, watching and ending children on Linux. A launch is one clone
// that shares our memory and suspends us until the child has called exec or
// given up (as posix_spawn does), with the pidfd made by the same call: no
// status pipe, no race between the pid and its pidfd. The child shares our
// descriptor table too, and copies only its lowest few when it drops the
// rest: a launch costs the same however many descriptors we hold.
#include "platform/platform.hpp"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <linux/close_range.h>
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
    reset_signals();
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

// The child's stack, made once: launches happen on one thread at a time.
// Null when it could not be made, and error says why.
constexpr std::size_t child_stack_size = 64 * 1024;
char* child_stack_top(os_error& error) {
    static os_error failed;
    static char* top = [] {
        void* stack = mmap(nullptr, child_stack_size, PROT_READ | PROT_WRITE,
                           MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
        if (stack == MAP_FAILED)
            failed = {errno, "mmap"};
        return stack == MAP_FAILED ? nullptr : static_cast<char*>(stack) + child_stack_size;
    }();
    error = failed;
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
    os_error stack_error;
    char* stack = child_stack_top(stack_error);
    if (stack == nullptr)
        return failed_launch(launch_step::create, stack_error);
    sigset_t all, saved;
    sigfillset(&all);
    if (int error = pthread_sigmask(SIG_SETMASK, &all, &saved))
        return failed_launch(launch_step::create, {error, "pthread_sigmask"});
    // Noted before the guard goes: an orphan reap must never see it unnoted.
    std::lock_guard<std::mutex> lock(supervised_guard);
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
        note_supervised(static_cast<int>(pid));
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

// The low numbers where a launch puts what its child keeps, so that the child
// need copy no more of our table than up to the last of them. They hold
// /dev/null between launches, and null_fd always does. Taken on the first
// launch, as low as were free then; launches come one at a time.
struct low_slots {
    int null_fd = -1;
    int stdio[3] = {-1, -1, -1};
    int ipc = -1;
    int last = -1;
};

void release(low_slots& slots) {
    for (int fd : {slots.null_fd, slots.stdio[0], slots.stdio[1], slots.stdio[2], slots.ipc})
        if (fd != -1)
            close(fd);
    slots = {};
}

os_error reserve(low_slots& slots) {
    if (slots.last != -1)
        return {};
    low_slots made;
    made.null_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
    if (made.null_fd == -1)
        return {errno, "open"};
    made.last = made.null_fd;
    for (int* slot : {&made.stdio[0], &made.stdio[1], &made.stdio[2], &made.ipc}) {
        *slot = fcntl(made.null_fd, F_DUPFD_CLOEXEC, 3);
        if (*slot == -1) {
            os_error error{errno, "fcntl"};
            release(made);
            return error;
        }
        made.last = std::max(made.last, *slot);
    }
    slots = made;
    return {};
}

// Puts the launch's descriptors into the slots and takes them out again: a
// slot never holds a child's descriptor past its launch.
class slot_filling {
  public:
    explicit slot_filling(low_slots& slots) : slots_(slots) {}
    ~slot_filling() {
        bool refilled = true;
        for (int i = 0; i < filled_; ++i)
            if (dup3(slots_.null_fd, used_[i], O_CLOEXEC) == -1)
                refilled = false;
        // A slot that kept a child's end would hold its pipe open: give them
        // all up, and the next launch takes new ones.
        if (!refilled)
            release(slots_);
    }
    slot_filling(const slot_filling&) = delete;
    slot_filling& operator=(const slot_filling&) = delete;

    os_error fill(int fd, int slot) {
        if (dup3(fd, slot, O_CLOEXEC) == -1)
            return {errno, "dup3"};
        used_[filled_++] = slot;
        return {};
    }

  private:
    low_slots& slots_;
    int used_[4] = {};
    int filled_ = 0;
};

low_slots slots;

os_error place_descriptors(const launch_request& request, slot_filling& filling, child_plan& plan) {
    for (int target = 0; target < 3; ++target) {
        int& source = plan.stdio_sources[target];
        source = request.stdio == stdio_source::handles ? request.stdio_handles[target]
                 : request.stdio == stdio_source::none  ? slots.null_fd
                                                        : target;
        // Our own standard streams are low already.
        if (request.stdio == stdio_source::handles && source > 2) {
            if (os_error error = filling.fill(source, slots.stdio[target]))
                return error;
            source = slots.stdio[target];
        }
    }
    if (request.ipc != no_handle) {
        if (os_error error = filling.fill(request.ipc, slots.ipc))
            return error;
        plan.ipc_source = slots.ipc;
    }
    return {};
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
    if (os_error error = reserve(slots))
        return failed_launch(launch_step::create, error);
    child_plan plan{&request, &user,      argv.data(),       envp.data(), {0, 1, 2},
                    -1,       slots.last, launch_step::none, {}};
    slot_filling filling(slots);
    if (os_error error = place_descriptors(request, filling, plan))
        return failed_launch(launch_step::create, error);
    return clone_child(plan);
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
    if (waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(watch.native_handle()), &info,
               WSTOPPED | WNOHANG | WNOWAIT) == -1)
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
    // a failed kill leaves nothing better to do than reap what we can.
    (void)signal_child(process.get(), SIGKILL);
    siginfo_t info{};
    if (wait_supervised(process.get(), info, WEXITED) == -1)
        info.si_pid = 0;
    process.reset();
}

} // namespace torvad::platform
