// The seam's types on Windows: overlapped handles, whose reads complete on
// the loop with the bytes already in a buffer.
#pragma once

#include <cstddef>
#include <utility>

#include <boost/asio/buffer.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/windows/object_handle.hpp>
#include <boost/asio/windows/stream_handle.hpp>

namespace torvad::platform {

using native_handle = void*; // HANDLE, without <windows.h> in every file
constexpr native_handle no_handle = nullptr;
// The number a child is told on its command line.
inline long long handle_value(native_handle handle) {
    return reinterpret_cast<long long>(handle);
}

// A pipe end opened for overlapped input and output.
using stream = boost::asio::windows::basic_stream_handle<boost::asio::io_context::executor_type>;
// A child's process handle: signalled once the child has ended.
using exit_watch =
    boost::asio::windows::basic_object_handle<boost::asio::io_context::executor_type>;

// A pipe has no readiness to wait for: a read is handed its buffer when it is
// armed, so each relayed stream of a channel has one of its own.
struct output_buffer {
    static constexpr std::size_t capacity = 4096;
    char bytes[capacity];
    std::size_t held = 0; // landed by the last read, not yet taken
    bool reading = false; // a read is armed and hasn't completed
};

// The waits of the seam take any completion handler, as Asio's own do: one
// kept in a std::function would cost every pending wait an allocation.
template <class Handler> void await_output(stream& pipe, output_buffer& buffer, Handler&& handler) {
    buffer.reading = true;
    pipe.async_read_some(boost::asio::buffer(buffer.bytes),
                         [&buffer, handler = std::forward<Handler>(handler)](
                             const boost::system::error_code& error, std::size_t bytes) mutable {
                             buffer.reading = false;
                             buffer.held = bytes;
                             handler(error);
                         });
}
template <class Handler> void await_exit(exit_watch& watch, Handler&& handler) {
    watch.async_wait(std::forward<Handler>(handler));
}
// Nothing is ever handed over: the watch stays closed, and nothing waits.
template <class Handler> void await_orphans(stream&, Handler&&) {}

} // namespace torvad::platform
