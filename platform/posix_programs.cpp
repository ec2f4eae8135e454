// Programs that the start runs and waits for before any child is supervised:
// launched like any child (clean descriptors, default signals, no service
// manager socket), read while they run, and watched through their pidfd so
// that a grandchild holding the pipe open can't hold the start.
#include "platform/platform.hpp"

#include <cerrno>
#include <fcntl.h>
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include <boost/process/search_path.hpp>

#include "platform/posix_children.hpp"

namespace torvad::platform {

namespace {

using output_handler = std::function<void(const char*, std::size_t)>;

// Once the program has ended, what it wrote is in the pipe: take that and stop,
// rather than wait for an end of file that a grandchild may never give.
void drain(int source, const output_handler& on_output) {
    // A blocking read here would wait for that grandchild: rather take nothing.
    if (fcntl(source, F_SETFL, O_NONBLOCK) == -1)
        return;
    char buffer[4096];
    ssize_t got;
    while ((got = read(source, buffer, sizeof buffer)) > 0 || (got == -1 && errno == EINTR))
        if (got > 0)
            on_output(buffer, static_cast<std::size_t>(got));
}

void relay_until_end(int source, int pidfd, const output_handler& on_output) {
    char buffer[4096];
    for (;;) {
        pollfd ready[2] = {{source, POLLIN, 0}, {pidfd, POLLIN, 0}};
        if (poll(ready, 2, -1) == -1) {
            if (errno == EINTR)
                continue;
            break;
        }
        if (ready[0].revents != 0) {
            ssize_t got = read(source, buffer, sizeof buffer);
            if (got > 0)
                on_output(buffer, static_cast<std::size_t>(got));
            if (got > 0 || (got == -1 && errno == EINTR))
                continue;
            break; // end of file, or an error that ends the stream
        }
        if (ready[1].revents != 0) {
            drain(source, on_output);
            break;
        }
    }
}

int wait_for_exit_code(int pidfd) {
    siginfo_t info{};
    if (child_registry::instance().wait_supervised(pidfd, info, WEXITED) == -1)
        return -1;
    return info.si_code == CLD_EXITED ? info.si_status
                                      : static_cast<int>(signal_status(info.si_status));
}

} // namespace

program_end run_program(const std::string& path, const std::vector<std::string>& args,
                        returned_stream returned, const output_handler& on_output) {
    launch_request request;
    request.executable = path;
    request.argv.push_back(path);
    request.argv.insert(request.argv.end(), args.begin(), args.end());
    owned_handle source, sink;
    if (returned != returned_stream::none) {
        int ends[2];
        if (pipe2(ends, O_CLOEXEC) == -1)
            return {errno};
        source.reset(ends[0]);
        sink.reset(ends[1]);
        request.stdio = stdio_source::handles;
        for (int fd = 0; fd < 3; ++fd)
            request.stdio_handles[fd] = fd == static_cast<int>(returned) ? sink.get() : fd;
    }
    launch_result launched = launch_child(request);
    // Only the program holds the writing end now, so its end is our end of file.
    sink.reset();
    if (launched.failed_step != launch_step::none)
        return {launched.error.code};
    if (source.valid())
        relay_until_end(source.get(), launched.process.get(), on_output);
    return {0, wait_for_exit_code(launched.process.get())};
}

std::string search_path(const std::string& name) {
    return boost::process::search_path(name).string();
}

} // namespace torvad::platform
