// The end of a child: its exit, the restart rule, and leaving the daemon.
#include "process/process.hpp"

#include "daemon/daemon.hpp"

namespace torvad {

namespace {
// A child killed by a signal counts as failed, as the shell reports it.
constexpr std::uint32_t signal_status_base = 128;
} // namespace

std::uint32_t exit_code_of(const platform::exit_status& exit, bool forced) {
    // A status that can't be read is taken as the clean end it most likely
    // was; the log says it was not read.
    if (exit.error)
        return 0;
    if (!exit.exited)
        return forced ? 0 : signal_status_base + static_cast<std::uint32_t>(exit.code);
    return static_cast<std::uint32_t>(exit.code);
}

void process::on_exit(const boost::system::error_code& error) {
    // Only a closing handle ends the wait with an error: finish has run.
    if (error)
        return;
    platform::exit_status exit = platform::exit_status_of(exit_watch);
    if (!exit.ended) {
        // Readiness is a hint: the loop can hand the stale readiness of a
        // descriptor closed in this turn to one opened after it. Only a reaped
        // status is the end of a child.
        wait_for_exit();
        return;
    }
    if (exit.error) {
        owner->log_error("failed to read the exit status of '%s'.", name.c_str());
        owner->log_verbose("%s", platform::describe(exit.error).c_str());
    }
    std::uint32_t code = exit_code_of(exit, forced);
    // All the child wrote is in its pipes now. What a descendant still holds
    // open is not waited for: take what is there and close. A read on its
    // way holds bytes from before the rest, so its landing comes first.
    ending = true;
    ended_status = code;
    finish_after_output();
}

void process::finish_after_output() {
    if (!ending || !drain_output())
        return;
    ending = false;
    finish(ended_status, packet_closed);
}

void process::close_pipes() {
    for (auto* pipe : {&stdin_pipe, &stdout_pipe, &stderr_pipe}) {
        boost::system::error_code ignored;
        pipe->close(ignored);
    }
}

void process::finish(std::uint32_t exit_status, std::uint32_t end) {
    end_packet = end;
    status = exit_status;
    // Closing ends the pending reads and writes before their queues go.
    close_pipes();
    boost::system::error_code ignored;
    ipc_pipe.close(ignored);
    exit_watch.close(ignored);
    stdin_close_requested = false;
    stdin_queue.clear();
    ipc_queue.clear();
    channels.clear();
    // A requester held back by our stdin backlog may read again.
    if (auto requester = parent.lock())
        requester->resume_ipc_read();
    if (end_packet == packet_closed) {
        if (status == 0)
            owner->log_info("'%s' exited with 0x%x.", name.c_str(), status);
        else
            owner->log_warning("'%s' exited with 0x%x.", name.c_str(), status);
        if (status != 0 && auto_restart && persistent)
            restart();
    }
    // In this turn, behind all the output already relayed and behind a
    // successor's opened: a peer that sent two requests in one write sees
    // their ends in the order it asked, and may use the id again at once.
    report_end();
    // Leaving the set may drop the last reference but ours.
    auto self = shared_from_this();
    owner->remove(self);
}

void process::restart() {
    owner->log_info("starting '%s' again.", name.c_str());
    // The successor is in children before we leave, so the run never looks
    // empty across a restart.
    create(owner, {command, user, working_directory, persistent, stdio_mode}, {parent, channel})
        ->start();
}

void process::terminate() {
    if (persistent) {
        send_packet(0, packet_sigterm, 0, nullptr, 0);
        return;
    }
    if (exit_watch.is_open()) {
        forced = true;
        platform::end_by_force(exit_watch);
    }
}

} // namespace torvad
