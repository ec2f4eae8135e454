// The relayed standard streams of a channel: its output to the requester as
// packets, and the requester's stdin packets to the child, both held back
// when the other side doesn't keep up.
#include "process/process.hpp"

#include "daemon/daemon.hpp"
#include "process/flow.hpp"

namespace torvad {

platform::stream& process::output_pipe(int stream) {
    return stream == 1 ? stdout_pipe : stderr_pipe;
}

platform::output_buffer& process::output_buffer_of(int stream) {
    return output_buffers[stream - 1];
}

void process::wait_output(int stream) {
    // The wait owns the object until it completes, so the closing packet of a
    // channel can only follow output that was already read.
    platform::await_output(
        output_pipe(stream), output_buffer_of(stream),
        [self = shared_from_this(), stream](const boost::system::error_code& error) {
            self->on_output(stream, error);
        });
}

void process::on_output(int stream, const boost::system::error_code& error) {
    // The child has ended, and this read was what its end waited for.
    if (ending)
        finish_after_output();
    else if (!error)
        relay_output(stream);
}

// One read of stream, as one packet to the requester (dropped without one).
// A stream that ends or fails is closed; would_block leaves it open.
boost::system::error_code process::forward_output(int stream, process* requester) {
    platform::stream& pipe = output_pipe(stream);
    const char* data = nullptr;
    std::size_t bytes = 0;
    boost::system::error_code error =
        platform::take_output(pipe, output_buffer_of(stream), data, bytes);
    if (error && error != boost::asio::error::would_block) {
        boost::system::error_code ignored;
        pipe.close(ignored);
    } else if (!error && requester) {
        requester->send_packet(channel, static_cast<std::uint32_t>(stream), 0, data,
                               static_cast<std::uint32_t>(bytes));
    }
    return error;
}

// Reads what is ready, a few reads per wake so that one busy channel doesn't
// starve the others, and stops while the requester's queue is full.
void process::relay_output(int stream) {
    auto requester = parent.lock();
    for (int reads = 0; reads < relay_reads_per_wake; ++reads) {
        if (requester && requester->ipc_backlogged()) {
            // A channel paused on its other stream waits in the list already.
            if (!output_paused[1] && !output_paused[2])
                requester->wait_for_room(shared_from_this());
            output_paused[stream] = true;
            return;
        }
        boost::system::error_code error = forward_output(stream, requester.get());
        if (error == boost::asio::error::would_block)
            break;
        if (error)
            return; // end of file, or the pipe is gone: this stream is over
    }
    wait_output(stream);
}

void process::resume_output() {
    // Both flags go first: a stream that pauses again must find itself out of
    // the requester's list, and put itself back.
    bool paused[3] = {false, output_paused[1], output_paused[2]};
    output_paused[1] = output_paused[2] = false;
    for (int stream : {1, 2})
        if (paused[stream])
            relay_output(stream);
}

// The child is gone, so what is in its pipes is all there will be from it;
// the queue's mark doesn't hold this back, the pipes' size bounds it. False
// while a read is still on its way: it is cut short, and its landing calls
// this again.
bool process::drain_output() {
    auto requester = parent.lock();
    bool drained = true;
    for (int stream : {1, 2}) {
        platform::stream& pipe = output_pipe(stream);
        if (platform::output_in_flight(output_buffer_of(stream))) {
            platform::cut_output_short(pipe);
            drained = false;
            continue;
        }
        while (pipe.is_open() && !forward_output(stream, requester.get())) {
        }
        output_paused[stream] = false;
    }
    return drained;
}

void process::write_stdin(const char* data, std::uint32_t size, bool close) {
    // Input behind a close, or for a child that closed its end, has nowhere to go.
    if (!stdin_pipe.is_open())
        return;
    stdin_queue.push(data, size);
    count_stdin_backlog();
    stdin_close_requested = stdin_close_requested || close;
    // A write in flight drains the queue by itself, a requested close included.
    if (!stdin_writing)
        pump_stdin();
}

void process::pump_stdin() {
    stdin_writing = false;
    if (!stdin_pipe.is_open())
        return;
    if (stdin_queue.empty()) {
        if (stdin_close_requested) {
            boost::system::error_code ignored;
            stdin_pipe.close(ignored);
        }
        return;
    }
    stdin_writing = true;
    // When finish closed the pipe the write completes as aborted and touches
    // nothing; any other failure is the child's end gone.
    stdin_pipe.async_write_some(
        stdin_queue.front(),
        [self = shared_from_this()](const boost::system::error_code& error, std::size_t n) {
            if (error == boost::asio::error::operation_aborted)
                return;
            if (error) {
                boost::system::error_code ignored;
                self->stdin_pipe.close(ignored);
                self->stdin_queue.clear();
            }
            self->stdin_queue.consume(n);
            self->count_stdin_backlog();
            self->pump_stdin();
            if (self->stdin_queue.size() < stdin_low_mark)
                if (auto requester = self->parent.lock())
                    requester->resume_ipc_read();
        });
}

bool process::stdin_backlogged() const {
    return stdin_queue.size() >= stdin_high_mark;
}

// The requester counts its channels over the mark as their queues cross it,
// so that whether it may read costs the same however many channels it has.
void process::count_stdin_backlog() {
    if (stdin_backlogged() == stdin_counted)
        return;
    stdin_counted = !stdin_counted;
    if (auto requester = parent.lock())
        requester->backlogged_channels += stdin_counted ? 1 : -1;
}

} // namespace torvad
