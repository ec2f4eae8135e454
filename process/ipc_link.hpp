// The ipc pipe of a persistent child: the pipe, the framer of what comes in,
// the queue of what goes out, and the channels it carries. A part of its
// process, which keeps it alive for its reads and writes and routes what the
// packets ask for.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <unordered_set>
#include <vector>

#include "ipc/framer.hpp"
#include "platform/platform.hpp"
#include "process/byte_queue.hpp"
#include "process/flow.hpp"

namespace torvad {

class process;

class ipc_link {
  public:
    explicit ipc_link(boost::asio::io_context& loop) : pipe_(loop) {}

    // A new pipe, theirs for the child; or one another program made.
    platform::os_error make(platform::owned_handle& theirs, platform::pipe_step& failed);
    platform::os_error attach(std::int64_t handle_value);
    bool open() const { return pipe_.is_open(); }
    // Ends the pending read and write before the queue goes; channels are forgotten.
    void close();

    // --- in: a read at a time into the framer ---
    template <class Read> void read(Read&& handler) {
        pipe_.async_read_some(boost::asio::buffer(in_->free_space(), in_->free_size()),
                              std::forward<Read>(handler));
    }
    template <class OnPacket, class OnBadLength>
    void take(std::size_t bytes, OnPacket&& on_packet, OnBadLength&& on_bad_length) {
        in_->add(bytes, std::forward<OnPacket>(on_packet),
                 std::forward<OnBadLength>(on_bad_length));
    }
    // A channel that doesn't read its stdin holds back the pipe that feeds it:
    // reads pause after each one and go on only while no channel is over its mark.
    void pause_reads() { read_paused_ = true; }
    bool resume_reads();
    void count_backlogged_channel(bool backlogged) { backlogged_channels_ += backlogged ? 1 : -1; }

    // --- out: one gathered write at a time ---
    // Queues one packet; true when no write is on its way to take it.
    bool queue_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                      const void* data, std::uint32_t size);
    // Writes the front of the queue; written() follows a write that went out
    // (it holds the process alive). A failed or cut write calls nothing.
    template <class Written> void pump(Written&& written) {
        writing_ = false;
        if (out_.empty() || !pipe_.is_open())
            return;
        writing_ = true;
        pipe_.async_write_some(out_.front(),
                               [this, written = std::forward<Written>(written)](
                                   const boost::system::error_code& error, std::size_t bytes) {
                                   if (error)
                                       return;
                                   out_.consume(bytes);
                                   written();
                               });
    }
    bool backlogged() const { return out_.size() >= ipc_high_mark; }
    // Channels whose output waits for room in the queue; once below the low
    // mark they are handed back to be resumed.
    void wait_for_room(std::weak_ptr<process> writer) { waiting_.push_back(std::move(writer)); }
    std::vector<std::weak_ptr<process>> take_roomed_writers();

    // --- channels: by id while open, and every one not yet ended ---
    std::map<std::uint32_t, std::weak_ptr<process>> channels;
    // Every process made as a channel of this one that has not reported its
    // end: a restarted channel has left `channels` at its predecessor's end,
    // but is still ours. Each enters in its constructor and leaves in its
    // report of its end, at the latest in its destructor, so a plain pointer
    // here is always to a living object.
    std::unordered_set<process*> own_channels;

  private:
    platform::stream pipe_;
    std::unique_ptr<framer> in_; // made with the pipe: channels have none
    byte_queue out_;
    bool writing_ = false;
    bool read_paused_ = false;
    std::size_t backlogged_channels_ = 0; // channels whose stdin is over its mark
    std::vector<std::weak_ptr<process>> waiting_;
};

} // namespace torvad
