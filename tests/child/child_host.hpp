// What the test child asks of its system, one small file for each
// (child_posix.cpp, child_win32.cpp).
#pragma once

#include <string>
#include <vector>

namespace child_host {

// Standard streams that carry bytes as they are (Windows would turn \n into \r\n).
void prepare_streams();
// Lines on what the child was started with beside ipc_fd: descriptors,
// signals, account.
std::vector<std::string> start_state(int ipc_fd);
// Leaves count processes behind whose parent has gone: each reports who
// adopted it and ends when we do. False where nothing adopts (Windows).
bool leave_orphans(int count);
// Takes, first, the name that the parent's ipc pipe number n would get, as
// another program of the machine could; false where pipes have no names.
bool take_pipe_name(int n);
// Console control event n (1 Ctrl-Break, 2 close) to our parent, as the
// console delivers one; false where there are no such events.
bool console_event(int n);
// Makes a pipe and starts torvad with -a on its far end (theirs), as a peer
// that runs torvad for itself does.
bool start_attached(const std::string& torvad, int& ours, long& theirs);
// Named for a tool of the system that the tests run (Windows: powershell,
// schtasks), the child stands in for it and gives its exit code; else -1.
int stand_in_for_tool(const char* self);

} // namespace child_host
