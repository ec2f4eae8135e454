// Execute requests: the decision is the protocol's; making the channel and
// keeping its id is ours.
#include "process/process.hpp"

#include "matcher/bounded_regex.hpp"

namespace torvad {

void process::send_and_forget(std::uint32_t channel_id, std::uint32_t type, std::uint32_t flags) {
    send_packet(channel_id, type, flags, nullptr, 0);
    link_.channels.erase(channel_id);
}

void process::handle_execute(const packet_header& header, const char* payload) {
    if (link_.channels.count(header.channel) != 0) {
        owner.log_error("channel 0x%x already exists", header.channel);
        return;
    }
    execute_decision decision =
        decide_execute(header.flags, payload, header.length - packet_header_size, user,
                       working_directory, owner.patterns(), platform::thread_cpu_nanoseconds);
    if (decision.refusal != nullptr) {
        if (decision.undecided)
            owner.log_error("a pattern could not be matched within %d ms; refused",
                            regex_time_bound_ms);
        owner.log_error("%s", decision.refusal);
        send_and_forget(header.channel, packet_failed, decision.status);
        return;
    }
    auto created = create(owner, std::move(decision.request), {weak_from_this(), header.channel});
    // The entry is there before start, so that a failed start, which sends
    // failed at once, also frees the id at once.
    link_.channels[header.channel] = created;
    created->start();
}

} // namespace torvad
