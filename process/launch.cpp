// Turning a constructed process into a running child: resolve the program,
// make its pipes, switch account, launch, then watch its exit and streams;
// or serve a pipe another program made.
#include <utility>

#include "process/process.hpp"

namespace torvad {

namespace {

// The child's ends of a launch's pipes, and how many of their names another
// program had taken first, not yet told.
struct child_ends {
    platform::owned_handle stdio[3], ipc;
    int taken_names = 0;
};

// Somebody tries to take our pipes: the launch went on under fresh names, or
// failed once none was left to try, and the operator is to know either way.
void report_taken_names(process_owner& owner, child_ends& ends) {
    if (int taken = std::exchange(ends.taken_names, 0))
        owner.log_warning("another program took %d pipe names first; fresh names were tried.",
                          taken);
}

// What a failed launch says beside the line its caller logged: the names
// taken, and in -v the reason.
void log_reason(process_owner& owner, child_ends& ends, const platform::os_error& error) {
    report_taken_names(owner, ends);
    if (error)
        owner.log_verbose("%s", platform::describe(error).c_str());
}

// Our ends of the relayed pipes in streams, the child's in ends and request.
platform::os_error make_stdio(relayed_streams& streams, std::int32_t mode,
                              platform::launch_request& request, child_ends& ends) {
    if (mode == stdio_none)
        request.stdio = platform::stdio_source::none;
    if (mode != stdio_pipes)
        return {};
    request.stdio = platform::stdio_source::handles;
    if (platform::os_error error = streams.make(ends.stdio, ends.taken_names)) {
        streams.close();
        return error;
    }
    for (int stream = 0; stream < 3; ++stream)
        request.stdio_handles[stream] = ends.stdio[stream].get();
    return {};
}

// The line of a launch the system refused; the status its requester is sent.
std::uint32_t log_refusal(process_owner& owner, const execute_request& what,
                          const platform::launch_result& launched) {
    if (launched.failed_step == platform::launch_step::logon) {
        owner.log_warning("Failed to logon as user '%s': error %d", what.user.c_str(),
                          launched.error.code);
        return status_not_found;
    }
    if (launched.failed_step == platform::launch_step::refused)
        owner.log_error("refused to run '%s': a command interpreter would read its arguments.",
                        what.command[0].c_str());
    else if (launched.failed_step == platform::launch_step::unconvertible)
        owner.log_error("refused to run '%s': an item is no text of the system's code page.",
                        what.command[0].c_str());
    else
        owner.log_error("failed to create child process.");
    return static_cast<std::uint32_t>(launched.error.code);
}

} // namespace

bool process::start() {
    if (life_.state() != life_state::launching)
        return true;
    // The child's ends: it inherits its copies at the launch, ours go with these.
    child_ends ends;
    // Each failure below is one line, its reason in -v, and failed for the requester.
    auto fail = [this, &ends](std::uint32_t status, const platform::os_error& error) {
        log_reason(owner, ends, error);
        on(life_event::launch_failed, status);
        return false;
    };
    const std::vector<std::string>& command = what.command;
    if (command.empty() || command[0].empty()) {
        // Nothing to launch would leave an object that never ends and keeps
        // the run alive; finish it like any failed launch.
        owner.log_error("executable not specified");
        return fail(status_malformed, {});
    }
    std::vector<std::string> argv = command;
    if (platform::os_error error = platform::resolve_program(argv)) {
        owner.log_error("executable '%s' not found.", command[0].c_str());
        return fail(status_not_found, error);
    }
    platform::launch_request request;
    if (platform::os_error error = make_stdio(streams_, what.stdio_mode, request, ends)) {
        owner.log_error("failed to create child process.");
        return fail(error.code, error);
    }
    if (what.persistent) {
        platform::pipe_step failed = platform::pipe_step::none;
        if (platform::os_error error = link_.make(ends.ipc, failed, ends.taken_names)) {
            // The half that failed says its own line, and the launch the usual one.
            owner.log_error(failed == platform::pipe_step::open ? "failed to open ipc pipe."
                                                                : "failed to create ipc pipe.");
            owner.log_error("failed to create ipc pipe.");
            return fail(error.code, error);
        }
        request.ipc = ends.ipc.get();
        argv.push_back(std::to_string(platform::handle_value(ends.ipc.get())));
    }
    request.executable = argv[0];
    request.argv = std::move(argv);
    request.working_directory = what.working_directory;
    request.user = what.user;
    // At a console the terminal signals its whole foreground group; only
    // we are to hear Ctrl-C, and stop the children in order.
    request.own_process_group = !owner.facts().background;
    report_taken_names(owner, ends);
    platform::launch_result launched = platform::launch_child(request);
    // The child has its copies of these now, or never will.
    ends.ipc.reset();
    for (auto& end : ends.stdio)
        end.reset();
    if (launched.failed_step != platform::launch_step::none)
        return fail(log_refusal(owner, what, launched), launched.error);
    if (platform::os_error error = child_.watch(launched)) {
        // Without its exit in the loop we could never see it end; the child
        // was ended at once, so this start failed.
        owner.log_error("failed to create child process.");
        return fail(error.code, error);
    }
    on(life_event::launched);
    return true;
}

void process::watch() {
    auto self = shared_from_this();
    child_.await_end(self);
    if (what.stdio_mode == stdio_pipes) {
        streams_.await(1, self);
        streams_.await(2, self);
    }
    if (what.persistent)
        link_.start();
    if (auto requester = place.parent.lock())
        requester->link().send(place.channel, packet_opened, child_.pid(), nullptr, 0);
}

void process::attach(std::int32_t attach_pid, std::int64_t handle_value) {
    if (platform::os_error error = link_.attach(handle_value)) {
        owner.log_error("failed to attach to ipc pipe.");
        owner.log_verbose("%s", platform::describe(error).c_str());
        return;
    }
    child_.set_pid(static_cast<std::uint32_t>(attach_pid));
    on(life_event::attached);
}

} // namespace torvad
