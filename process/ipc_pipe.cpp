// The traffic of an ipc pipe: what comes in, read a read at a time, framed
// and routed to the channels it names; and what goes out, queued, traced and
// written, with the channels that wait for room woken as it drains.
#include "process/ipc_link.hpp"

#include <utility>

#include "ipc/trace.hpp"
#include "process/process.hpp"

namespace torvad {

void ipc_link::start() {
    read();
    const run_facts& facts = self_.owner.facts();
    std::string payload = version_payload(facts.program_name, torvad_version, facts.background);
    send(0, packet_version, 0, payload.data(), static_cast<std::uint32_t>(payload.size()));
}

void ipc_link::close_channel_pipes() {
    for (process* own : own_channels_)
        own->streams().close();
}

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
    else if (header.type == packet_ready && header.channel == 0)
        self_.owner.child_ready(self_);
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

void ipc_link::send(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                    const void* data, std::uint32_t size) {
    // A closed pipe takes nothing more, and its trace would tell of nothing.
    if (!pipe_.is_open())
        return;
    out_.push_packet(channel, type, flags, data, size);
    if (self_.owner.facts().verbose) {
        packet_header header{size + packet_header_size, channel, type, flags};
        trace(header, static_cast<const char*>(data), true);
    }
    // A write in flight takes it with the rest.
    if (!writing_)
        pump();
}

void ipc_link::pump() {
    writing_ = false;
    if (out_.empty() || !pipe_.is_open())
        return;
    writing_ = true;
    // A failed or cut write does nothing more; one that went out wakes the
    // channels that waited for room, once the queue is below its low mark.
    pipe_.async_write_some(out_.front(),
                           [this, self = self_.shared_from_this()](
                               const boost::system::error_code& error, std::size_t bytes) {
                               if (error)
                                   return;
                               out_.consume(bytes);
                               pump();
                               if (out_.size() >= ipc_low_mark)
                                   return;
                               for (const auto& weak : std::exchange(waiting_, {}))
                                   if (auto writer = weak.lock())
                                       writer->streams().resume(writer);
                           });
}

void ipc_link::trace(const packet_header& header, const char* payload, bool sent) {
    // Without -v this is the whole cost of the trace.
    const run_facts& facts = self_.owner.facts();
    if (!facts.verbose)
        return;
    std::string line = trace_line(header, payload, sent, self_.name, facts.trace_colour);
    self_.owner.log_verbose("%s", line.c_str());
}

} // namespace torvad
