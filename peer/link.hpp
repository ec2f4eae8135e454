// The system calls under a peer's connection: one small file for each system
// (link_posix.cpp, link_win32.cpp). A link is the value torvad put on the
// command line: a descriptor number on Linux, a handle value on Windows.
#pragma once

#include <cstddef>
#include <string>

namespace torvad::peer {

// True when value names an open descriptor or handle of this process.
bool link_is_open(long value);
void close_link(int link);
// Bytes read into buffer, 0 at the end of the stream, -1 on an error.
long read_link(int link, char* buffer, std::size_t size);
// Writes all of data. With wait_ms >= 0, gives up when the far end takes
// nothing for that long; false then, and on an error. Never raises SIGPIPE.
bool write_link(int link, const char* data, std::size_t size, int wait_ms = -1);

} // namespace torvad::peer
