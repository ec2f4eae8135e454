// Orphans on Linux. A process whose parent ends is handed to the nearest
// ancestor that reaps for its descendants: the first process of its PID
// namespace, or a child subreaper. We are one or the other, so we reap every
// such orphan, and leave the status of our own children to their pidfds.
#include "platform/platform.hpp"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include "platform/posix_children.hpp"

namespace torvad::platform {

namespace {
// A scan for ended orphans walks all our children in the kernel, so it can't
// follow every supervised child's end. A signal that names an orphan, or
// comes while we have few children, is scanned for at once. Otherwise the
// scan waits until one in scan_share of the supervised children has ended
// since the last: an orphan that ended with one of them, its signal merged
// into theirs, waits that long, and an end costs the same however many
// children we have.
constexpr std::size_t scan_share = 64;
} // namespace

bool child_registry::scan_due(int fd) {
    signalfd_siginfo pending[8];
    ssize_t got;
    while ((got = read(fd, pending, sizeof pending)) > 0) {
        for (std::size_t i = 0; i < static_cast<std::size_t>(got) / sizeof pending[0]; ++i) {
            int pid = static_cast<int>(pending[i].ssi_pid);
            if (supervised_.count(pid) != 0 || reaped_.count(pid) != 0)
                ++supervised_signals_;
            else
                scan_owed_ = true;
        }
    }
    // Merged signals undercount the ends, and reaps come late: the larger.
    std::size_t ends = std::max(supervised_signals_, reaped_.size());
    if (ends != 0 && ends * scan_share >= supervised_.size())
        scan_owed_ = true;
    return scan_owed_;
}

void child_registry::scan_done() {
    scan_owed_ = false;
    reaped_.clear();
    supervised_signals_ = 0;
}

os_error watch_orphans(stream& watch) {
    return child_registry::instance().watch_orphans(watch);
}

bool reap_orphans(stream& watch) {
    return child_registry::instance().reap_orphans(watch);
}

os_error child_registry::watch_orphans(stream& watch) {
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
    watching_ = true;
    return {};
}

bool child_registry::reap_orphans(stream& watch) {
    std::lock_guard<std::mutex> lock(guard_);
    // One pending signal stands for any number of ends; the scan below finds them.
    if (!scan_due(watch.native_handle()))
        return true;
    for (;;) {
        // A peek leaves the child as it is; only an orphan is then reaped.
        siginfo_t ended{};
        if (waitid(P_ALL, 0, &ended, WEXITED | WNOHANG | WNOWAIT) == -1 && errno == EINTR)
            continue;
        if (ended.si_pid == 0) {
            scan_done(); // none has ended, or we have no child at all
            return true;
        }
        // The peek shows one ended child only, and the same one until it is
        // reaped: the rest can be seen once this one's pidfd has served.
        if (supervised_.count(ended.si_pid) != 0)
            return false;
        siginfo_t taken{};
        while (waitid(P_PID, static_cast<id_t>(ended.si_pid), &taken, WEXITED | WNOHANG) == -1 &&
               errno == EINTR) {
        }
    }
}

} // namespace torvad::platform
