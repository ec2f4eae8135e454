// Runs the real torvad binary for end-to-end tests: stdout on a pseudo-terminal
// (the console path) or on a pipe (the service path), with bounded waits for
// what it prints and for its exit.
#pragma once

#include <functional>
#include <string>
#include <sys/types.h>
#include <vector>

namespace e2e {

extern const char* const torvad_binary;
extern const char* const child_binary;

struct options {
    bool terminal = true;         // stdout and stderr on a pty, else a pipe
    int inherit = -1;             // one more fd the daemon keeps
    std::vector<std::string> env; // NAME=value set in the environment (PATH too)
    std::string directory;        // where it starts; empty: ours
    // The start state a careless parent may leave: a low fd limit, stdin
    // closed, SIGCHLD ignored.
    int fd_limit = 0;
    bool close_stdin = false;
    bool ignore_sigchld = false;
};

class daemon_run {
  public:
    daemon_run(const std::vector<std::string>& args, const options& how = {});
    ~daemon_run();
    daemon_run(const daemon_run&) = delete;

    // Reads until text appears behind the cursor; moves the cursor behind it.
    bool wait_for(const std::string& text, int timeout_ms = 10000);
    // Reads until text appears anywhere; the cursor stays where it was.
    bool wait_anywhere(const std::string& text, int timeout_ms = 10000);
    // The value behind "key=" in the next output that holds it, e.g. a pid.
    std::string wait_value(const std::string& key, int timeout_ms = 10000);
    // The exit code, or -1 when it didn't end in time (it is killed then).
    int wait_exit(int timeout_ms = 10000);
    void signal(int signal_number);
    pid_t pid() const { return pid_; }
    const std::string& output() const { return output_; }

  private:
    bool read_some(int timeout_ms);
    pid_t pid_ = -1;
    int out_fd_ = -1;
    bool eof_ = false;
    bool exited_ = false;
    int exit_code_ = -1;
    std::string output_;
    std::size_t cursor_ = 0;
};

// Runs torvad with args through steps, each a check or an action:
//   "?text" waits for text behind the last match    "!INT" / "!TERM" signals torvad
//   "#key"  takes the pid behind "key=" as the child "kill N" sends signal N to it
//   "=N"    expects exit code N                     "-text" text never appears
//   "+text" text appears anywhere                    "Z" no child of torvad is a zombie
//   "&text" waits for text anywhere, cursor kept
//   "!GROUP" SIGINT to torvad's process group, as a terminal's Ctrl-C
//   "M<n>"  torvad's peak memory stayed below n MiB
// A test's own steps, tried before those above; true when it took the step.
using step_hook = std::function<bool(const std::string& step, daemon_run& run)>;
void run_scenario(const std::vector<std::string>& args, const std::vector<std::string>& steps,
                  const options& how = {}, const step_hook& hook = {});

// A scratch directory removed with its contents at the end of the test.
struct scratch_dir {
    scratch_dir();
    ~scratch_dir();
    std::string path;
};

bool file_exists(const std::string& path);
std::string read_file(const std::string& path);
// A datagram socket bound at path, as a service manager or a log daemon has.
int bound_datagram_socket(const std::string& path);
// The peak resident memory of pid, in KiB.
long peak_memory_kib(pid_t pid);
// Children of pid that are zombies.
int zombie_children(pid_t pid);

} // namespace e2e
