// The relayed standard streams of a channel: our ends of its three pipes, the
// stdin waiting for the child, and which output stream is held back because
// the requester's queue is full. A part of its process, which keeps it alive
// for its reads and writes; the flow between processes is the process's.
#pragma once

#include <cstdint>

#include "platform/platform.hpp"
#include "process/byte_queue.hpp"
#include "process/flow.hpp"

namespace torvad {

class relayed_streams {
  public:
    explicit relayed_streams(boost::asio::io_context& loop)
        : stdin_(loop), stdout_(loop), stderr_(loop) {}

    // Makes the three pipes; theirs are the child's ends, in stream order.
    platform::os_error make(platform::owned_handle (&theirs)[3]);
    void close();

    // --- output: streams 1 and 2 ---
    platform::stream& output(int stream) { return stream == 1 ? stdout_ : stderr_; }
    platform::output_buffer& buffer(int stream) { return buffers_[stream - 1]; }
    // One read of stream, handed to send; a stream that ends or fails is
    // closed, would_block leaves it open.
    template <class Send> boost::system::error_code forward(int stream, Send&& send) {
        const char* data = nullptr;
        std::size_t bytes = 0;
        boost::system::error_code error =
            platform::take_output(output(stream), buffer(stream), data, bytes);
        if (error && error != boost::asio::error::would_block) {
            boost::system::error_code ignored;
            output(stream).close(ignored);
        } else if (!error) {
            send(data, bytes);
        }
        return error;
    }
    bool paused(int stream) const { return paused_[stream]; }
    bool any_paused() const { return paused_[1] || paused_[2]; }
    void set_paused(int stream, bool paused) { paused_[stream] = paused; }

    // --- input: stream 0 ---
    bool input_open() const { return stdin_.is_open(); }
    // Queues bytes for the child; true when no write is on its way to take them.
    bool queue_input(const char* data, std::uint32_t size, bool close);
    std::size_t queued_input() const { return stdin_queue_.size(); }
    bool input_backlogged() const { return stdin_queue_.size() >= stdin_high_mark; }
    // Writes the front of the queue and calls written() once it went out
    // (written holds the process alive); a requested close follows the last
    // byte. A write cut short by close() calls nothing.
    template <class Written> void pump_input(Written&& written) {
        writing_ = false;
        if (!stdin_.is_open())
            return;
        if (stdin_queue_.empty()) {
            if (close_requested_)
                close_input();
            return;
        }
        writing_ = true;
        stdin_.async_write_some(stdin_queue_.front(),
                                [this, written = std::forward<Written>(written)](
                                    const boost::system::error_code& error, std::size_t n) {
                                    if (error == boost::asio::error::operation_aborted)
                                        return;
                                    // Any other failure is the child's end gone: nothing more goes
                                    // in.
                                    if (error) {
                                        close_input();
                                        stdin_queue_.clear();
                                    }
                                    stdin_queue_.consume(n);
                                    written();
                                });
    }
    // What the child was owed is dropped with the child.
    void clear_input() {
        close_requested_ = false;
        stdin_queue_.clear();
    }

  private:
    void close_input() {
        boost::system::error_code ignored;
        stdin_.close(ignored);
    }

    platform::stream stdin_, stdout_, stderr_;
    platform::output_buffer buffers_[2]; // stdout's, stderr's
    byte_queue stdin_queue_;
    bool writing_ = false;
    bool close_requested_ = false;
    bool paused_[3] = {false, false, false}; // by stream number, 1 and 2
};

} // namespace torvad
