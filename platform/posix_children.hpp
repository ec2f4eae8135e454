// What the Linux side of the seam keeps about the children it launches, in
// one registry: the low descriptor slots a launch puts the child's ends in,
// the pids of supervised children until their status is taken (how an orphan
// that the kernel hands us is told from a child we supervise), and the tables
// of the orphan scan; and the account a launch switches to, resolved before
// the child is made.
#pragma once

#include <cstddef>
#include <mutex>
#include <string>
#include <sys/wait.h>
#include <unordered_set>
#include <vector>

#include "platform/platform.hpp"

namespace torvad::platform {

// Where a launched child finds what it keeps, as our descriptor numbers: its
// standard streams and its ipc end (-1: none); it copies our table up to last_kept.
struct placed_descriptors {
    int stdio[3] = {0, 1, 2};
    int ipc = -1;
    int last_kept = -1;
};

class child_registry {
  public:
    // The one registry of the process.
    static child_registry& instance();

    // --- launches, one at a time (posix_children.cpp) ---
    // Puts request's descriptors into the low slots, taken on the first
    // launch, as low as were free then; refill() empties them again.
    os_error place(const launch_request& request, placed_descriptors& placed);
    // Gives the filled slots /dev/null again: a slot never holds a child's
    // descriptor past its launch.
    void refill();
    // The stack a child runs on until its exec, made once; null on failure.
    char* child_stack(os_error& error);
    // Held from a launch to the note of its pid, and from an orphan's peek to
    // its reap: an orphan reap can then never take the status of a
    // supervised child, even one that ended the moment it was made.
    std::unique_lock<std::mutex> hold() { return std::unique_lock<std::mutex>(guard_); }
    void note_supervised(int pid, const std::unique_lock<std::mutex>& held);
    // waitid on the child behind pidfd, retried on EINTR; once its status is
    // taken its pid is forgotten. The result and errno are waitid's.
    int wait_supervised(int pidfd, siginfo_t& info, int options);

    // --- orphans (posix_orphans.cpp) ---
    os_error watch_orphans(stream& watch);
    bool reap_orphans(stream& watch);

  private:
    struct low_slots {
        int null_fd = -1; // always /dev/null
        int stdio[3] = {-1, -1, -1};
        int ipc = -1;
        int last = -1;
    };
    os_error reserve_slots();
    void release_slots();
    os_error fill(int fd, int slot);
    // Drains the pending signals and says whether a scan is due; with guard_ held.
    bool scan_due(int signal_fd);
    void scan_done();

    std::mutex guard_;
    // The launching thread's alone: launches come one at a time.
    low_slots slots_;
    int filled_[4] = {};
    int filled_count_ = 0;
    char* stack_top_ = nullptr;
    // Under guard_.
    std::unordered_set<int> supervised_;
    // Set before any thread is started, read from then on.
    bool watching_ = false;
    // The orphan scan's, under guard_: the scan still owed (until one has seen
    // no ended orphan), and the supervised children reaped since the last,
    // whose signal may come after their exit wait has taken their status,
    // with the signals that named them.
    bool scan_owed_ = false;
    std::unordered_set<int> reaped_;
    std::size_t supervised_signals_ = 0;
};

// An account resolved before the launch, so the child only makes system calls.
struct account {
    bool change = false; // false: run as ourselves
    unsigned uid = 0;
    unsigned gid = 0;
    std::vector<unsigned> groups;
};

// Resolves "domain\name" (empty domain or "." is this machine); an error is
// the reason the logon is refused.
os_error resolve_account(const std::string& user, account& out);

} // namespace torvad::platform
