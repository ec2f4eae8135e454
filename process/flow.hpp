// The marks of flow control. A child that doesn't read and a peer that
// doesn't read must not grow the supervisor: each queue stops what fills it
// at its high mark and lets it go on below its low mark. Nothing is dropped.
#pragma once

#include <cstddef>

namespace torvad {

// A channel's output is not read while its requester's ipc queue holds this much.
constexpr std::size_t ipc_high_mark = 256 * 1024;
constexpr std::size_t ipc_low_mark = 64 * 1024;
// An ipc pipe is not read while a channel it feeds holds this much stdin.
constexpr std::size_t stdin_high_mark = 256 * 1024;
constexpr std::size_t stdin_low_mark = 64 * 1024;
// A relayed read (at most 4096 bytes, the seam's) becomes one packet.
constexpr int relay_reads_per_wake = 16;

} // namespace torvad
