// Runs the real torvad binary for end-to-end tests: stdout on a terminal (the
// console path) or on a pipe (the service path). The same tests drive the
// Windows build under Wine when TORVAD_WINDOWS_BUILD names its folder.
#pragma once

#include <string>
#include <vector>

namespace e2e {

extern const bool under_wine;
// The programs as torvad names them; the name torvad's version packet gives
// it; the test child's file as this system names it.
extern const std::string torvad_binary, child_binary, tool_binary, wrap_binary, torvad_name,
    child_file;

enum class systems { both, linux_only, windows_only };
bool holds_here(systems where);

struct options {
    bool terminal = true;          // stdout and stderr on a terminal (a console), else a pipe
    std::vector<std::string> env;  // NAME=value set in the environment
    std::string directory;         // where it starts; empty: ours
    std::string shell;             // run first, as a careless parent leaves the start state
    std::string program;           // run instead of torvad
    bool manager = false;          // a service manager of the test's own on NOTIFY_SOCKET
    bool first_process = false;    // PID 1 of PID and mount namespaces of its own (Linux)
    systems where = systems::both; // where a row of run_rows holds
    bool as_root = false;          // a row of run_rows that holds only when we are root
};
inline const options on_linux{.where = systems::linux_only},
    on_windows{.where = systems::windows_only};

// Runs torvad with args through steps, each a check or an action, with
// bounded waits for what it prints and for its exit:
//   "?text" waits for text behind the last match    "!INT" / "!TERM" signals torvad
//   "#key"  takes the pid behind "key=" as the child "kill N" sends signal N to it
//   "=N"    expects exit code N                     "-text" text never appears
//   "&text" waits for text anywhere                 "z" no child of torvad is a zombie
//   "!GROUP" Ctrl-C at the terminal, to torvad's whole process group
//   "Ppath" the file at path holds torvad's pid and a line feed
//   "$command" a shell command of the test's own, which must succeed
// With a manager: "@message" expects its next report (a regex), "@*" drops those still
// unread, "@" expects none, "!USR2" sends torvad a SIGUSR2.
// Under Wine every stop request is Ctrl-C, typed at the console only for !GROUP.
void run_scenario(const std::vector<std::string>& args, const std::vector<std::string>& steps,
                  const options& how = {});

// A row of a scenario table; run_rows runs those that hold here.
struct row {
    std::vector<std::string> args, steps;
    options how = {};
};
void run_rows(const std::vector<row>& rows);

// A directory removed with its contents at the end of the test.
struct scratch_dir {
    scratch_dir();
    ~scratch_dir();
    std::string path;
};

// torvad's arguments for the test child in a mode: options, "--", the child, mode.
std::vector<std::string> child(std::vector<std::string> mode,
                               std::vector<std::string> options = {});
// A path here as Windows programs under Wine see it.
std::string windows_form(std::string path);
std::string read_file(const std::string& path);
// A datagram socket bound at path, as a service manager or a log daemon has.
int bound_datagram_socket(const std::string& path);

} // namespace e2e
