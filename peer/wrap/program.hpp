// The system calls under torvad-wrap, one file for each system
// (program_posix.cpp, program_win32.cpp): the wrapped program's start, stop
// and end, its notify socket, and the wrapper's own signals.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace torvad::wrap {

struct running_program {
    long pid = 0;
    std::intptr_t handle = 0; // Windows: the process handle
    int stop_signal = 0;      // the stop it was started for
};

// The stop signal an option names ("TERM", "SIGHUP", "2"); -1 for none the
// system knows. Windows has one stop, Ctrl-Break, named "BREAK".
int signal_by_name(const std::string& name);
int default_stop_signal();

// Keeps the ipc link from the program: it is torvad's pipe to us alone.
void keep_link_from_program(long link);

// Starts command with our own standard streams, in a process group of its
// own, with NOTIFY_SOCKET set to notify_address when that isn't empty, to be
// stopped by stop_signal.
// Returns 0, or the error number of the failed start.
int start_program(const std::vector<std::string>& command, const std::string& notify_address,
                  int stop_signal, running_program& out);
// Asks the program to stop its own way: its stop signal to its process group
// on Linux, Ctrl-Break to its process group on Windows. A failure names the
// call and its error number.
struct stop_failure {
    int error = 0;
    const char* call = "";
};
stop_failure stop_program(const running_program& program);
// How the program ended: its status is its exit code, or 128 + the signal
// that ended it, also named.
struct program_end {
    int status = 0;
    int signal = 0;
};
// The text of an error number, for a log line.
std::string error_text(int error);

// A datagram socket of our own for the program's notify messages; fd -1, an
// empty address and the error where there is none.
struct notify_socket {
    long fd = -1;
    std::string address;
    int error = 0;
};
notify_socket open_notify_socket();
// Blocks for the next message into buffer: its size, -1 on an error; a
// message that didn't fit is flagged too long and its size is what it was.
long receive_notification(const notify_socket& socket, char* buffer, std::size_t size,
                          bool& too_long);

// Holds our own stop requests (SIGTERM, SIGHUP; a console's close, a logoff,
// a shutdown) from now on, for serve to hand over; Ctrl-C at the console is
// torvad's to act on. Called first, before the program starts.
void hold_own_stop_requests();

// What serve hands over as it comes: on Linux every call is on serve's own
// thread; on Windows the link is read on a thread of its own, and a stop
// comes on the console's.
struct handlers {
    // The link has bytes: take them; false once it has ended.
    std::function<bool()> on_link;
    // A notify message waits: take it; false once the socket failed.
    std::function<bool()> on_notification;
    // We were asked to stop.
    void (*on_stop)() = nullptr;
};
// Waits for the program's end, handing over until then what comes on the
// link and the notify socket, and our own stop requests, held or new.
program_end serve(const running_program& program, long link, const notify_socket& socket,
                  const handlers& on);

} // namespace torvad::wrap
