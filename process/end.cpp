// The end of a child: its exit, the drain of its output, the report to its
// requester, and leaving the owner, which decides on a successor.
#include "process/process.hpp"

namespace torvad {

void process::on_exit(const boost::system::error_code& error) {
    // Only a closing handle ends the wait with an error: finish has run.
    if (error || shut_)
        return;
    platform::exit_status exit = child_.take_end();
    if (!exit.ended) {
        // Readiness is a hint: the loop can hand the stale readiness of a
        // descriptor closed in this turn to one opened after it. Only a reaped
        // status is the end of a child.
        wait_for_exit();
        return;
    }
    if (exit.error) {
        owner.log_error("failed to read the exit status of '%s'.", name_.c_str());
        owner.log_verbose("%s", platform::describe(exit.error).c_str());
    }
    // All the child wrote is in its pipes now. What a descendant still holds
    // open is not waited for: take what is there and close. A read on its
    // way holds bytes from before the rest, so its landing comes first.
    child_.begin_ending(child_.code_of(exit));
    finish_after_output();
}

void process::finish_after_output() {
    if (!child_.ending() || !drain_output())
        return;
    finish(child_.end_ending(), packet_closed);
}

void process::close_pipes() {
    streams_.close();
}

void process::close_channel_pipes() {
    for (process* own : link_.own_channels)
        own->close_pipes();
}

void process::finish(std::uint32_t exit_status, std::uint32_t end) {
    end_packet_ = end;
    status_ = exit_status;
    // The owner logs the end and starts a successor first: the time from an
    // exit to the next start is what a restart costs.
    if (end_packet_ == packet_closed)
        owner.child_ended(*this, status_);
    // Closing ends the pending reads and writes before their queues go.
    close_pipes();
    link_.close();
    child_.close();
    streams_.clear_input();
    count_stdin_backlog();
    // A requester held back by our stdin backlog may read again.
    if (auto requester = parent.lock())
        requester->resume_ipc_read();
    // In this turn, behind all the output already relayed and behind a
    // successor's opened: a peer that sent two requests in one write sees
    // their ends in the order it asked, and may use the id again at once.
    report_end();
    // Leaving the set may drop the last reference but ours.
    auto self = shared_from_this();
    owner.remove(self);
}

void process::terminate() {
    if (persistent) {
        send_packet(0, packet_sigterm, 0, nullptr, 0);
        stopped_by_terminal_ = child_.continue_if_stopped();
        return;
    }
    if (!child_.watched())
        return;
    if (platform::os_error error = child_.end_by_force()) {
        owner.log_error("failed to end '%s'.", name_.c_str());
        owner.log_verbose("%s", platform::describe(error).c_str());
    }
}

} // namespace torvad
