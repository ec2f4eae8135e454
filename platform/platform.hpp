// The operating system seam: every system call the supervisor makes goes
// through one of these free functions, named for what it does. The build picks
// the implementation (platform/posix_*.cpp on Linux); nothing here owns state
// beyond the descriptors it hands back, which the caller then owns, the pids
// of the children it launched until their status is taken, and what it last
// told the service manager.
#pragma once

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <functional>
#include <string>
#include <vector>

namespace torvad::platform {

// The executable suffix of this system: empty here, ".exe" on Windows.
extern const char* const exe_suffix;

// A failed system call: its errno and its name, for a log line that says
// which call failed and why. code 0 is success.
struct os_error {
    int code = 0;
    const char* call = "";
    explicit operator bool() const { return code != 0; }
};
// "call: reason", e.g. "fork: Resource temporarily unavailable".
std::string describe(const os_error& error);

// --- the supervisor's own process ---------------------------------------------

// Makes the start state whatever the parent left: fds 0, 1, 2 open (on
// /dev/null where closed, before anything else takes those numbers), default
// SIGCHLD so that exits can be waited for, SIGPIPE ignored so that a peer
// closing its end is a write error, and no signal blocked.
void prepare_own_process();
int current_process_id();
bool stdout_is_terminal();
bool change_directory(const std::string& path);
std::tm local_time_now();
// Writes the file "<pid>\n"; false when it can't be created.
bool write_pid_file(const std::string& path, int pid);
void remove_file(const std::string& path);
// The absolute, normal form of path against the current directory; an error
// when path is relative and that directory can't be had (it may have been
// deleted).
std::string absolute_path(const std::string& path, os_error& error);
// The path of an executable found on PATH, or empty.
std::string search_path(const std::string& name);
// The whole content of a file.
os_error read_file(const std::string& path, std::string& content);

// Runs work on a thread with a stack of stack_bytes and waits for it; what
// work throws is thrown here. False when no such thread could be had.
bool run_on_large_stack(std::size_t stack_bytes, const std::function<void()>& work);

// --- the event log --------------------------------------------------------------

enum class event_type : std::uint16_t { error = 1, warning = 2, information = 4 };
// One record; the log is opened on the first record only.
void write_event_record(event_type type, const char* text);

// --- descriptors ----------------------------------------------------------------

void close_descriptor(int fd);
// A connected pair of stream sockets, both close-on-exec.
os_error make_ipc_pair(int& ours, int& theirs);
// A pipe, both ends close-on-exec.
os_error make_pipe(int& read_end, int& write_end);
// True when fd names an open descriptor.
bool descriptor_is_open(int fd);

// --- accounts and launching -----------------------------------------------------

// An account resolved before the launch, so the child only makes system calls.
struct account {
    bool change = false; // false: run as ourselves
    unsigned uid = 0;
    unsigned gid = 0;
    std::vector<unsigned> groups;
};

// Resolves "domain\name" (empty domain or "." is this machine). Returns 0, or
// the errno-like reason the logon is refused.
int resolve_account(const std::string& user, account& out);

enum class stdio_source { inherit, descriptors, null_device };

struct launch_request {
    std::string executable;        // absolute path
    std::vector<std::string> argv; // argv[0] included
    std::string working_directory; // empty: ours
    stdio_source stdio = stdio_source::inherit;
    int stdio_fds[3] = {-1, -1, -1}; // with stdio_source::descriptors
    int ipc_fd = -1;                 // kept open in the child at the same number
    bool own_process_group = false;  // keeps a terminal's signals from the child
    account user;
};

// Where a launch failed: switching to the account, or making the child.
enum class launch_step { none, logon, create };

struct launch_result {
    int pid = 0;
    int pidfd = -1; // owned by the caller on success
    launch_step failed_step = launch_step::none;
    os_error error;
};

// Launches the child. It keeps exactly fds 0, 1, 2 and ipc_fd, starts with
// default signal dispositions, an empty mask and the environment without the
// service manager's socket, and any failure before exec is known (step, call
// and errno) when this returns.
launch_result launch_child(const launch_request& request);

struct exit_status {
    bool ended = false;  // false: still running, the readiness was spurious
    bool exited = false; // false: killed by a signal
    int code = 0;        // exit status, or the signal number
    os_error error;      // the wait itself failed: the status is unknown
};

// Reaps the child behind pidfd without blocking, if it has ended.
exit_status reap_child(int pidfd);
// Ends the child by force.
void kill_child(int pidfd);
// Ends the child by force, reaps it and closes its pidfd, all before returning.
void end_child_now(int pidfd);

// --- orphans ----------------------------------------------------------------------

// Makes us the reaper of our descendants whose parent has gone (the first
// process of a PID namespace is that already) and gives a descriptor that is
// readable when a child may have ended; -1 where no orphan is ever handed over.
// Called before any thread is started.
os_error watch_orphans(int& fd);
// Reaps every ended child that is not one launched above, whose status stays
// for reap_child. False when such a child's end hides others: call again once
// its status has been taken.
bool reap_orphans(int fd);

// --- the service manager --------------------------------------------------------

// Keeps the service manager's stop request (SIGTERM) pending until the
// dispatcher waits for it, so that it can't end us by its default action.
void hold_stop_requests();
// Runs service_main on a thread of its own when the service manager started us
// (or a container runtime, which stands for it), delivering stop requests to
// on_stop from this thread; false at once otherwise.
bool run_service_dispatcher(const std::function<void()>& service_main,
                            const std::function<void()>& on_stop);

enum class service_state { start_pending, running, stop_pending, stopped };
// children: the number of persistent children, which the status text of the
// running and stopping states names where the service manager shows one.
void report_service_state(service_state state, std::size_t children);
// A change of that number while running or stopping; nothing otherwise.
void report_service_children(std::size_t count);

} // namespace torvad::platform

// --- programs run to their end before the supervision starts --------------------
// (the product's start: the service program check, the init script, the hand-over)
namespace torvad::platform {

// True when something of any type stands at path (a directory counts too).
bool path_exists(const std::string& path);

// Which of the program's standard streams comes back to the caller.
enum class returned_stream { none = 0, output = 1, error = 2 };

struct program_end {
    int error = 0;      // errno when the program could not be started at all
    int exit_code = -1; // its exit status, or 128 + the signal that ended it
};

// Runs the program at path (relative: to the working directory, never searched
// for) with args behind argv[0] = path, and waits for its end without a time
// limit. The returned stream is handed to on_output as it arrives, so the
// program never blocks on a full pipe; its other streams are ours. It gets
// our environment less NOTIFY_SOCKET, and no descriptor beyond 0, 1 and 2.
program_end run_program(const std::string& path, const std::vector<std::string>& args,
                        returned_stream returned,
                        const std::function<void(const char*, std::size_t)>& on_output);

} // namespace torvad::platform
