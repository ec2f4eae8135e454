// Construction and destruction of a process: entering the daemon's set, and
// the one closing packet every channel owes its parent.
#include "process/process.hpp"

#include <boost/filesystem/path.hpp>

#include "daemon/daemon.hpp"

namespace torvad {

process::process(daemon* owner, execute_request what, channel_ref ref)
    : owner(owner), command(std::move(what.command)), user(std::move(what.user)),
      working_directory(std::move(what.working_directory)), parent(std::move(ref.parent)),
      channel(ref.channel), persistent(what.persistent), stdio_mode(what.stdio_mode),
      end_packet(packet_failed), exit_watch(owner->get_executor()),
      stdin_pipe(owner->get_executor()), stdout_pipe(owner->get_executor()),
      stderr_pipe(owner->get_executor()), ipc_pipe(owner->get_executor()) {
    // Pipes are relayed to a parent; without a living one there is nowhere to go.
    if (stdio_mode == stdio_pipes && parent.expired())
        stdio_mode = stdio_none;
    if (!command.empty())
        name = boost::filesystem::path(command[0]).filename().string();
}

std::shared_ptr<process> process::create(daemon* owner, execute_request what, channel_ref ref) {
    std::shared_ptr<process> created(new process(owner, std::move(what), std::move(ref)));
    // The set is the owner from here on, so create never hands out a child
    // that the daemon doesn't know.
    owner->adopt(created);
    return created;
}

process::~process() {
    // Only an object that never reached finish (the daemon's teardown) still
    // owes its parent the closing packet here.
    report_end();
}

std::string process::description() const {
    return "'" + name + "' (pid " + std::to_string(pid) + ")";
}

void process::report_end() {
    if (end_reported)
        return;
    end_reported = true;
    if (auto requester = parent.lock()) {
        requester->send_packet(channel, end_packet, status, nullptr, 0);
        requester->channels.erase(channel);
    }
}

} // namespace torvad
