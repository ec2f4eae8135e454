// The clock of the pattern matcher on Windows.
#include <windows.h>

#include "platform/platform.hpp"

namespace torvad::platform {

// The thread's kernel and user time, counted in 100 ns.
std::int64_t thread_cpu_nanoseconds() {
    FILETIME created, exited, kernel, user;
    if (!GetThreadTimes(GetCurrentThread(), &created, &exited, &kernel, &user))
        return 0;
    auto count = [](const FILETIME& time) {
        return (std::int64_t{time.dwHighDateTime} << 32 | time.dwLowDateTime) * 100;
    };
    return count(kernel) + count(user);
}

} // namespace torvad::platform
