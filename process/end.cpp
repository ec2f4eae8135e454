// The end of a child: the report to its owner and its requester, and leaving
// the owner, which decides on a successor; and the stop that asks for it.
#include "process/process.hpp"

namespace torvad {

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
