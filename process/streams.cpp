// The relayed standard streams of a channel: its output to the requester as
// packets, and the requester's stdin packets to the child, both held back
// when the other side doesn't keep up.
#include "process/process.hpp"

#include "daemon/daemon.hpp"
#include "process/flow.hpp"

namespace torvad {

namespace {
// Only one handler runs at a time and a read is copied into a packet at
// once, so every channel reads into this one buffer: an idle channel holds
// none of its own.
char relay_buffer[relay_read_size];
} // namespace

void process::wait_output(int stream) {
    descriptor& pipe = stream == 1 ? stdout_pipe : stderr_pipe;
    // The wait owns the object until it completes, so the closing packet of a
    // channel can only follow output that was already read.
    pipe.async_wait(descriptor::wait_read,
                    [self = shared_from_this(), stream](const boost::system::error_code& error) {
                        if (!error)
                            self->relay_output(stream);
                    });
}

// One read of stream, as one packet to the requester (dropped without one).
// A stream that ends or fails is closed; would_block leaves it open.
boost::system::error_code process::forward_output(int stream, process* requester) {
    descriptor& pipe = stream == 1 ? stdout_pipe : stderr_pipe;
    boost::system::error_code error;
    std::size_t bytes = pipe.read_some(boost::asio::buffer(relay_buffer), error);
    if (error && error != boost::asio::error::would_block) {
        boost::system::error_code ignored;
        pipe.close(ignored);
    } else if (!error && requester) {
        requester->send_packet(channel, static_cast<std::uint32_t>(stream), 0, relay_buffer,
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
// the queue's mark doesn't hold this back, the pipes' size bounds it.
void process::drain_output() {
    auto requester = parent.lock();
    for (int stream : {1, 2}) {
        descriptor& pipe = stream == 1 ? stdout_pipe : stderr_pipe;
        while (pipe.is_open() && !forward_output(stream, requester.get())) {
        }
        output_paused[stream] = false;
    }
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
    // A write holds a plain pointer: it must not keep the object alive. When
    // finish closed the pipe it completes as aborted and touches nothing; any
    // other failure is the child's end gone, seen while we are in the set.
    stdin_pipe.async_write_some(stdin_queue.front(),
                                [this](const boost::system::error_code& error, std::size_t n) {
                                    if (error == boost::asio::error::operation_aborted)
                                        return;
                                    if (error) {
                                        boost::system::error_code ignored;
                                        stdin_pipe.close(ignored);
                                        stdin_queue.clear();
                                    }
                                    stdin_queue.consume(n);
                                    count_stdin_backlog();
                                    pump_stdin();
                                    if (stdin_queue.size() < stdin_low_mark)
                                        if (auto requester = parent.lock())
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
