// Turning a constructed process into a running child: resolve the program,
// make its pipes, switch account, launch, then watch its exit and streams.
#include "process/process.hpp"

namespace torvad {

namespace {

// Somebody tries to take our pipes: the launch went on under fresh names, or
// failed once none was left to try, and the operator is to know either way.
void report_taken_names(process_owner& owner) {
    if (int taken = platform::taken_pipe_names())
        owner.log_warning("another program took %d pipe names first; fresh names were tried.",
                          taken);
}

} // namespace

bool process::fail_launch(std::uint32_t failure_status, const platform::os_error& error) {
    report_taken_names(owner);
    if (error)
        owner.log_verbose("%s", platform::describe(error).c_str());
    finish(failure_status, packet_failed);
    return false;
}

bool process::prepare_stdio(platform::launch_request& request,
                            platform::owned_handle (&theirs)[3]) {
    if (stdio_mode_ == stdio_none)
        request.stdio = platform::stdio_source::none;
    if (stdio_mode_ != stdio_pipes)
        return true;
    request.stdio = platform::stdio_source::handles;
    if (platform::os_error error = streams_.make(theirs)) {
        close_pipes();
        owner.log_error("failed to create child process.");
        return fail_launch(error.code, error);
    }
    for (int stream = 0; stream < 3; ++stream)
        request.stdio_handles[stream] = theirs[stream].get();
    return true;
}

bool process::start() {
    if (child_.pid() != 0)
        return true;
    if (command.empty() || command[0].empty()) {
        // Nothing to launch would leave an object that never ends and keeps
        // the run alive; finish it like any failed launch.
        owner.log_error("executable not specified");
        return fail_launch(status_malformed, {});
    }
    std::vector<std::string> argv = command;
    if (platform::os_error error = platform::resolve_program(argv)) {
        owner.log_error("executable '%s' not found.", command[0].c_str());
        return fail_launch(status_not_found, error);
    }
    platform::launch_request request;
    // The child's ends: it inherits its copies at the launch, ours go with these.
    platform::owned_handle child_stdio[3], child_ipc;
    if (!prepare_stdio(request, child_stdio))
        return false;
    if (persistent) {
        platform::pipe_step failed = platform::pipe_step::none;
        if (platform::os_error error = link_.make(child_ipc, failed)) {
            // The half that failed says its own line, and the launch the usual one.
            owner.log_error(failed == platform::pipe_step::open ? "failed to open ipc pipe."
                                                                : "failed to create ipc pipe.");
            owner.log_error("failed to create ipc pipe.");
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
    request.own_process_group = !owner.facts().background;
    report_taken_names(owner);
    platform::launch_result launched = platform::launch_child(request);
    // The child has its copies of these now, or never will.
    child_ipc.reset();
    for (auto& end : child_stdio)
        end.reset();
    if (launched.failed_step == platform::launch_step::logon) {
        owner.log_warning("Failed to logon as user '%s': error %d", user.c_str(),
                          launched.error.code);
        return fail_launch(status_not_found, launched.error);
    }
    if (launched.failed_step == platform::launch_step::refused) {
        owner.log_error("refused to run '%s': a command interpreter would read its arguments.",
                        command[0].c_str());
        return fail_launch(launched.error.code, launched.error);
    }
    if (launched.failed_step == platform::launch_step::unconvertible) {
        owner.log_error("refused to run '%s': an item is no text of the system's code page.",
                        command[0].c_str());
        return fail_launch(launched.error.code, launched.error);
    }
    if (launched.failed_step != platform::launch_step::none) {
        owner.log_error("failed to create child process.");
        return fail_launch(launched.error.code, launched.error);
    }
    return watch_child(launched);
}

bool process::watch_child(platform::launch_result& launched) {
    if (platform::os_error error = child_.watch(launched)) {
        // Without its exit in the loop we could never see it end; the child
        // was ended at once, so this start failed.
        owner.log_error("failed to create child process.");
        return fail_launch(error.code, error);
    }
    wait_for_exit();
    if (stdio_mode_ == stdio_pipes) {
        wait_output(1);
        wait_output(2);
    }
    if (persistent) {
        read_ipc();
        send_version();
    }
    if (auto requester = parent.lock())
        requester->send_packet(channel, packet_opened, child_.pid(), nullptr, 0);
    return true;
}

void process::wait_for_exit() {
    child_.await_end([self = shared_from_this()](const boost::system::error_code& error) {
        self->on_exit(error);
    });
}

} // namespace torvad
