// The operating system seam: every system call the supervisor makes goes
// through one of these free functions, named for what it does. The build picks
// the implementation (platform/posix_*.cpp on Linux, win32_*.cpp on Windows;
// files.cpp on both); nothing here owns state beyond the handles it hands
// back, which the caller then owns, what it keeps to tell its own children
// from orphans, and what it last told the service manager.
#pragma once

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <functional>
#include <string>
#include <vector>

#include <boost/system/error_code.hpp>

#include "platform/handles.hpp"

namespace torvad::platform {

// The executable suffix of this system: empty on Linux, ".exe" on Windows.
extern const char* const exe_suffix;

// The system's code for "no such file": what a search that finds nothing reports.
extern const int error_not_found;

// The status of a program killed by signal: counted as a failure, as a shell
// reports it.
constexpr std::uint32_t signal_status(int signal_number) {
    return 128 + static_cast<std::uint32_t>(signal_number);
}

// A failed system call: the system's error code (errno, or GetLastError) and
// the call's name, for a log line that says which call failed and why. code 0
// is success.
struct os_error {
    int code = 0;
    const char* call = "";
    explicit operator bool() const { return code != 0; }
};
// "call: reason", e.g. "fork: Resource temporarily unavailable".
std::string describe(const os_error& error);

// --- the supervisor's own process ---------------------------------------------

// Makes the start state whatever the parent left: standard streams open,
// exits of children observable, a peer closing its end only a write error,
// and no signal blocked. An error names the first step that failed; the
// others are made all the same.
os_error prepare_own_process();
// Each log line reaches stdout as it is written, with its line feed as it is.
void unbuffer_output();
int current_process_id();
bool stdout_is_terminal();
// Whether the console takes the escape sequences of colour, switching them on
// where the console must be asked.
bool console_takes_colour();
bool change_directory(const std::string& path);
std::tm local_time_now();
// Writes the file "<pid>\n"; false when it can't be created.
bool write_pid_file(const std::string& path, int pid);
void remove_file(const std::string& path);
// The absolute, normal form of path against the current directory; an error
// when path is relative and that directory can't be had (it may have been
// deleted).
std::string absolute_path(const std::string& path, os_error& error);
// The path of an executable found on PATH (with the extensions of PATHEXT on
// Windows), or empty.
std::string search_path(const std::string& name);
// The program a command names, as it is launched: the executable suffix
// added to a name without an extension, a ".ps1" script put behind its
// interpreter (script_wrapper), and argv[0] made absolute, a bare name found
// on PATH. An error when it is not found or the current directory is gone.
os_error resolve_program(std::vector<std::string>& argv);
// The interpreter of ".ps1" scripts and its flags, the script's path to follow.
const std::vector<std::string>& script_wrapper();
// The whole content of a file.
os_error read_file(const std::string& path, std::string& content);
// True when something of any type stands at path (a directory counts too).
bool path_exists(const std::string& path);

// An account as "domain\name", split at its first backslash; no backslash:
// an empty domain.
struct account_name {
    std::string domain, name;
};
account_name split_account(const std::string& user);

// The CPU time the calling thread has used, in nanoseconds: the clock that
// bounds a pattern match (a match_clock).
std::int64_t thread_cpu_nanoseconds();

// --- the event log --------------------------------------------------------------

enum class event_type : std::uint16_t { error = 1, warning = 2, information = 4 };
// One record; the log is opened on the first record only.
void write_event_record(event_type type, const char* text);

// --- pipes ----------------------------------------------------------------------

// Which half of the ipc pipe could not be had: ours, made first, or the
// child's end, opened on it.
enum class pipe_step { none, create, open };
// Each pipe adds to taken_names the names another program had taken first;
// each was tried again under a fresh name (on Windows; a pair has no name).
// The duplex pipe of a persistent child: ours bound to the loop, theirs to be
// inherited by the child, whose last argument names it. On failure failed
// says which half it was.
os_error make_ipc_pipe(stream& ours, owned_handle& theirs, pipe_step& failed, int& taken_names);
// A relayed standard stream: for stdin (stream 0) the child reads theirs and
// we write ours; for stdout and stderr (1, 2) the other way round.
os_error make_relay_pipe(int stream_number, stream& ours, owned_handle& theirs, int& taken_names);
// Binds a pipe that another program made and gave us by its handle value.
os_error attach_pipe(stream& ours, std::int64_t value);

// Relayed output, read as it comes. await_output (with the system's types)
// completes when bytes can be taken without waiting (on Windows: when one read
// has landed in buffer); take_output then gives one read's worth at a time,
// would_block when there is nothing more now, and another error when the
// stream has ended.
boost::system::error_code take_output(stream& pipe, output_buffer& buffer, const char*& data,
                                      std::size_t& size);
// The writer of pipe has ended, so what the pipe holds is all there will be.
// True when take_output can now take all of it; false while a read armed by
// await_output may still land bytes ahead of the rest: that read is ended
// early, its handler runs next, and then this is asked again.
bool end_output(stream& pipe, output_buffer& buffer);

// --- launching and ending children ---------------------------------------------

enum class stdio_source { inherit, handles, none };

struct launch_request {
    std::string executable;        // absolute path
    std::vector<std::string> argv; // argv[0] included; each reaches the child as it is
    std::string working_directory; // empty: ours
    std::string user;              // "domain\name" to run as; empty: our own account
    stdio_source stdio = stdio_source::inherit;
    native_handle stdio_handles[3] = {no_handle, no_handle,
                                      no_handle}; // with stdio_source::handles
    native_handle ipc = no_handle;                // inherited; the child is told handle_value(ipc)
    bool own_process_group = false;               // keeps a terminal's signals from the child
};

// Where a launch failed: the logon to the account, or making the child; or
// the program was refused, being one whose arguments a command interpreter
// would read (a batch file on Windows), or an item of the launch is no text
// of the system's code page (unconvertible, on Windows).
enum class launch_step { none, logon, create, refused, unconvertible };

struct launch_result {
    int pid = 0;
    owned_handle process; // what watch_exit binds: a pidfd, or the process handle
    launch_step failed_step = launch_step::none;
    os_error error;
};

// Launches the child with exactly the items of argv as its arguments. It keeps
// exactly its standard streams and the ipc end (fds 0, 1, 2 on Linux, which
// also starts it with default signal dispositions, an empty mask and the
// environment without the service manager's socket). Any failure before the
// child runs is known (step, call and code) when this returns.
launch_result launch_child(const launch_request& request);

// Binds the process handle of a launch to watch; on failure it stays in process.
// await_exit (with the system's types) then completes once the child may have
// ended (on Linux a hint: see exit_status).
os_error watch_exit(exit_watch& watch, owned_handle& process);

// Hands handle to an Asio object of either system, which owns it from then
// on; on failure it stays in handle.
template <class asio_object> os_error adopt_handle(asio_object& into, owned_handle& handle) {
    boost::system::error_code failure;
    into.assign(handle.get(), failure);
    if (failure)
        return {failure.value(), "assign"};
    handle.release();
    return {};
}

struct exit_status {
    bool ended = false;  // false: still running, the wait's completion was stale
    bool exited = false; // false: killed by a signal
    int code = 0;        // exit status, or the signal number
    os_error error;      // the status could not be read
};

// The end of the child behind watch, if it has ended; it is reaped then.
exit_status exit_status_of(exit_watch& watch);
// Ends the child by force (TerminateProcess with 0 on Windows).
os_error end_by_force(exit_watch& watch);
// Continues the child if a terminal's job control has stopped it (it read the
// terminal from a background group); true when it was stopped. Never on Windows.
bool continue_if_stopped(exit_watch& watch);
// Ends the child by force and releases it, all before returning: for a child
// whose exit can't be watched.
void end_now(owned_handle& process);

// --- orphans ----------------------------------------------------------------------

// Makes us the reaper of our descendants whose parent has gone (the first
// process of a PID namespace is that already) and binds watch to what tells
// that one may have ended, which await_orphans (with the system's types)
// waits for. watch stays closed where no orphan is ever handed over (Windows).
// Called before any thread is started.
os_error watch_orphans(stream& watch);
// Reaps every ended child that is not one launched above, whose status stays
// for exit_status_of. False when such a child's end hides others: call again
// once its status has been taken.
bool reap_orphans(stream& watch);

// --- the service manager --------------------------------------------------------

// Keeps the service manager's stop request (SIGTERM) pending until the
// dispatcher waits for it, so that it can't end us by its default action.
os_error hold_stop_requests();
// Runs service_main on a thread of its own when the service manager started us
// (or a container runtime, which stands for it), delivering stop requests to
// on_stop from this thread; false at once otherwise. service_main runs only
// once the service could be registered under name.
bool run_service_dispatcher(const std::string& name, const std::function<void()>& service_main,
                            const std::function<void()>& on_stop);

enum class service_state { start_pending, running, stop_pending, stopped };
// children: the number of persistent children, which the status text of the
// running and stopping states names where the service manager shows one.
os_error report_service_state(service_state state, std::size_t children);
// A change of that number while running or stopping; nothing otherwise.
os_error report_service_children(std::size_t count);
// A start that is still pending goes on: Windows' manager counts its
// checkpoints; systemd waits for READY=1 without them.
os_error report_start_progress();

} // namespace torvad::platform

// --- programs run to their end before the supervision starts --------------------
// (the product's start: the service program check, the init script, the hand-over)
namespace torvad::platform {

// Which of the program's standard streams comes back to the caller.
enum class returned_stream { none = 0, output = 1, error = 2 };

struct program_end {
    int error = 0;      // the system's code when the program could not be started at all
    int exit_code = -1; // its exit status, or 128 + the signal that ended it
};

// Runs the program at path (relative: to the working directory, never searched
// for) with args behind argv[0] = path, and waits for its end without a time
// limit. The returned stream is handed to on_output as it arrives, so the
// program never blocks on a full pipe; its other streams are ours. On Linux it
// gets our environment less NOTIFY_SOCKET, and no descriptor beyond 0, 1 and 2.
program_end run_program(const std::string& path, const std::vector<std::string>& args,
                        returned_stream returned,
                        const std::function<void(const char*, std::size_t)>& on_output);

// The hand-over's job: one that runs once as the system account after our
// end, points service_name at core_path and starts the service; through the
// task scheduler ("schtasks") where it is on PATH, else the system's own way
// (schedule_system_job). False when it could not be scheduled.
bool schedule_handover(const std::string& service_name, const std::string& core_path);
bool schedule_system_job(const std::string& service_name, const std::string& core_path);

} // namespace torvad::platform
