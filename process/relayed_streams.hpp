// The relayed standard streams of a channel: our ends of its three pipes, its
// output relayed to the requester as packets and its stdin queued for the
// child, each held back when the other side doesn't keep up. A part of its
// process: its reads and writes hold the process alive, and a read that
// lands is reported to the process's life, which says whether to relay it.
#pragma once

#include <cstdint>
#include <memory>

#include "platform/platform.hpp"
#include "process/byte_queue.hpp"
#include "process/flow.hpp"

namespace torvad {

class process;
class requester_link;

class relayed_streams {
  public:
    explicit relayed_streams(boost::asio::io_context& loop)
        : stdin_(loop), stdout_(loop), stderr_(loop) {}

    // Makes the three pipes; theirs are the child's ends, in stream order,
    // and taken_names grows by the names another program had taken first.
    platform::os_error make(platform::owned_handle (&theirs)[3], int& taken_names);
    void close();

    // --- output: streams 1 and 2, to the requester of self ---
    // Waits until stream has something, then reports it to self's life.
    void await(int stream, std::shared_ptr<process> self);
    // Reads what is ready, a few reads per wake so that one busy channel
    // doesn't starve the others, and waits again; or pauses while the
    // requester's queue is full, until it has room and resume comes.
    void relay(int stream, const std::shared_ptr<process>& self);
    void resume(const std::shared_ptr<process>& self);
    // The child has ended: takes all its pipes hold. False while a read is
    // still on its way: it is ended early, and its landing asks again.
    bool drain(const process& self);

    // --- input: stream 0, from the requester of self ---
    // Queues bytes for the child and writes them; a requested close follows
    // the last byte. Input behind a close, or for a child that closed its
    // end, has nowhere to go.
    void write_input(const char* data, std::uint32_t size, bool close,
                     const std::shared_ptr<process>& self);
    // What the child was owed is dropped with the child; the requester's
    // count and reads go on without it.
    void drop_input(requester_link* requester);

  private:
    platform::stream& output(int stream) { return stream == 1 ? stdout_ : stderr_; }
    platform::output_buffer& buffer(int stream) { return buffers_[stream - 1]; }
    // One read of stream, as one packet on channel (dropped without a
    // requester); a stream that ends or fails is closed, would_block leaves
    // it open.
    boost::system::error_code forward(int stream, requester_link* requester, std::uint32_t channel);
    void pump_input(std::shared_ptr<process> self);
    // The requester counts its channels over the mark as their queues cross
    // it, so that whether it may read costs the same however many it has.
    void count_backlog(requester_link* requester);
    void close_input();

    platform::stream stdin_, stdout_, stderr_;
    platform::output_buffer buffers_[2]; // stdout's, stderr's
    byte_queue stdin_queue_;
    bool writing_ = false;
    bool close_requested_ = false;
    bool stdin_counted_ = false;             // in the requester's count of backlogged channels
    bool paused_[3] = {false, false, false}; // by stream number, 1 and 2
};

} // namespace torvad
