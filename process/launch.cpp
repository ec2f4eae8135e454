// Turning a constructed process into a running child: resolve the program,
// make its pipes, switch account, launch, then watch its exit and streams.
#include "process/process.hpp"

#include <boost/filesystem/operations.hpp>
#include <boost/process/search_path.hpp>

#include "daemon/daemon.hpp"
#include "ipc/packet.hpp"
#include "platform/platform.hpp"

namespace torvad {

namespace {

const char* const script_wrapper[] = {"powershell",       "-noprofile", "-noninteractive",
                                      "-executionpolicy", "bypass",     "-file"};

// Applies the suffix and script rules to argv[0]; false when a bare name is
// not found on the search path.
bool resolve_executable(std::vector<std::string>& argv) {
    std::string extension = boost::filesystem::path(argv[0]).extension().string();
    if (extension.empty())
        argv[0] += platform::exe_suffix;
    else if (extension == ".ps1")
        argv.insert(argv.begin(), std::begin(script_wrapper), std::end(script_wrapper));
    if (argv[0].find_first_of("/\\") == std::string::npos) {
        auto found = boost::process::search_path(argv[0]);
        if (found.empty())
            return false;
        argv[0] = found.string();
    }
    boost::system::error_code ignored;
    argv[0] = boost::filesystem::absolute(argv[0], boost::filesystem::current_path(ignored))
                  .lexically_normal()
                  .string();
    return true;
}

} // namespace

bool process::fail_launch(std::uint32_t failure_status) {
    finish(failure_status, packet_failed);
    return false;
}

bool process::prepare_stdio(platform::launch_request& request) {
    if (stdio_mode == stdio_none)
        request.stdio = platform::stdio_source::null_device;
    if (stdio_mode != stdio_pipes)
        return true;
    // async_pipe reports failure by exception; a launch reports it by result.
    try {
        stdin_pipe = std::make_unique<boost::process::async_pipe>(*owner);
        stdout_pipe = std::make_unique<boost::process::async_pipe>(*owner);
        stderr_pipe = std::make_unique<boost::process::async_pipe>(*owner);
    } catch (const boost::system::system_error& error) {
        owner->log_error("failed to create child process.");
        fail_launch(error.code().value());
        return false;
    }
    request.stdio = platform::stdio_source::descriptors;
    request.stdio_fds[0] = stdin_pipe->native_source();
    request.stdio_fds[1] = stdout_pipe->native_sink();
    request.stdio_fds[2] = stderr_pipe->native_sink();
    return true;
}

bool process::start() {
    if (pid != 0)
        return true;
    if (command.empty() || command[0].empty()) {
        // Nothing to launch would leave an object that never ends and keeps
        // the run alive; finish it like any failed launch.
        owner->log_error("executable not specified");
        return fail_launch(status_malformed);
    }
    std::vector<std::string> argv = command;
    if (!resolve_executable(argv)) {
        owner->log_error("executable '%s' not found.", command[0].c_str());
        return fail_launch(status_not_found);
    }
    platform::launch_request request;
    if (!prepare_stdio(request))
        return false;
    if (persistent) {
        int error = 0;
        request.ipc_fd = create_ipc_pipe(error);
        if (request.ipc_fd == -1) {
            owner->log_error("failed to create ipc pipe.");
            return fail_launch(error);
        }
        argv.push_back(std::to_string(request.ipc_fd));
    }
    int logon_error = user.empty() ? 0 : platform::resolve_account(user, request.user);
    platform::launch_result launched;
    if (logon_error == 0) {
        request.executable = argv[0];
        request.argv = std::move(argv);
        request.working_directory = working_directory;
        launched = platform::launch_child(request);
        if (launched.failed_step == platform::launch_step::logon)
            logon_error = launched.error;
    }
    // The child has its copy of the ipc end now, or never will.
    platform::close_descriptor(request.ipc_fd);
    if (logon_error != 0) {
        owner->log_warning("Failed to logon as user '%s': error %d", user.c_str(), logon_error);
        return fail_launch(status_not_found);
    }
    if (launched.failed_step != platform::launch_step::none) {
        owner->log_error("failed to create child process.");
        return fail_launch(launched.error);
    }
    watch_child(launched.pidfd, launched.pid);
    return true;
}

void process::watch_child(int pidfd, int child_pid) {
    process_handle.assign(pidfd);
    pid = static_cast<std::uint32_t>(child_pid);
    watch_exit();
    if (stdio_mode == stdio_pipes) {
        open_streams = 2;
        read_output(1);
        read_output(2);
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
    process_handle.async_wait(boost::asio::posix::stream_descriptor::wait_read,
                              [this](const boost::system::error_code& error) { on_exit(error); });
}

} // namespace torvad
