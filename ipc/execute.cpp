// Execute requests: a child asks for a program to be run as a new channel on
// its pipe, checked against the patterns before anything is made.
#include "process/process.hpp"

#include "daemon/daemon.hpp"
#include "ipc/packet.hpp"
#include "ipc/patterns.hpp"
#include "ipc/strings.hpp"

namespace torvad {

void process::send_and_forget(std::uint32_t channel_id, std::uint32_t type, std::uint32_t flags) {
    send_packet(channel_id, type, flags, nullptr, 0);
    channels.erase(channel_id);
}

namespace {

// Takes the first item into value when a further item stands behind it.
bool take_leading_item(std::vector<std::string>& items, std::string& value) {
    if (items.size() < 2)
        return false;
    value = std::move(items.front());
    items.erase(items.begin());
    return true;
}

std::int32_t requested_stdio(std::uint32_t flags) {
    if (flags & execute_stdio_pipes)
        return stdio_pipes;
    return flags & execute_stdio_none ? stdio_none : stdio_inherit;
}

} // namespace

void process::handle_execute(const char* packet) {
    packet_header header = read_packet_header(packet);
    if (channels.count(header.channel) != 0) {
        owner->log_error("channel 0x%x already exists", header.channel);
        return;
    }
    auto items = split_strings(packet + packet_header_size, header.length - packet_header_size, 0);
    std::string wanted_user = user;
    std::string wanted_path = working_directory;
    const char* refusal = nullptr;
    std::uint32_t refusal_status = status_malformed;
    if ((header.flags & execute_user) && !take_leading_item(items, wanted_user))
        refusal = "user not specified";
    else if ((header.flags & execute_path) && !take_leading_item(items, wanted_path))
        refusal = "path not specified";
    else if (items.front().empty())
        refusal = "executable not specified";
    else if ((refusal = permission_refusal(*owner, user, wanted_user, items)) != nullptr)
        refusal_status = status_not_permitted;
    if (refusal != nullptr) {
        owner->log_error("%s", refusal);
        send_and_forget(header.channel, packet_failed, refusal_status);
        return;
    }
    auto created = spawn(owner, std::move(items), std::move(wanted_user), std::move(wanted_path),
                         {weak_from_this(), header.channel},
                         (header.flags & execute_persistent) != 0, requested_stdio(header.flags));
    created->start();
    // A failed start already left children: dropping created then sends
    // failed and erases this entry again, from the destructor.
    channels[header.channel] = created;
}

} // namespace torvad
