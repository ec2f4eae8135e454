// The byte paths of a process: a child's output to its parent as packets, the
// parent's stdin packets to the child, and the queue of the ipc pipe.
#include "process/process.hpp"

#include <boost/asio/read.hpp>
#include <boost/asio/write.hpp>

#include "daemon/daemon.hpp"
#include "ipc/packet.hpp"

namespace torvad {

namespace {

// Writes the whole front entry of queue, which stays queued until the write
// is done; then drops it and pumps the next. The handler holds a plain
// pointer: a write must not keep the object alive, and a closed stream
// completes it with an error, on which it touches nothing.
template <class Stream>
void write_front(Stream& stream, std::deque<std::vector<char>>& queue, process* writer,
                 void (process::*pump)()) {
    boost::asio::async_write(
        stream, boost::asio::buffer(queue.front()),
        [&queue, writer, pump](const boost::system::error_code& error, std::size_t) {
            if (error)
                return;
            // finish may have emptied the queue meanwhile
            if (!queue.empty())
                queue.pop_front();
            (writer->*pump)();
        });
}

} // namespace

void process::read_output(std::int32_t stream) {
    auto& pipe = stream == 1 ? stdout_pipe : stderr_pipe;
    char* buffer = stream == 1 ? stdout_buffer : stderr_buffer;
    // The read owns the object until it completes, so the closing packet of a
    // channel can only follow output that was already read.
    pipe->async_read_some(boost::asio::buffer(buffer, sizeof stdout_buffer),
                          [self = shared_from_this(),
                           stream](const boost::system::error_code& error, std::size_t bytes) {
                              self->on_output(error, bytes, stream);
                          });
}

void process::on_output(const boost::system::error_code& error, std::size_t bytes,
                        std::int32_t stream) {
    if (error) {
        // The last stream to end completes an exit that waited for the output.
        if (--open_streams == 0 && exit_pending)
            finish(pending_status, packet_closed);
        return;
    }
    if (auto requester = parent.lock())
        requester->send_packet(channel, static_cast<std::uint32_t>(stream), 0,
                               stream == 1 ? stdout_buffer : stderr_buffer,
                               static_cast<std::uint32_t>(bytes));
    read_output(stream);
}

void process::write_stdin(const char* data, std::uint32_t size) {
    bool idle = stdin_queue.empty();
    if (size != 0)
        stdin_queue.emplace_back(data, data + size);
    // A write in flight drains the queue by itself, a requested close included.
    if (idle)
        pump_stdin();
}

void process::pump_stdin() {
    if (!stdin_pipe || !stdin_pipe->is_open())
        return;
    if (stdin_queue.empty()) {
        if (stdin_close_requested)
            stdin_pipe->close();
        return;
    }
    write_front(*stdin_pipe, stdin_queue, this, &process::pump_stdin);
}

void process::send_packet(std::uint32_t channel_id, std::uint32_t type, std::uint32_t flags,
                          const void* data, std::uint32_t size) {
    ipc_queue.push_back(frame_packet(channel_id, type, flags, data, size));
    trace_packet(ipc_queue.back().data(), true);
    if (ipc_queue.size() == 1)
        pump_ipc();
}

void process::pump_ipc() {
    if (ipc_queue.empty() || !ipc_pipe.is_open())
        return;
    write_front(ipc_pipe, ipc_queue, this, &process::pump_ipc);
}

} // namespace torvad
