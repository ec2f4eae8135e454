// The flow of a channel's relayed streams: its output to the requester as
// packets, and the requester's stdin packets to the child, both held back
// when the other side doesn't keep up.
#include "process/process.hpp"

namespace torvad {

void process::wait_output(int stream) {
    // The wait owns the object until it completes, so the closing packet of a
    // channel can only follow output that was already read.
    platform::await_output(
        streams_.output(stream), streams_.buffer(stream),
        [self = shared_from_this(), stream](const boost::system::error_code& error) {
            self->on_output(stream, error);
        });
}

void process::on_output(int stream, const boost::system::error_code& error) {
    if (shut_)
        return;
    // The child has ended, and this read was what its end waited for.
    if (child_.ending())
        finish_after_output();
    else if (!error)
        relay_output(stream);
}

// One read of stream, as one packet to the requester (dropped without one).
boost::system::error_code process::forward_output(int stream, process* requester) {
    return streams_.forward(stream, [&](const char* data, std::size_t bytes) {
        if (requester)
            requester->send_packet(channel, static_cast<std::uint32_t>(stream), 0, data,
                                   static_cast<std::uint32_t>(bytes));
    });
}

// Reads what is ready, a few reads per wake so that one busy channel doesn't
// starve the others, and stops while the requester's queue is full.
void process::relay_output(int stream) {
    auto requester = parent.lock();
    for (int reads = 0; reads < relay_reads_per_wake; ++reads) {
        if (requester && requester->link_.backlogged()) {
            // A channel paused on its other stream waits in the list already.
            if (!streams_.any_paused())
                requester->link_.wait_for_room(weak_from_this());
            streams_.set_paused(stream, true);
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
    bool paused[3] = {false, streams_.paused(1), streams_.paused(2)};
    streams_.set_paused(1, false);
    streams_.set_paused(2, false);
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
        platform::stream& pipe = streams_.output(stream);
        if (platform::output_in_flight(streams_.buffer(stream))) {
            platform::cut_output_short(pipe);
            drained = false;
            continue;
        }
        while (pipe.is_open() && !forward_output(stream, requester.get())) {
        }
        streams_.set_paused(stream, false);
    }
    return drained;
}

void process::write_stdin(const char* data, std::uint32_t size, bool close) {
    // Input behind a close, or for a child that closed its end, has nowhere to go.
    if (!streams_.input_open())
        return;
    bool idle = streams_.queue_input(data, size, close);
    count_stdin_backlog();
    // A write in flight drains the queue by itself, a requested close included.
    if (idle)
        pump_stdin();
}

void process::pump_stdin() {
    streams_.pump_input([self = shared_from_this()] {
        self->count_stdin_backlog();
        self->pump_stdin();
        if (self->streams_.queued_input() < stdin_low_mark)
            if (auto requester = self->parent.lock())
                requester->resume_ipc_read();
    });
}

// The requester counts its channels over the mark as their queues cross it,
// so that whether it may read costs the same however many channels it has.
void process::count_stdin_backlog() {
    if (streams_.input_backlogged() == stdin_counted_)
        return;
    stdin_counted_ = !stdin_counted_;
    if (auto requester = parent.lock())
        requester->link_.count_backlogged_channel(stdin_counted_);
}

} // namespace torvad
