// What the test child asks of its system (child_posix.cpp, child_win32.cpp);
// false where the system has no such thing.
#pragma once

#include <string>
#include <vector>

namespace child_host {

// Standard streams that carry bytes as they are (Windows would turn \n into \r\n).
void prepare_streams();
// Lines on what the child was started with: descriptors, signals, account.
std::vector<std::string> start_state(int ipc_fd);
// Leaves count orphans behind that report who adopted them and end when we do.
bool leave_orphans(int count);
// Takes first the parent's pipe names of its random calls "n,n,...", which a
// bcrypt.dll stand-in makes known; then, with "", whether any was connected.
bool squat(const std::string& calls);
// Console event n (1 Ctrl-Break, 2 close, 5 logoff, 6 shutdown) to our parent and to us.
bool console_event(int n);
// Makes a pipe and starts torvad with -a on its far end (theirs).
bool start_attached(const std::string& torvad, int& ours, long& theirs);
// One datagram to NOTIFY_SOCKET, as a server that speaks systemd's notify protocol.
bool notify(const std::string& message);
// Named powershell or schtasks on Windows, stands in for it: its exit code, else -1.
int stand_in_for_tool(const char* self);

} // namespace child_host
