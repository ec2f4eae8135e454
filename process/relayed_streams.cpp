// The pipes of a channel's standard streams, one read of output as a packet,
// and the stdin the child is owed.
#include "process/relayed_streams.hpp"

#include "process/ipc_link.hpp"

namespace torvad {

platform::os_error relayed_streams::make(platform::owned_handle (&theirs)[3], int& taken_names) {
    platform::stream* ours[3] = {&stdin_, &stdout_, &stderr_};
    for (int stream = 0; stream < 3; ++stream)
        if (platform::os_error error =
                platform::make_relay_pipe(stream, *ours[stream], theirs[stream], taken_names))
            return error;
    return {};
}

void relayed_streams::close() {
    for (auto* pipe : {&stdin_, &stdout_, &stderr_}) {
        boost::system::error_code ignored;
        pipe->close(ignored);
    }
}

boost::system::error_code relayed_streams::forward(int stream, requester_link* requester,
                                                   std::uint32_t channel) {
    const char* data = nullptr;
    std::size_t bytes = 0;
    boost::system::error_code error =
        platform::take_output(output(stream), buffer(stream), data, bytes);
    if (error && error != boost::asio::error::would_block) {
        boost::system::error_code ignored;
        output(stream).close(ignored);
    } else if (!error && requester) {
        requester->send(channel, static_cast<std::uint32_t>(stream), 0, data,
                        static_cast<std::uint32_t>(bytes));
    }
    return error;
}

void relayed_streams::drop_input(requester_link* requester) {
    close_requested_ = false;
    stdin_queue_.clear();
    count_backlog(requester);
    // A requester held back by this backlog may read again.
    if (requester)
        requester->resume_reads();
}

void relayed_streams::count_backlog(requester_link* requester) {
    bool backlogged = stdin_queue_.size() >= stdin_high_mark;
    if (backlogged == stdin_counted_)
        return;
    stdin_counted_ = backlogged;
    if (requester)
        requester->count_backlogged_channel(backlogged);
}

void relayed_streams::close_input() {
    boost::system::error_code ignored;
    stdin_.close(ignored);
}

} // namespace torvad
