// The relay of a channel's standard streams: its output to the requester as
// packets, and the requester's stdin packets to the child, both held back
// when the other side doesn't keep up.
#include "process/process.hpp"

namespace torvad {

namespace {
requester_link* link_of(const std::shared_ptr<process>& requester) {
    return requester ? &requester->link() : nullptr;
}
} // namespace

void relayed_streams::await(int stream, std::shared_ptr<process> self) {
    // The wait owns the process until it completes, so the closing packet of
    // a channel can only follow output that was already read.
    platform::await_output(
        output(stream), buffer(stream),
        [self = std::move(self), stream](const boost::system::error_code& error) {
            self->on(error ? life_event::output_closed : life_event::output,
                     static_cast<std::uint32_t>(stream));
        });
}

void relayed_streams::relay(int stream, const std::shared_ptr<process>& self) {
    auto requester = self->place.parent.lock();
    for (int reads = 0; reads < relay_reads_per_wake; ++reads) {
        if (requester && requester->link().backlogged()) {
            // A channel paused on its other stream waits in the list already.
            if (!paused_[1] && !paused_[2])
                requester->link().wait_for_room(self);
            paused_[stream] = true;
            return;
        }
        boost::system::error_code error = forward(stream, link_of(requester), self->place.channel);
        if (error == boost::asio::error::would_block)
            break;
        if (error)
            return; // end of file, or the pipe is gone: this stream is over
    }
    await(stream, self);
}

void relayed_streams::resume(const std::shared_ptr<process>& self) {
    // Both flags go first: a stream that pauses again must find itself out of
    // the requester's list, and put itself back.
    bool paused[3] = {false, paused_[1], paused_[2]};
    paused_[1] = paused_[2] = false;
    for (int stream : {1, 2})
        if (paused[stream])
            relay(stream, self);
}

// What is in the pipes is all there will be from the child; the queue's mark
// doesn't hold this back, the pipes' size bounds it.
bool relayed_streams::drain(const process& self) {
    auto requester = self.place.parent.lock();
    bool drained = true;
    for (int stream : {1, 2}) {
        if (!platform::end_output(output(stream), buffer(stream))) {
            drained = false;
            continue;
        }
        while (output(stream).is_open() &&
               !forward(stream, link_of(requester), self.place.channel)) {
        }
        paused_[stream] = false;
    }
    return drained;
}

void relayed_streams::write_input(const char* data, std::uint32_t size, bool close,
                                  const std::shared_ptr<process>& self) {
    if (!stdin_.is_open())
        return;
    stdin_queue_.push(data, size);
    close_requested_ = close_requested_ || close;
    count_backlog(link_of(self->place.parent.lock()));
    // A write in flight drains the queue by itself, a requested close included.
    if (!writing_)
        pump_input(self);
}

// Writes the front of the queue; a write cut short by close() does nothing more.
void relayed_streams::pump_input(std::shared_ptr<process> self) {
    writing_ = false;
    if (!stdin_.is_open())
        return;
    if (stdin_queue_.empty()) {
        if (close_requested_)
            close_input();
        return;
    }
    writing_ = true;
    stdin_.async_write_some(stdin_queue_.front(),
                            [this, self = std::move(self)](const boost::system::error_code& error,
                                                           std::size_t written) mutable {
                                if (error == boost::asio::error::operation_aborted)
                                    return;
                                // Any other failure is the child's end gone: nothing more goes in.
                                if (error) {
                                    close_input();
                                    stdin_queue_.clear();
                                }
                                stdin_queue_.consume(written);
                                auto requester = self->place.parent.lock();
                                count_backlog(link_of(requester));
                                bool room = stdin_queue_.size() < stdin_low_mark;
                                pump_input(std::move(self));
                                if (room && requester)
                                    requester->link().resume_reads();
                            });
}

} // namespace torvad
