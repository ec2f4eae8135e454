// What the Linux side of the seam keeps about the children it launches: their
// pids until their status is taken, which is how an orphan that the kernel
// hands us is told from a child we supervise; and the account a launch
// switches to, resolved before the child is made.
#pragma once

#include <mutex>
#include <string>
#include <sys/wait.h>
#include <vector>

#include "platform/platform.hpp"

namespace torvad::platform {

// Held from a launch to the note of its pid, and from an orphan's peek to its
// reap: an orphan reap can then never take the status of a supervised child,
// even one that ended the moment it was made.
extern std::mutex supervised_guard;
// With the guard held.
void note_supervised(int pid);
// waitid on the child behind pidfd, retried on EINTR; once its status is
// taken its pid is forgotten. The result and errno are waitid's.
int wait_supervised(int pidfd, siginfo_t& info, int options);

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
