// torvad: supervises the product's programs. main reads as its steps, and
// owns the daemon from its first step to its last.
#include <csignal>
#include <cstdio>

#include <boost/filesystem/path.hpp>

#include "daemon/daemon.hpp"
#include "entry/command_line.hpp"
#include "entry/product_start.hpp"
#include "entry/service.hpp"
#include "platform/platform.hpp"
#include "process/process.hpp"

namespace torvad {
namespace {

settings settings_of(const command_line& options) {
    return {.verbose = options.verbose,
            .logging = options.logging,
            .background = options.background || !platform::stdout_is_terminal(),
            .auto_restart = !options.no_restart,
            .readiness = options.readiness};
}

// The name is made absolute before the working directory changes, so that the
// removal at the end reaches the file this run created.
std::string write_pid_file(daemon& supervisor, const char* name) {
    if (name == nullptr)
        return {};
    // Without a current directory the name stays relative, and -v says why.
    platform::os_error error;
    std::string path = platform::absolute_path(name, error);
    if (error)
        supervisor.log_verbose("%s", platform::describe(error).c_str());
    if (platform::write_pid_file(path, platform::current_process_id()))
        return path;
    supervisor.log_error("failed to create pid file");
    return {};
}

// False when the service was handed over instead: there is nothing to supervise.
bool choose_what_to_supervise(daemon& supervisor, command_line& options) {
    if (options.command.empty() && options.attach_pid == 0) {
        // The server program wins when both products are installed here.
        if (platform::path_exists(std::string("core") + platform::exe_suffix))
            return start_server_family(supervisor, options.family);
        if (platform::path_exists(std::string("wfe") + platform::exe_suffix))
            start_web_service(supervisor);
        return true;
    }
    auto top = process::create(supervisor, {.command = std::move(options.command),
                                            .user = std::move(options.user),
                                            .working_directory = ".",
                                            .persistent = true,
                                            .stdio_mode = stdio_inherit});
    // Attached before the program's name is known, so its version packet
    // names no program: peers that attach have always seen it so.
    if (options.attach_pid != 0)
        top->attach(options.attach_pid, options.attach_pipe);
    supervisor.configure("torvad", nullptr);
    return true;
}

// A stop request can come while the product's start runs its programs. At a
// console a plain kill is one too, taken by the loop once it runs; under the
// service manager it waits, blocked, for the dispatcher to act on it.
void take_stop_requests(daemon& supervisor, bool background) {
    if (!background)
        supervisor.add_stop_signal(SIGTERM);
    else if (platform::os_error error = platform::hold_stop_requests())
        supervisor.log_verbose("%s", platform::describe(error).c_str());
}

void supervise(daemon& supervisor, bool background) {
    if (!background) {
        supervisor.start();
        supervisor.run();
        return;
    }
    service_run service(supervisor);
    // Outside a service manager this fails at once and nothing was started:
    // the run simply ends, so its result changes nothing here.
    (void)platform::run_service_dispatcher(
        supervisor.service_name(), [&service] { service.main(); },
        [&service] { service.control_stop(); });
}

} // namespace

// The program's steps, in the order they run.
int run_program(int argc, char** argv) {
    // The start state (standard fds, signal dispositions) comes before any
    // descriptor of ours, so none can take a standard stream's number.
    platform::os_error start_state = platform::prepare_own_process();
    platform::unbuffer_output();

    command_line options = scan_command_line(argc, argv);
    if (options.help) {
        std::fputs(help_text(argv[0]).c_str(), stderr);
        return 0;
    }
    settings chosen = settings_of(options);
    daemon supervisor(chosen);
    if (start_state)
        supervisor.log_verbose("%s", platform::describe(start_state).c_str());
    // Before the start runs any program or thread: see daemon/orphans.cpp.
    supervisor.take_orphans();

    std::string pid_file = write_pid_file(supervisor, options.pid_file);
    platform::os_error error;
    boost::filesystem::path exe_path = platform::absolute_path(argv[0], error);
    if (error)
        supervisor.log_verbose("%s", platform::describe(error).c_str());
    if (options.directory.empty())
        options.directory = exe_path.parent_path().string();
    // A directory that can't be entered leaves us where we started; relative
    // names are then looked up there. Operators rely on the run going on.
    platform::change_directory(options.directory);

    take_stop_requests(supervisor, chosen.background);
    // A hand-over ends the run at once, and leaves the PID file in place.
    if (!choose_what_to_supervise(supervisor, options))
        return 1;
    supervisor.set_program_name(exe_path.filename().string());
    supervise(supervisor, chosen.background);
    supervisor.shut_down();

    if (!pid_file.empty())
        platform::remove_file(pid_file);
    return 0;
}

} // namespace torvad

int main(int argc, char** argv) {
    return torvad::run_program(argc, argv);
}
