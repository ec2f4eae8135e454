// Construction and destruction of a process, and the actions its life calls for.
#include "process/process.hpp"

#include <boost/filesystem/path.hpp>

namespace torvad {

namespace {
// Pipes are relayed to a parent; without a living one there is nowhere to go.
execute_request as_run(execute_request what, const channel_ref& ref) {
    if (what.stdio_mode == stdio_pipes && ref.parent.expired())
        what.stdio_mode = stdio_none;
    return what;
}

std::string file_name(const std::vector<std::string>& command) {
    return command.empty() ? std::string()
                           : boost::filesystem::path(command[0]).filename().string();
}
} // namespace

process::process(process_owner& owner, execute_request what, channel_ref ref)
    : owner(owner), what(as_run(std::move(what), ref)), place(std::move(ref)),
      name(file_name(this->what.command)), child_(owner.loop()), streams_(owner.loop()),
      link_(*this, owner.loop()) {
    if (auto requester = place.parent.lock())
        requester->link().join(this);
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
    // No packet from here: an object that never ended is one the owner's
    // shutdown dropped, and its requester is gone before it. One that ended
    // left at its end, and its id may be another's by now.
    if (life_.state() != life_state::ended)
        if (auto requester = place.parent.lock())
            requester->link().leave(place.channel, this);
}

std::string process::description() const {
    return "'" + name + "' (pid " + std::to_string(child_.pid()) +
           (child_.stopped_by_terminal() ? ", stopped by the terminal)" : ")");
}

void process::on(life_event event, std::uint32_t value) {
    child_life::taken step = life_.take(event, value);
    switch (step.action) {
    case life_action::none:
        break;
    case life_action::watch:
        watch();
        break;
    case life_action::serve:
        link_.start();
        break;
    case life_action::relay:
        streams_.relay(static_cast<int>(step.value), shared_from_this());
        break;
    case life_action::drain:
        if (streams_.drain(*this))
            on(life_event::drained);
        break;
    case life_action::fail:
        finish(step.value, packet_failed);
        break;
    case life_action::close_end:
        finish(step.value, packet_closed);
        break;
    case life_action::terminate:
        stop_child();
        break;
    case life_action::close_handles:
        streams_.close();
        link_.close();
        child_.close();
        break;
    }
}

} // namespace torvad
