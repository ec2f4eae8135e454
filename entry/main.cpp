// torvad: supervises the product's programs. main reads as its steps.
#include <csignal>
#include <cstdio>

#include <boost/filesystem/path.hpp>

#include "daemon/daemon.hpp"
#include "entry/command_line.hpp"
#include "entry/product_start.hpp"
#include "entry/service.hpp"
#include "platform/platform.hpp"
#include "process/process.hpp"

using namespace torvad;

namespace {

// The name is made absolute before the working directory changes, so that the
// removal at the end reaches the file this run created.
std::string write_pid_file(const char* name) {
    if (name == nullptr)
        return {};
    platform::os_error ignored;
    std::string path = platform::absolute_path(name, ignored);
    if (platform::write_pid_file(path, platform::current_process_id()))
        return path;
    the_daemon.log_error("failed to create pid file");
    return {};
}

void choose_what_to_supervise(command_line& options) {
    if (options.command.empty() && options.attach_pid == 0) {
        // The server program wins when both products are installed here.
        if (platform::path_exists(std::string("core") + platform::exe_suffix))
            start_server_family(options.family);
        else if (platform::path_exists(std::string("wfe") + platform::exe_suffix))
            start_web_service();
        return;
    }
    auto top = process::create(&the_daemon, {.command = std::move(options.command),
                                             .user = std::move(options.user),
                                             .working_directory = ".",
                                             .persistent = true,
                                             .stdio_mode = stdio_inherit});
    // Attached before the program's name is known, so its version packet
    // names no program: peers that attach have always seen it so.
    if (options.attach_pid != 0)
        top->attach(options.attach_pid, options.attach_pipe);
    the_daemon.configure("torvad", nullptr);
}

// A stop request can come while the product's start runs its programs. At a
// console a plain kill is one too, taken by the loop once it runs; under the
// service manager it waits, blocked, for the dispatcher to act on it.
void take_stop_requests() {
    if (background)
        platform::hold_stop_requests();
    else
        the_daemon.add_stop_signal(SIGTERM);
}

void run_at_console() {
    the_daemon.start();
    the_daemon.run();
}

} // namespace

int main(int argc, char** argv) {
    // The start state (standard fds, signal dispositions) was made before the
    // daemon was built; see daemon.cpp.
    platform::unbuffer_output();
    background = !platform::stdout_is_terminal();

    command_line options = scan_command_line(argc, argv);
    if (options.help) {
        std::fputs(help_text(argv[0]).c_str(), stderr);
        return 0;
    }
    verbose = options.verbose;
    logging = options.logging;
    background = background || options.background;
    auto_restart = !options.no_restart;
    // Before the start runs any program or thread: see daemon/orphans.cpp.
    the_daemon.take_orphans();

    std::string pid_file = write_pid_file(options.pid_file);
    platform::os_error ignored;
    boost::filesystem::path exe_path = platform::absolute_path(argv[0], ignored);
    if (options.directory.empty())
        options.directory = exe_path.parent_path().string();
    // A directory that can't be entered leaves us where we started; relative
    // names are then looked up there. Operators rely on the run going on.
    platform::change_directory(options.directory);

    take_stop_requests();
    choose_what_to_supervise(options);
    the_daemon.set_program_name(exe_path.filename().string());

    if (!background)
        run_at_console();
    else
        // Outside a service manager this fails at once and nothing was
        // started: the run simply ends, so its result changes nothing here.
        (void)platform::run_service_dispatcher(the_daemon.service_name(), run_service,
                                               service_control_stop);

    if (!pid_file.empty())
        platform::remove_file(pid_file);
    return 0;
}
