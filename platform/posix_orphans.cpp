// Orphans on Linux. A process whose parent ends is handed to the nearest
// ancestor that reaps for its descendants: the first process of its PID
// namespace, or a child subreaper. We are one or the other, so we reap every
// such orphan, and leave the status of our own children to their pidfds.
#include "platform/platform.hpp"

#include <cerrno>
#include <csignal>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <unistd.h>
#include <unordered_set>

#include "platform/posix_children.hpp"

namespace torvad::platform {

std::mutex supervised_guard;

namespace {
std::unordered_set<int> supervised;
} // namespace

void note_supervised(int pid) {
    supervised.insert(pid);
}

int wait_supervised(int pidfd, siginfo_t& info, int options) {
    int waited;
    do
        waited = waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(pidfd), &info, options);
    while (waited == -1 && errno == EINTR);
    if (waited == 0 && info.si_pid != 0) {
        std::lock_guard<std::mutex> lock(supervised_guard);
        supervised.erase(info.si_pid);
    }
    return waited;
}

os_error watch_orphans(stream& watch) {
    // The first process of a PID namespace is the reaper there already.
    if (getpid() != 1 && prctl(PR_SET_CHILD_SUBREAPER, 1) == -1)
        return {errno, "prctl"};
    sigset_t child_ended;
    sigemptyset(&child_ended);
    sigaddset(&child_ended, SIGCHLD);
    // Blocked before any thread is made, so that the signal waits for the
    // descriptor and interrupts no call. Children start with an empty mask.
    if (int error = pthread_sigmask(SIG_BLOCK, &child_ended, nullptr))
        return {error, "pthread_sigmask"};
    owned_handle fd(signalfd(-1, &child_ended, SFD_NONBLOCK | SFD_CLOEXEC));
    if (!fd.valid())
        return {errno, "signalfd"};
    boost::system::error_code failure;
    watch.assign(fd.get(), failure);
    if (failure)
        return {failure.value(), "assign"};
    fd.release();
    return {};
}

bool reap_orphans(stream& watch) {
    // One pending signal stands for any number of ends; the scan below finds them.
    signalfd_siginfo pending[8];
    while (read(watch.native_handle(), pending, sizeof pending) > 0) {
    }
    std::lock_guard<std::mutex> lock(supervised_guard);
    for (;;) {
        // A peek leaves the child as it is; only an orphan is then reaped.
        siginfo_t ended{};
        if (waitid(P_ALL, 0, &ended, WEXITED | WNOHANG | WNOWAIT) == -1 && errno == EINTR)
            continue;
        if (ended.si_pid == 0)
            return true; // none has ended, or we have no child at all
        // The peek shows one ended child only, and the same one until it is
        // reaped: the rest can be seen once this one's pidfd has served.
        if (supervised.count(ended.si_pid) != 0)
            return false;
        siginfo_t reaped{};
        while (waitid(P_PID, static_cast<id_t>(ended.si_pid), &reaped, WEXITED | WNOHANG) == -1 &&
               errno == EINTR) {
        }
    }
}

} // namespace torvad::platform
