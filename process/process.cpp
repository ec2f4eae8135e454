// Construction and destruction of a process: entering its owner's set, and
// leaving its requester's channels.
#include "process/process.hpp"

#include <boost/filesystem/path.hpp>

namespace torvad {

process::process(process_owner& owner, execute_request what, channel_ref ref)
    : owner(owner), command(std::move(what.command)), user(std::move(what.user)),
      working_directory(std::move(what.working_directory)), parent(std::move(ref.parent)),
      channel(ref.channel), persistent(what.persistent), stdio_mode_(what.stdio_mode),
      end_packet_(packet_failed), child_(owner.loop()), streams_(owner.loop()),
      link_(owner.loop()) {
    // Pipes are relayed to a parent; without a living one there is nowhere to go.
    if (stdio_mode_ == stdio_pipes && parent.expired())
        stdio_mode_ = stdio_none;
    if (!command.empty())
        name_ = boost::filesystem::path(command[0]).filename().string();
    if (auto requester = parent.lock())
        requester->link_.own_channels.insert(this);
}

std::shared_ptr<process> process::create(process_owner& owner, execute_request what,
                                         channel_ref ref) {
    std::shared_ptr<process> created(new process(owner, std::move(what), std::move(ref)));
    // The set is the owner from here on, so create never hands out a child
    // that the owner doesn't know.
    owner.adopt(created);
    return created;
}

process::~process() {
    // No packet from here: an object that never reached finish is one the
    // owner's shutdown dropped, and its requester is gone before it.
    leave_parent();
}

std::string process::description() const {
    return "'" + name_ + "' (pid " + std::to_string(child_.pid()) +
           (stopped_by_terminal_ ? ", stopped by the terminal)" : ")");
}

void process::report_end() {
    if (end_reported_)
        return;
    if (auto requester = parent.lock())
        requester->send_packet(channel, end_packet_, status_, nullptr, 0);
    leave_parent();
}

void process::leave_parent() {
    end_reported_ = true;
    if (auto requester = parent.lock()) {
        requester->link_.channels.erase(channel);
        requester->link_.own_channels.erase(this);
    }
}

void process::close_all() {
    shut_ = true;
    close_pipes();
    link_.close();
    child_.close();
}

} // namespace torvad
