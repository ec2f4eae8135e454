// The traffic of a process's ipc pipe: binding one we were given, reading and
// framing what comes in, routing it, and pumping what goes out.
#include "process/process.hpp"

#include "ipc/trace.hpp"

namespace torvad {

void process::attach(std::int32_t attach_pid, std::int64_t handle_value) {
    if (platform::os_error error = link_.attach(handle_value)) {
        owner.log_error("failed to attach to ipc pipe.");
        owner.log_verbose("%s", platform::describe(error).c_str());
        return;
    }
    child_.set_pid(static_cast<std::uint32_t>(attach_pid));
    read_ipc();
    send_version();
}

void process::read_ipc() {
    // The pending read owns the object: see wait_output.
    link_.read([self = shared_from_this()](const boost::system::error_code& error,
                                           std::size_t bytes) { self->on_ipc_read(error, bytes); });
}

void process::on_ipc_read(const boost::system::error_code& error, std::size_t bytes) {
    if (shut_)
        return;
    if (!error) {
        link_.take(
            bytes,
            [this](const packet_header& header, const char* payload) {
                on_packet(header, payload);
            },
            [this] { owner.log_error("bad ipc packet length"); });
        // A channel that doesn't read its stdin holds back the pipe that feeds it.
        link_.pause_reads();
        resume_ipc_read();
        return;
    }
    // An attached pipe has no child whose exit could end the object, so the
    // peer closing its end does: otherwise nothing could ever end the run.
    if (child_.pid() != 0 && !child_.watched() && link_.open()) {
        owner.log_info("attached ipc pipe closed.");
        finish(0, packet_failed);
    }
}

void process::resume_ipc_read() {
    if (link_.resume_reads())
        read_ipc();
}

void process::on_packet(const packet_header& header, const char* payload) {
    trace_packet(header, payload, false);
    if (header.type == packet_stdin)
        route_stdin(header, payload);
    else if (header.type == packet_execute)
        handle_execute(header, payload);
    else if (header.type == packet_ready && header.channel == 0)
        owner.child_ready(*this);
}

void process::route_stdin(const packet_header& header, const char* payload) {
    auto entry = link_.channels.find(header.channel);
    if (entry == link_.channels.end()) {
        owner.log_error("channel 0x%x does not exist", header.channel);
        return;
    }
    auto target = entry->second.lock();
    if (!target || target->stdio_mode_ != stdio_pipes) {
        owner.log_error("channel 0x%x standard input is not available", header.channel);
        return;
    }
    target->write_stdin(payload, header.length - packet_header_size,
                        (header.flags & stdin_close) != 0);
}

void process::send_packet(std::uint32_t channel_id, std::uint32_t type, std::uint32_t flags,
                          const void* data, std::uint32_t size) {
    // A closed pipe takes nothing more, and its trace would tell of nothing.
    if (!link_.open())
        return;
    bool idle = link_.queue_packet(channel_id, type, flags, data, size);
    if (owner.facts().verbose) {
        packet_header header{size + packet_header_size, channel_id, type, flags};
        trace_packet(header, static_cast<const char*>(data), true);
    }
    if (idle)
        pump_ipc();
}

void process::pump_ipc() {
    link_.pump([self = shared_from_this()] {
        self->pump_ipc();
        for (const auto& weak : self->link_.take_roomed_writers())
            if (auto writer = weak.lock())
                writer->resume_output();
    });
}

void process::send_version() {
    const run_facts& facts = owner.facts();
    std::string payload = version_payload(facts.program_name, torvad_version, facts.background);
    send_packet(0, packet_version, 0, payload.data(), static_cast<std::uint32_t>(payload.size()));
}

void process::trace_packet(const packet_header& header, const char* payload, bool sent) {
    // Without -v this is the whole cost of the trace.
    if (!owner.facts().verbose)
        return;
    std::string line = trace_line(header, payload, sent, name_, owner.facts().trace_colour);
    owner.log_verbose("%s", line.c_str());
}

} // namespace torvad
