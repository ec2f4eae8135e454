// The end of a child: the wait for its exit, the report to its owner and its
// requester, and leaving the owner, which decides on a successor; and the
// stop that asks for it.
#include "process/process.hpp"

namespace torvad {

void launched_child::await_end(std::shared_ptr<process> self) {
    platform::await_exit(
        watch_, [this, self = std::move(self)](const boost::system::error_code& error) mutable {
            on_end(error, std::move(self));
        });
}

void launched_child::on_end(const boost::system::error_code& error, std::shared_ptr<process> self) {
    // Only a closing handle ends the wait with an error, and a wait that
    // completed as it closed finds it closed: either way the child is done with.
    if (error || !watch_.is_open())
        return;
    platform::exit_status exit = platform::exit_status_of(watch_);
    if (!exit.ended) {
        // Readiness is a hint: the loop can hand the stale readiness of a
        // descriptor closed in this turn to one opened after it. Only a reaped
        // status is the end of a child.
        await_end(std::move(self));
        return;
    }
    if (exit.error) {
        self->owner.log_error("failed to read the exit status of '%s'.", self->name.c_str());
        self->owner.log_verbose("%s", platform::describe(exit.error).c_str());
    }
    // All the child wrote is in its pipes now; its output is taken before its
    // end is told.
    self->on(life_event::exited, exit_code_of(exit, forced_));
}

void process::finish(std::uint32_t status, std::uint32_t end_packet) {
    // The owner logs the end and starts a successor first: the time from an
    // exit to the next start is what a restart costs.
    if (end_packet == packet_closed)
        owner.child_ended(*this, status);
    // Closing ends the pending reads and writes before their queues go.
    streams_.close();
    link_.close();
    child_.close();
    auto requester = place.parent.lock();
    streams_.drop_input(requester ? &requester->link() : nullptr);
    // In this turn, behind all the output already relayed and behind a
    // successor's opened: a peer that sent two requests in one write sees
    // their ends in the order it asked, and may use the id again at once.
    if (requester) {
        requester->link().send(place.channel, end_packet, status, nullptr, 0);
        requester->link().leave(place.channel, this);
    }
    // Our channels' output has nowhere to go now: each channel knows its
    // requester, so an end costs the same however many children there are.
    link_.close_channel_pipes();
    // Leaving the set may drop the last reference but ours.
    auto self = shared_from_this();
    owner.remove(self);
}

void process::stop_child() {
    if (what.persistent) {
        link_.send(0, packet_sigterm, 0, nullptr, 0);
        child_.continue_if_stopped();
        return;
    }
    if (!child_.watched())
        return;
    if (platform::os_error error = child_.end_by_force()) {
        owner.log_error("failed to end '%s'.", name.c_str());
        owner.log_verbose("%s", platform::describe(error).c_str());
    }
}

} // namespace torvad
