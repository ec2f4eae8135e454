// The seam's types on Linux: descriptors, read by the reactor once ready.
#pragma once

#include <boost/asio/io_context.hpp>
#include <boost/asio/posix/stream_descriptor.hpp>

#include <utility>

namespace torvad::platform {

using native_handle = int;
constexpr native_handle no_handle = -1;
// A launched child has its ipc end at the first descriptor after its
// standard streams, whatever number ours had (see posix_launch.cpp).
constexpr native_handle child_ipc_handle = 3;
// The number a child is told on its command line.
inline long long handle_value(native_handle /*ipc*/) {
    return child_ipc_handle;
}

// A pipe or socket of a child, or the watch of orphans.
using stream = boost::asio::posix::basic_stream_descriptor<boost::asio::io_context::executor_type>;
// A child's pidfd: readable once the child has ended.
using exit_watch = stream;

// Relayed output waits for readiness and is then read into one buffer that
// all channels share (a read is sent on at once), so a channel keeps nothing.
struct output_buffer {};

// The waits of the seam take any completion handler, as Asio's own do: one
// kept in a std::function would cost every pending wait an allocation.
template <class Handler> void await_output(stream& pipe, output_buffer&, Handler&& handler) {
    pipe.async_wait(stream::wait_read, std::forward<Handler>(handler));
}
template <class Handler> void await_exit(exit_watch& watch, Handler&& handler) {
    watch.async_wait(exit_watch::wait_read, std::forward<Handler>(handler));
}
template <class Handler> void await_orphans(stream& watch, Handler&& handler) {
    watch.async_wait(stream::wait_read, std::forward<Handler>(handler));
}

} // namespace torvad::platform
