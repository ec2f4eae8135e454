// Programs that the start runs and waits for before any child is supervised:
// spawned with a clean descriptor set, read while they run, reaped through a
// pidfd so that a grandchild holding the pipe open can't hold the start.
#include "platform/platform.hpp"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <boost/filesystem/operations.hpp>
#include <boost/process/search_path.hpp>

extern char** environ;

namespace torvad::platform {

bool path_exists(const std::string& path) {
    boost::system::error_code error;
    auto type = boost::filesystem::status(path, error).type();
    return type != boost::filesystem::status_error && type != boost::filesystem::file_not_found;
}

std::string find_program(const std::string& name) {
    return boost::process::search_path(name).string();
}

namespace {

// What a program of ours tells the service manager must never count as ours.
std::vector<char*> environment_without_notify_socket() {
    static const char prefix[] = "NOTIFY_SOCKET=";
    std::vector<char*> entries;
    for (char** entry = environ; *entry != nullptr; ++entry)
        if (std::strncmp(*entry, prefix, sizeof prefix - 1) != 0)
            entries.push_back(*entry);
    entries.push_back(nullptr);
    return entries;
}

// Default signal dispositions and an empty mask, our pipe end on the returned
// stream, and nothing open beyond 0, 1 and 2.
struct spawn_setup {
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;

    spawn_setup(int sink, returned_stream returned) {
        posix_spawn_file_actions_init(&actions);
        posix_spawnattr_init(&attributes);
        sigset_t signals;
        sigemptyset(&signals);
        posix_spawnattr_setsigmask(&attributes, &signals);
        sigfillset(&signals);
        posix_spawnattr_setsigdefault(&attributes, &signals);
        posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
        if (returned != returned_stream::none)
            posix_spawn_file_actions_adddup2(&actions, sink, static_cast<int>(returned));
        posix_spawn_file_actions_addclosefrom_np(&actions, 3);
    }
    ~spawn_setup() {
        posix_spawn_file_actions_destroy(&actions);
        posix_spawnattr_destroy(&attributes);
    }
    spawn_setup(const spawn_setup&) = delete;
    spawn_setup& operator=(const spawn_setup&) = delete;
};

using output_handler = std::function<void(const char*, std::size_t)>;

// Once the program has ended, what it wrote is in the pipe: take that and stop,
// rather than wait for an end of file that a grandchild may never give.
void drain(int source, const output_handler& on_output) {
    fcntl(source, F_SETFL, O_NONBLOCK);
    char buffer[4096];
    ssize_t got;
    while ((got = read(source, buffer, sizeof buffer)) > 0 || (got == -1 && errno == EINTR))
        if (got > 0)
            on_output(buffer, static_cast<std::size_t>(got));
}

void relay_until_end(int source, int pid, const output_handler& on_output) {
    int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
    char buffer[4096];
    for (;;) {
        pollfd ready[2] = {{source, POLLIN, 0}, {pidfd, POLLIN, 0}};
        if (poll(ready, pidfd >= 0 ? 2 : 1, -1) == -1) {
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
    if (pidfd >= 0)
        close(pidfd);
}

int wait_for_exit_code(int pid) {
    int status = 0;
    while (waitpid(pid, &status, 0) == -1)
        if (errno != EINTR)
            return -1;
    if (WIFEXITED(status))
        return WEXITSTATUS(status);
    return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : -1;
}

} // namespace

program_end run_program(const std::string& path, const std::vector<std::string>& args,
                        returned_stream returned, const output_handler& on_output) {
    program_end end;
    int pipe_ends[2] = {-1, -1};
    if (returned != returned_stream::none && pipe2(pipe_ends, O_CLOEXEC) == -1) {
        end.error = errno;
        return end;
    }
    std::vector<char*> argv{const_cast<char*>(path.c_str())};
    for (const auto& arg : args)
        argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);
    auto environment = environment_without_notify_socket();
    pid_t pid = -1;
    {
        spawn_setup setup(pipe_ends[1], returned);
        end.error = posix_spawn(&pid, path.c_str(), &setup.actions, &setup.attributes, argv.data(),
                                environment.data());
    }
    if (pipe_ends[1] >= 0)
        close(pipe_ends[1]);
    if (end.error == 0 && pipe_ends[0] >= 0)
        relay_until_end(pipe_ends[0], pid, on_output);
    if (pipe_ends[0] >= 0)
        close(pipe_ends[0]);
    if (end.error == 0)
        end.exit_code = wait_for_exit_code(pid);
    return end;
}

} // namespace torvad::platform
