// What the test child asks of its system, one small file for each
// (child_posix.cpp, child_win32.cpp).
#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace child_host {

// Standard streams that carry bytes as they are (Windows would turn \n into \r\n).
void prepare_streams();
// Lines on what the child was started with: the descriptors it holds beside
// ipc_fd, its signals, its account, what of the environment it should not see.
std::vector<std::string> start_state(int ipc_fd);
// Leaves count processes behind whose parent has gone: each reports who
// adopted it and ends when we do. False when that can't be done (on Windows
// nothing adopts a process).
bool leave_orphans(int count);
// Takes, first, the name that the parent's ipc pipe number n would get, with
// room for any number of instances, as another program of the machine could;
// false where pipes have no names (Linux).
bool take_pipe_name(int n);
// Console control event n (1 Ctrl-Break, 2 close) to our parent, as the
// console delivers one: a thread of the parent's own runs its handlers.
// False where there are no such events (Linux) or it can't be sent.
bool console_event(int n);
// Named for a tool of the system that the tests run (Windows: powershell,
// schtasks), the child stands in for it and gives its exit code; -1
// when the name is no such tool's (on Linux shell scripts and the system's
// own tools serve).
int stand_in_for_tool(const char* self);

} // namespace child_host
