// The ipc pipe of a process: making it, binding one we were given, reading
// and framing what comes in, and the queue of what goes out.
#include "process/process.hpp"

#include "daemon/daemon.hpp"
#include "ipc/trace.hpp"
#include "process/flow.hpp"

namespace torvad {

platform::os_error process::create_ipc_pipe(platform::owned_handle& theirs) {
    platform::pipe_step failed = platform::pipe_step::none;
    platform::os_error error = platform::make_ipc_pipe(ipc_pipe, theirs, failed);
    if (!error)
        ipc_in = std::make_unique<framer>();
    else if (failed == platform::pipe_step::open)
        owner->log_error("failed to open ipc pipe.");
    else
        owner->log_error("failed to create ipc pipe.");
    return error;
}

void process::attach(std::int32_t attach_pid, std::int64_t handle_value) {
    if (platform::os_error error = platform::attach_pipe(ipc_pipe, handle_value)) {
        owner->log_error("failed to attach to ipc pipe.");
        owner->log_verbose("%s", platform::describe(error).c_str());
        return;
    }
    ipc_in = std::make_unique<framer>();
    pid = static_cast<std::uint32_t>(attach_pid);
    read_ipc();
    send_version();
}

void process::read_ipc() {
    // The pending read owns the object: see wait_output.
    ipc_pipe.async_read_some(
        boost::asio::buffer(ipc_in->free_space(), ipc_in->free_size()),
        [self = shared_from_this()](const boost::system::error_code& error, std::size_t bytes) {
            self->on_ipc_read(error, bytes);
        });
}

void process::on_ipc_read(const boost::system::error_code& error, std::size_t bytes) {
    if (!error) {
        ipc_in->add(
            bytes,
            [this](const packet_header& header, const char* payload) {
                on_packet(header, payload);
            },
            [this] { owner->log_error("bad ipc packet length"); });
        // A channel that doesn't read its stdin holds back the pipe that feeds it.
        ipc_read_paused = true;
        resume_ipc_read();
        return;
    }
    // An attached pipe has no child whose exit could end the object, so the
    // peer closing its end does: otherwise nothing could ever end the run.
    if (pid != 0 && !exit_watch.is_open() && ipc_pipe.is_open()) {
        owner->log_info("attached ipc pipe closed.");
        finish(0, packet_failed);
    }
}

void process::resume_ipc_read() {
    if (!ipc_read_paused || !ipc_pipe.is_open() || backlogged_channels != 0)
        return;
    ipc_read_paused = false;
    read_ipc();
}

void process::on_packet(const packet_header& header, const char* payload) {
    trace_packet(header, payload, false);
    if (header.type == packet_stdin)
        route_stdin(header, payload);
    else if (header.type == packet_execute)
        handle_execute(header, payload);
}

void process::route_stdin(const packet_header& header, const char* payload) {
    auto entry = channels.find(header.channel);
    if (entry == channels.end()) {
        owner->log_error("channel 0x%x does not exist", header.channel);
        return;
    }
    auto target = entry->second.lock();
    if (!target || target->stdio_mode != stdio_pipes) {
        owner->log_error("channel 0x%x standard input is not available", header.channel);
        return;
    }
    target->write_stdin(payload, header.length - packet_header_size,
                        (header.flags & stdin_close) != 0);
}

void process::send_packet(std::uint32_t channel_id, std::uint32_t type, std::uint32_t flags,
                          const void* data, std::uint32_t size) {
    ipc_queue.push_packet(channel_id, type, flags, data, size);
    if (verbose) {
        packet_header header{size + packet_header_size, channel_id, type, flags};
        trace_packet(header, static_cast<const char*>(data), true);
    }
    if (!ipc_writing)
        pump_ipc();
}

void process::pump_ipc() {
    ipc_writing = false;
    if (ipc_queue.empty() || !ipc_pipe.is_open())
        return;
    ipc_writing = true;
    ipc_pipe.async_write_some(
        ipc_queue.front(),
        [self = shared_from_this()](const boost::system::error_code& error, std::size_t bytes) {
            if (!error)
                self->on_ipc_written(bytes);
        });
}

void process::on_ipc_written(std::size_t bytes) {
    ipc_queue.consume(bytes);
    pump_ipc();
    if (ipc_queue.size() < ipc_low_mark && !waiting_for_room.empty()) {
        auto waiting = std::move(waiting_for_room);
        waiting_for_room.clear();
        for (const auto& weak : waiting)
            if (auto writer = weak.lock())
                writer->resume_output();
    }
}

bool process::ipc_backlogged() const {
    return ipc_queue.size() >= ipc_high_mark;
}

void process::wait_for_room(const std::shared_ptr<process>& writer) {
    waiting_for_room.push_back(writer);
}

void process::send_version() {
    std::string payload = version_payload(owner->program_name(), daemon_version, background);
    send_packet(0, packet_version, 0, payload.data(), static_cast<std::uint32_t>(payload.size()));
}

void process::trace_packet(const packet_header& header, const char* payload, bool sent) {
    // Without -v this is the whole cost of the trace.
    if (!verbose)
        return;
    std::string line = trace_line(header, payload, sent, name, owner->colour() && !logging);
    owner->log_verbose("%s", line.c_str());
}

} // namespace torvad
