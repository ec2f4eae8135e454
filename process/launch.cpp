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

bool process::prepare_stdio(platform::launch_request& request,
                            platform::owned_handle (&theirs)[3]) {
    if (stdio_mode == stdio_none)
        request.stdio = platform::stdio_source::none;
    if (stdio_mode != stdio_pipes)
        return true;
    request.stdio = platform::stdio_source::handles;
    platform::stream* ours[3] = {&stdin_pipe, &stdout_pipe, &stderr_pipe};
    for (int stream = 0; stream < 3; ++stream) {
        if (platform::os_error error =
                platform::make_relay_pipe(stream, *ours[stream], theirs[stream])) {
            close_pipes();
            owner->log_error("failed to create child process.");
            return fail_launch(error.code, error);
        }
        request.stdio_handles[stream] = theirs[stream].get();
    }
    return true;
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
    // The child's ends: it inherits its copies at the launch, ours go with these.
    platform::owned_handle child_stdio[3], child_ipc;
    if (!prepare_stdio(request, child_stdio))
        return false;
    if (persistent) {
        if (platform::os_error error = create_ipc_pipe(child_ipc)) {
            owner->log_error("failed to create ipc pipe.");
            return fail_launch(error.code, error);
        }
        request.ipc = child_ipc.get();
        argv.push_back(std::to_string(platform::handle_value(child_ipc.get())));
    }
    request.executable = argv[0];
    request.argv = std::move(argv);
    request.working_directory = working_directory;
    request.user = user;
    // At a console the terminal signals its whole foreground group; only
    // we are to hear Ctrl-C, and stop the children in order.
    request.own_process_group = !background;
    platform::launch_result launched = platform::launch_child(request);
    // The child has its copies of these now, or never will.
    child_ipc.reset();
    for (auto& end : child_stdio)
        end.reset();
    if (launched.failed_step == platform::launch_step::logon) {
        owner->log_warning("Failed to logon as user '%s': error %d", user.c_str(),
                           launched.error.code);
        return fail_launch(status_not_found, launched.error);
    }
    if (launched.failed_step == platform::launch_step::refused) {
        owner->log_error("refused to run '%s': a command interpreter would read its arguments.",
                         command[0].c_str());
        return fail_launch(launched.error.code, launched.error);
    }
    if (launched.failed_step != platform::launch_step::none) {
        owner->log_error("failed to create child process.");
        return fail_launch(launched.error.code, launched.error);
    }
    watch_child(launched);
    return true;
}

void process::watch_child(platform::launch_result& launched) {
    pid = static_cast<std::uint32_t>(launched.pid);
    if (platform::os_error error = platform::watch_exit(exit_watch, launched.process)) {
        // Without its exit in the loop we could never see it end: end the
        // child now rather than leave it unwatched.
        platform::end_now(launched.process);
        owner->log_error("failed to create child process.");
        fail_launch(error.code, error);
        return;
    }
    wait_for_exit();
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

void process::wait_for_exit() {
    platform::await_exit(exit_watch,
                         [self = shared_from_this()](const boost::system::error_code& error) {
                             self->on_exit(error);
                         });
}

} // namespace torvad
