// The ipc pipe of a process: making it, binding one we were given, and
// framing what comes in, in place in ipc_buffer.
#include "process/process.hpp"

#include <cerrno>
#include <cstring>

#include "daemon/daemon.hpp"
#include "ipc/packet.hpp"
#include "platform/platform.hpp"

namespace torvad {

namespace {
// Counts the pipes made by this process, never going back.
std::uint64_t ipc_pipe_counter = 0;
} // namespace

int process::create_ipc_pipe(int& error) {
    ++ipc_pipe_counter;
    int ours = -1, theirs = -1;
    error = platform::make_ipc_pair(ours, theirs);
    if (error == 0) {
        try {
            ipc_pipe.assign(ours);
            return theirs;
        } catch (const boost::system::system_error& failure) {
            error = failure.code().value();
            platform::close_descriptor(ours);
            platform::close_descriptor(theirs);
        }
    }
    owner->log_error("failed to create ipc pipe.");
    return -1;
}

void process::attach(std::int32_t attach_pid, int fd) {
    try {
        if (!platform::descriptor_is_open(fd))
            throw boost::system::system_error(EBADF, boost::system::generic_category());
        ipc_pipe.assign(fd);
    } catch (const boost::system::system_error&) {
        owner->log_error("failed to attach to ipc pipe.");
        return;
    }
    pid = static_cast<std::uint32_t>(attach_pid);
    read_ipc();
    send_version();
}

void process::read_ipc() {
    // The pending read owns the object: see read_output.
    ipc_pipe.async_read_some(
        boost::asio::buffer(ipc_buffer + ipc_fill, sizeof ipc_buffer - ipc_fill),
        [self = shared_from_this()](const boost::system::error_code& error, std::size_t bytes) {
            self->on_ipc_read(error, bytes);
        });
}

void process::on_ipc_read(const boost::system::error_code& error, std::size_t bytes) {
    if (!error) {
        frame_ipc(static_cast<std::uint32_t>(bytes));
        read_ipc();
        return;
    }
    // An attached pipe has no child whose exit could end the object, so the
    // peer closing its end does: otherwise nothing could ever end the run.
    if (pid != 0 && !process_handle.is_open() && ipc_pipe.is_open()) {
        owner->log_info("attached ipc pipe closed.");
        finish(0, packet_failed);
    }
}

void process::frame_ipc(std::uint32_t bytes) {
    ipc_fill += bytes;
    std::uint32_t offset = 0;
    while (ipc_fill - offset >= packet_header_size) {
        const char* packet = ipc_buffer + offset;
        packet_header header = read_packet_header(packet);
        if (!valid_packet_length(header.length)) {
            owner->log_error("bad ipc packet length");
            ipc_fill = 0;
            return;
        }
        if (header.length > ipc_fill - offset)
            break;
        trace_packet(packet, false);
        if (header.type == packet_stdin)
            route_stdin(packet);
        else if (header.type == packet_execute)
            handle_execute(packet);
        offset += header.length;
    }
    // One move of the unfinished tail, however many packets came in this read.
    ipc_fill -= offset;
    if (offset != 0 && ipc_fill != 0)
        std::memmove(ipc_buffer, ipc_buffer + offset, ipc_fill);
}

void process::route_stdin(const char* packet) {
    packet_header header = read_packet_header(packet);
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
    if (header.flags & stdin_close)
        target->stdin_close_requested = true;
    target->write_stdin(packet + packet_header_size, header.length - packet_header_size);
}

void process::send_version() {
    std::string payload = version_payload(owner->program_name, daemon_version, background);
    send_packet(0, packet_version, 0, payload.data(), static_cast<std::uint32_t>(payload.size()));
}

} // namespace torvad
