// What comes in on an ipc pipe: read a read at a time, framed, and routed to
// the channels it names.
#include "process/ipc_link.hpp"

#include "process/process.hpp"

namespace torvad {

void ipc_link::read() {
    // The pending read owns the process, as the relayed reads do.
    pipe_.async_read_some(
        boost::asio::buffer(in_->free_space(), in_->free_size()),
        [this, self = self_.shared_from_this()](const boost::system::error_code& error,
                                                std::size_t bytes) { on_read(error, bytes); });
}

void ipc_link::on_read(const boost::system::error_code& error, std::size_t bytes) {
    // Closed by the end or the shutdown of its process: nothing more is routed.
    if (!pipe_.is_open())
        return;
    if (!error) {
        in_->add(
            bytes,
            [this](const packet_header& header, const char* payload) {
                on_packet(header, payload);
            },
            [this] { self_.owner.log_error("bad ipc packet length"); });
        // A channel that doesn't read its stdin holds back the pipe that feeds it:
        // reads pause after each one and go on only while no channel is over its mark.
        read_paused_ = true;
        resume_reads();
        return;
    }
    // An attached pipe has no child whose exit could end the process, so the
    // peer closing its end does: otherwise nothing could ever end the run.
    if (attached_) {
        self_.owner.log_info("attached ipc pipe closed.");
        self_.on(life_event::pipe_closed);
    }
}

void ipc_link::resume_reads() {
    if (!read_paused_ || !pipe_.is_open() || backlogged_channels_ != 0)
        return;
    read_paused_ = false;
    read();
}

void ipc_link::on_packet(const packet_header& header, const char* payload) {
    trace(header, payload, false);
    if (header.type == packet_stdin)
        route_stdin(header, payload);
    else if (header.type == packet_execute)
        execute(header, payload);
}

void ipc_link::route_stdin(const packet_header& header, const char* payload) {
    auto entry = channels_.find(header.channel);
    if (entry == channels_.end()) {
        self_.owner.log_error("channel 0x%x does not exist", header.channel);
        return;
    }
    auto target = entry->second.lock();
    if (!target || target->what.stdio_mode != stdio_pipes) {
        self_.owner.log_error("channel 0x%x standard input is not available", header.channel);
        return;
    }
    target->streams().write_input(payload, header.length - packet_header_size,
                                  (header.flags & stdin_close) != 0, target);
}

} // namespace torvad
