// Making, attaching and closing an ipc pipe, and its queue's bookkeeping.
#include "process/ipc_link.hpp"

#include <utility>

namespace torvad {

platform::os_error ipc_link::make(platform::owned_handle& theirs, platform::pipe_step& failed) {
    platform::os_error error = platform::make_ipc_pipe(pipe_, theirs, failed);
    if (!error)
        in_ = std::make_unique<framer>();
    return error;
}

platform::os_error ipc_link::attach(std::int64_t handle_value) {
    platform::os_error error = platform::attach_pipe(pipe_, handle_value);
    if (!error)
        in_ = std::make_unique<framer>();
    return error;
}

void ipc_link::close() {
    boost::system::error_code ignored;
    pipe_.close(ignored);
    out_.clear();
    channels.clear();
}

bool ipc_link::resume_reads() {
    if (!read_paused_ || !pipe_.is_open() || backlogged_channels_ != 0)
        return false;
    read_paused_ = false;
    return true;
}

bool ipc_link::queue_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                            const void* data, std::uint32_t size) {
    out_.push_packet(channel, type, flags, data, size);
    return !writing_;
}

std::vector<std::weak_ptr<process>> ipc_link::take_roomed_writers() {
    if (out_.size() >= ipc_low_mark)
        return {};
    return std::exchange(waiting_, {});
}

} // namespace torvad
