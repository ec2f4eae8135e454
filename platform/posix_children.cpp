// The registry of launched children on Linux: the low slots of a launch, the
// child's stack, and the supervised pids.
#include "platform/posix_children.hpp"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

namespace torvad::platform {

child_registry& child_registry::instance() {
    static child_registry registry;
    return registry;
}

// The low numbers where a launch puts what its child keeps, so that the child
// need copy no more of our table than up to the last of them. They hold
// /dev/null between launches.
os_error child_registry::reserve_slots() {
    if (slots_.last != -1)
        return {};
    low_slots made;
    made.null_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
    if (made.null_fd == -1)
        return {errno, "open"};
    slots_ = made;
    slots_.last = made.null_fd;
    for (int* slot : {&slots_.stdio[0], &slots_.stdio[1], &slots_.stdio[2], &slots_.ipc}) {
        *slot = fcntl(slots_.null_fd, F_DUPFD_CLOEXEC, 3);
        if (*slot == -1) {
            os_error error{errno, "fcntl"};
            release_slots();
            return error;
        }
        slots_.last = std::max(slots_.last, *slot);
    }
    return {};
}

void child_registry::release_slots() {
    for (int fd : {slots_.null_fd, slots_.stdio[0], slots_.stdio[1], slots_.stdio[2], slots_.ipc})
        if (fd != -1)
            close(fd);
    slots_ = {};
}

os_error child_registry::fill(int fd, int slot) {
    if (dup3(fd, slot, O_CLOEXEC) == -1)
        return {errno, "dup3"};
    filled_[filled_count_++] = slot;
    return {};
}

os_error child_registry::place(const launch_request& request, placed_descriptors& placed) {
    if (os_error error = reserve_slots())
        return error;
    placed.last_kept = slots_.last;
    for (int target = 0; target < 3; ++target) {
        int& source = placed.stdio[target];
        source = request.stdio == stdio_source::handles ? request.stdio_handles[target]
                 : request.stdio == stdio_source::none  ? slots_.null_fd
                                                        : target;
        // Our own standard streams are low already.
        if (request.stdio == stdio_source::handles && source > 2) {
            if (os_error error = fill(source, slots_.stdio[target]))
                return error;
            source = slots_.stdio[target];
        }
    }
    if (request.ipc != no_handle) {
        if (os_error error = fill(request.ipc, slots_.ipc))
            return error;
        placed.ipc = slots_.ipc;
    }
    return {};
}

void child_registry::refill() {
    bool refilled = true;
    for (int i = 0; i < filled_count_; ++i)
        if (dup3(slots_.null_fd, filled_[i], O_CLOEXEC) == -1)
            refilled = false;
    filled_count_ = 0;
    // A slot that kept a child's end would hold its pipe open: give them all
    // up, and the next launch takes new ones.
    if (!refilled)
        release_slots();
}

char* child_registry::child_stack(os_error& error) {
    constexpr std::size_t stack_size = 64 * 1024;
    if (stack_top_ != nullptr)
        return stack_top_;
    void* stack = mmap(nullptr, stack_size, PROT_READ | PROT_WRITE,
                       MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
    if (stack == MAP_FAILED) {
        error = {errno, "mmap"};
        return nullptr;
    }
    stack_top_ = static_cast<char*>(stack) + stack_size;
    return stack_top_;
}

void child_registry::note_supervised(int pid, const std::unique_lock<std::mutex>& /*held*/) {
    supervised_.insert(pid);
    reaped_.erase(pid);
}

int child_registry::wait_supervised(int pidfd, siginfo_t& info, int options) {
    int waited;
    do
        waited = waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(pidfd), &info, options);
    while (waited == -1 && errno == EINTR);
    if (waited == 0 && info.si_pid != 0) {
        std::lock_guard<std::mutex> lock(guard_);
        supervised_.erase(info.si_pid);
        if (watching_)
            reaped_.insert(info.si_pid);
    }
    return waited;
}

} // namespace torvad::platform
