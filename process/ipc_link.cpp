// Making, attaching and closing an ipc pipe, and what goes out on it.
#include "process/ipc_link.hpp"

#include <utility>

#include "ipc/trace.hpp"
#include "process/process.hpp"

namespace torvad {

platform::os_error ipc_link::make(platform::owned_handle& theirs, platform::pipe_step& failed) {
    platform::os_error error = platform::make_ipc_pipe(pipe_, theirs, failed);
    if (!error)
        in_ = std::make_unique<framer>();
    return error;
}

platform::os_error ipc_link::attach(std::int64_t handle_value) {
    platform::os_error error = platform::attach_pipe(pipe_, handle_value);
    if (!error) {
        in_ = std::make_unique<framer>();
        attached_ = true;
    }
    return error;
}

void ipc_link::start() {
    read();
    const run_facts& facts = self_.owner.facts();
    std::string payload = version_payload(facts.program_name, torvad_version, facts.background);
    send(0, packet_version, 0, payload.data(), static_cast<std::uint32_t>(payload.size()));
}

void ipc_link::close() {
    boost::system::error_code ignored;
    pipe_.close(ignored);
    out_.clear();
    channels_.clear();
}

void ipc_link::close_channel_pipes() {
    for (process* own : own_channels_)
        own->streams().close();
}

void ipc_link::leave(std::uint32_t id, process* channel) {
    channels_.erase(id);
    own_channels_.erase(channel);
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
