// The operating system seam: every system call the supervisor makes goes
// through one of these free functions, named for what it does. The build picks
// the implementation (platform/posix_*.cpp on Linux); nothing here owns state
// beyond the descriptors it hands back, which the caller then owns.
#pragma once

#include <cstdint>
#include <ctime>
#include <functional>
#include <string>
#include <vector>

namespace torvad::platform {

// The executable suffix of this system: empty here, ".exe" on Windows.
extern const char* const exe_suffix;

// --- the supervisor's own process ---------------------------------------------

int current_process_id();
bool stdout_is_terminal();
// Opens /dev/null on any of fds 0, 1, 2 that is closed, so that no pipe or
// socket of ours can ever land on a standard descriptor.
void ensure_standard_descriptors();
// A peer closing its end must surface as a write error, never kill us.
void ignore_broken_pipes();
bool change_directory(const std::string& path);
std::tm local_time_now();
// Writes the file "<pid>\n"; false when it can't be created.
bool write_pid_file(const std::string& path, int pid);
void remove_file(const std::string& path);
// The absolute form of path against the current directory, at the time of call.
std::string absolute_path(const std::string& path);

// --- the event log --------------------------------------------------------------

enum class event_type : std::uint16_t { error = 1, warning = 2, information = 4 };
// One record; the log is opened on the first record only.
void write_event_record(event_type type, const char* text);

// --- descriptors ----------------------------------------------------------------

void close_descriptor(int fd);
// A connected pair of stream sockets, both close-on-exec. Returns 0 or errno.
int make_ipc_pair(int& ours, int& theirs);
// True when fd names an open descriptor.
bool descriptor_is_open(int fd);

// --- accounts and launching -----------------------------------------------------

// An account resolved before the fork, so the child only makes system calls.
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
    account user;
};

enum class launch_step { none, logon, exec };

struct launch_result {
    int pid = 0;
    int pidfd = -1; // owned by the caller on success
    launch_step failed_step = launch_step::none;
    int error = 0; // errno of the failed step
};

// Forks and executes the child. The child keeps exactly fds 0, 1, 2 and ipc_fd,
// starts with default signal dispositions and an empty mask, and any failure
// before exec is reported back (step and errno) before this returns.
launch_result launch_child(const launch_request& request);

struct exit_status {
    bool ended = false;  // false: still running, the readiness was spurious
    bool exited = false; // false: killed by a signal
    int code = 0;        // exit status, or the signal number
};

// Reaps the child behind pidfd without blocking, if it has ended. A child that
// is already gone counts as ended with 0.
exit_status reap_child(int pidfd);
// Ends the child by force.
void kill_child(int pidfd);

// --- the service manager --------------------------------------------------------

// Runs service_main on a thread of its own when the service manager started us,
// delivering stop requests to on_stop from this thread; false at once otherwise.
bool run_service_dispatcher(const std::function<void()>& service_main,
                            const std::function<void()>& on_stop);

enum class service_state { start_pending, running, stop_pending, stopped };
void report_service_state(service_state state);

} // namespace torvad::platform

// --- programs run to their end before the supervision starts --------------------
// (the product's start: the service program check, the init script, the hand-over)
namespace torvad::platform {

// True when something of any type stands at path (a directory counts too).
bool path_exists(const std::string& path);
// The absolute path of name in a directory of PATH, or empty when there is none.
std::string find_program(const std::string& name);

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
