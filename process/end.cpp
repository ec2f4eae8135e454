// The end of a child: its exit, the restart rule, and leaving the daemon.
#include "process/process.hpp"

#include <boost/asio/post.hpp>

#include "daemon/daemon.hpp"
#include "ipc/packet.hpp"
#include "platform/platform.hpp"

namespace torvad {

namespace {
// async_pipe hands out its ends as const only, but closing ours is ours to do.
void close_write_end(boost::process::async_pipe& pipe) {
    const_cast<boost::asio::posix::stream_descriptor&>(pipe.sink()).close();
}

// A child killed by a signal counts as failed, as the shell reports it.
constexpr std::uint32_t signal_status_base = 128;
} // namespace

void process::on_exit(const boost::system::error_code& error) {
    // Only a closing handle ends the wait with an error, and then the object
    // may be gone: touch nothing.
    if (error)
        return;
    platform::exit_status exit = platform::reap_child(process_handle.native_handle());
    if (!exit.ended) {
        // Readiness is a hint: the loop can hand the stale readiness of a
        // descriptor closed in this turn to one opened after it. Only a reaped
        // status is the end of a child.
        watch_exit();
        return;
    }
    std::uint32_t code = static_cast<std::uint32_t>(exit.code);
    if (!exit.exited)
        code = forced ? 0 : signal_status_base + code;
    if (open_streams == 0) {
        finish(code, packet_closed);
        return;
    }
    // All the child wrote is in its pipes now. Dropping our copies of their
    // write ends lets the reads run to end-of-file, so nothing is lost and
    // the closing packet still follows the last output.
    exit_pending = true;
    pending_status = code;
    close_write_end(*stdout_pipe);
    close_write_end(*stderr_pipe);
}

void process::close_pipes() {
    for (auto* pipe : {&stdin_pipe, &stdout_pipe, &stderr_pipe})
        if (*pipe)
            (*pipe)->close();
}

void process::finish(std::uint32_t exit_status, std::uint32_t end) {
    end_packet = end;
    status = exit_status;
    // Closing ends the pending reads and writes before their queues go.
    close_pipes();
    ipc_pipe.close();
    stdin_close_requested = false;
    stdin_queue.clear();
    ipc_queue.clear();
    ipc_fill = 0;
    channels.clear();
    if (end_packet == packet_closed) {
        if (status == 0)
            owner->log_info("'%s' exited with 0x%x.", name.c_str(), status);
        else
            owner->log_warning("'%s' exited with 0x%x.", name.c_str(), status);
        if (status != 0 && auto_restart && persistent) {
            owner->log_info("starting '%s' again.", name.c_str());
            // The successor is in children before we leave, so the run never
            // looks empty across a restart.
            process::create(owner, command, user, working_directory, {parent, channel}, persistent,
                            stdio_mode)
                ->start();
        }
    }
    // Completions that were already queued when the pipes closed still run and
    // may hold a plain pointer to us; this handler, queued behind them, keeps
    // the object alive until they have.
    auto self = shared_from_this();
    boost::asio::post(*owner, [self] {});
    owner->remove(self);
}

void process::terminate() {
    if (persistent) {
        send_packet(0, packet_sigterm, 0, nullptr, 0);
        return;
    }
    if (process_handle.is_open()) {
        forced = true;
        platform::kill_child(process_handle.native_handle());
    }
}

} // namespace torvad
