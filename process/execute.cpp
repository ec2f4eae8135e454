// Execute requests: the decision is the protocol's; making the channel and
// keeping its id is the link's.
#include "process/ipc_link.hpp"

#include "matcher/bounded_regex.hpp"
#include "process/process.hpp"

namespace torvad {

void ipc_link::send_and_forget(std::uint32_t channel, std::uint32_t type, std::uint32_t flags) {
    send(channel, type, flags, nullptr, 0);
    channels_.erase(channel);
}

void ipc_link::execute(const packet_header& header, const char* payload) {
    process_owner& owner = self_.owner;
    if (channels_.count(header.channel) != 0) {
        owner.log_error("channel 0x%x already exists", header.channel);
        return;
    }
    execute_decision decision = decide_execute(
        header.flags, payload, header.length - packet_header_size, self_.what.user,
        self_.what.working_directory, owner.patterns(), platform::thread_cpu_nanoseconds);
    if (decision.refusal != nullptr) {
        if (decision.undecided)
            owner.log_error("a pattern could not be matched within %d ms; refused",
                            regex_time_bound_ms);
        owner.log_error("%s", decision.refusal);
        send_and_forget(header.channel, packet_failed, decision.status);
        return;
    }
    auto created = process::create(owner, std::move(decision.request),
                                   {self_.weak_from_this(), header.channel});
    // The entry is there before start, so that a failed start, which sends
    // failed at once, also frees the id at once.
    channels_[header.channel] = created;
    created->start();
}

} // namespace torvad
