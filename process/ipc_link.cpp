// Making, attaching and closing an ipc pipe, and a channel leaving it.
#include "process/ipc_link.hpp"

namespace torvad {

platform::os_error ipc_link::make(platform::owned_handle& theirs, platform::pipe_step& failed,
                                  int& taken_names) {
    platform::os_error error = platform::make_ipc_pipe(pipe_, theirs, failed, taken_names);
    if (!error)
        in_ = std::make_unique<framer>();
    return error;
}

platform::os_error ipc_link::attach(std::int64_t handle_value) {
    platform::os_error error = platform::attach_pipe(pipe_, handle_value);
    if (!error) {
        in_ = std::make_unique<framer>();
        attached_ = true;
    }
    return error;
}

void ipc_link::close() {
    boost::system::error_code ignored;
    pipe_.close(ignored);
    out_.clear();
    channels_.clear();
}

void ipc_link::leave(std::uint32_t id, process* channel) {
    channels_.erase(id);
    own_channels_.erase(channel);
}

} // namespace torvad
