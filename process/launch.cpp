// Turning a constructed process into a running child: resolve the program,
// make its pipes, switch account, launch, then watch its exit and streams.
#include "process/process.hpp"

#include <boost/filesystem/path.hpp>

#include "daemon/daemon.hpp"

namespace torvad {

namespace {

const char* const script_wrapper[] = {"powershell",       "-noprofile", "-noninteractive",
                                      "-executionpolicy", "bypass",     "-file"};

// Applies the suffix and script rules to argv[0] and makes it absolute; an
// error when a bare name is not on the search path or the current directory
// is gone.
platform::os_error resolve_executable(std::vector<std::string>& argv) {
    std::string extension = boost::filesystem::path(argv[0]).extension().string();
    if (extension.empty())
        argv[0] += platform::exe_suffix;
    else if (extension == ".ps1")
        argv.insert(argv.begin(), std::begin(script_wrapper), std::end(script_wrapper));
    if (argv[0].find_first_of("/\\") == std::string::npos) {
        argv[0] = platform::search_path(argv[0]);
        if (argv[0].empty())
            return {ENOENT, "search PATH"};
    }
    platform::os_error error;
    argv[0] = platform::absolute_path(argv[0], error);
    return error;
}

} // namespace

bool process::fail_launch(std::uint32_t failure_status, const platform::os_error& error) {
    if (error)
        owner->log_verbose("%s", platform::describe(error).c_str());
    finish(failure_status, packet_failed);
    return false;
}

platform::os_error own_descriptor(descriptor& object, int fd) {
    boost::system::error_code failure;
    object.assign(fd, failure);
    if (!failure)
        object.non_blocking(true, failure);
    return failure ? platform::os_error{failure.value(), "assign"} : platform::os_error{};
}

bool process::prepare_stdio(platform::launch_request& request) {
    if (stdio_mode == stdio_none)
        request.stdio = platform::stdio_source::null_device;
    if (stdio_mode != stdio_pipes)
        return true;
    request.stdio = platform::stdio_source::descriptors;
    // The child reads its stdin and writes its stdout and stderr; ours are
    // the other ends.
    int ours[3] = {-1, -1, -1};
    platform::os_error error;
    for (int stream = 0; stream < 3 && !error; ++stream) {
        int read_end = -1, write_end = -1;
        error = platform::make_pipe(read_end, write_end);
        ours[stream] = stream == 0 ? write_end : read_end;
        request.stdio_fds[stream] = stream == 0 ? read_end : write_end;
    }
    descriptor* pipes[3] = {&stdin_pipe, &stdout_pipe, &stderr_pipe};
    for (int stream = 0; stream < 3 && !error; ++stream)
        error = own_descriptor(*pipes[stream], ours[stream]);
    if (!error)
        return true;
    for (int stream = 0; stream < 3; ++stream) {
        if (!pipes[stream]->is_open())
            platform::close_descriptor(ours[stream]);
        platform::close_descriptor(request.stdio_fds[stream]);
    }
    close_pipes();
    owner->log_error("failed to create child process.");
    return fail_launch(error.code, error);
}

bool process::start() {
    if (pid != 0)
        return true;
    if (command.empty() || command[0].empty()) {
        // Nothing to launch would leave an object that never ends and keeps
        // the run alive; finish it like any failed launch.
        owner->log_error("executable not specified");
        return fail_launch(status_malformed, {});
    }
    std::vector<std::string> argv = command;
    if (platform::os_error error = resolve_executable(argv)) {
        owner->log_error("executable '%s' not found.", command[0].c_str());
        return fail_launch(status_not_found, error);
    }
    platform::launch_request request;
    if (!prepare_stdio(request))
        return false;
    if (persistent) {
        if (platform::os_error error = create_ipc_pipe(request.ipc_fd)) {
            for (int fd : request.stdio_fds)
                platform::close_descriptor(fd);
            owner->log_error("failed to create ipc pipe.");
            return fail_launch(error.code, error);
        }
        argv.push_back(std::to_string(platform::child_ipc_fd(request.ipc_fd)));
    }
    int logon_error = user.empty() ? 0 : platform::resolve_account(user, request.user);
    platform::launch_result launched;
    if (logon_error == 0) {
        request.executable = argv[0];
        request.argv = std::move(argv);
        request.working_directory = working_directory;
        // At a console the terminal signals its whole foreground group; only
        // we are to hear Ctrl-C, and stop the children in order.
        request.own_process_group = !background;
        launched = platform::launch_child(request);
        if (launched.failed_step == platform::launch_step::logon)
            logon_error = launched.error.code;
    }
    // The child has its copies of these now, or never will.
    platform::close_descriptor(request.ipc_fd);
    for (int fd : request.stdio_fds)
        platform::close_descriptor(fd);
    if (logon_error != 0) {
        owner->log_warning("Failed to logon as user '%s': error %d", user.c_str(), logon_error);
        return fail_launch(status_not_found, launched.error);
    }
    if (launched.failed_step != platform::launch_step::none) {
        owner->log_error("failed to create child process.");
        return fail_launch(launched.error.code, launched.error);
    }
    watch_child(launched);
    return true;
}

void process::watch_child(const platform::launch_result& launched) {
    boost::system::error_code failure;
    exit_watch.assign(launched.pidfd, failure);
    pid = static_cast<std::uint32_t>(launched.pid);
    if (failure) {
        // Without its pidfd in the loop we could never see the exit: end the
        // child now rather than leave it unwatched.
        platform::end_child_now(launched.pidfd);
        owner->log_error("failed to create child process.");
        fail_launch(failure.value(), {failure.value(), "assign"});
        return;
    }
    watch_exit();
    if (stdio_mode == stdio_pipes) {
        wait_output(1);
        wait_output(2);
    }
    if (persistent) {
        read_ipc();
        send_version();
    }
    if (auto requester = parent.lock())
        requester->send_packet(channel, packet_opened, pid, nullptr, 0);
}

void process::watch_exit() {
    // The exit wait holds a plain pointer: it must not keep the object alive,
    // and it only completes successfully while the object is in children.
    exit_watch.async_wait(descriptor::wait_read,
                          [this](const boost::system::error_code& error) { on_exit(error); });
}

} // namespace torvad
