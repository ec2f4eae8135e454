// Making and closing the relayed pipes, and queueing a channel's stdin.
#include "process/relayed_streams.hpp"

namespace torvad {

platform::os_error relayed_streams::make(platform::owned_handle (&theirs)[3]) {
    platform::stream* ours[3] = {&stdin_, &stdout_, &stderr_};
    for (int stream = 0; stream < 3; ++stream)
        if (platform::os_error error =
                platform::make_relay_pipe(stream, *ours[stream], theirs[stream]))
            return error;
    return {};
}

void relayed_streams::close() {
    for (auto* pipe : {&stdin_, &stdout_, &stderr_}) {
        boost::system::error_code ignored;
        pipe->close(ignored);
    }
}

bool relayed_streams::queue_input(const char* data, std::uint32_t size, bool close) {
    stdin_queue_.push(data, size);
    close_requested_ = close_requested_ || close;
    return !writing_;
}

} // namespace torvad
