// The ipc pipe of a persistent child: the pipe, the framer of what comes in,
// the queue of what goes out, and the channels it carries, to which it routes
// what the packets ask for. A part of its process: its reads and writes hold
// the process alive, and a peer closing an attached pipe is reported to the
// process's life.
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

// What a channel needs of its requester's link: its packets go out there, its
// output waits there for room in the queue, and its stdin backlog holds back
// the link's reads. A channel is one of the link's from its construction to
// its leave.
class requester_link {
  public:
    // Queues one packet (traced under -v) and writes it; a closed pipe takes nothing.
    virtual void send(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                      const void* data, std::uint32_t size) = 0;
    // The queue is over its mark: a channel's output waits for room.
    virtual bool backlogged() const = 0;
    // writer's output is resumed once the queue is below its low mark.
    virtual void wait_for_room(std::weak_ptr<process> writer) = 0;
    // A channel's stdin queue went over its mark (true) or back under it.
    virtual void count_backlogged_channel(bool backlogged) = 0;
    // A channel's stdin has room again: reads go on unless another holds them.
    virtual void resume_reads() = 0;
    virtual void join(process* channel) = 0;
    // The channel's end: its id is free, and it is no longer ours.
    virtual void leave(std::uint32_t id, process* channel) = 0;

  protected:
    ~requester_link() = default;
};

class ipc_link final : public requester_link {
  public:
    ipc_link(process& self, boost::asio::io_context& loop) : self_(self), pipe_(loop) {}

    // A new pipe, theirs for the child (taken_names grows by the names another
    // program had taken first); or one another program made.
    platform::os_error make(platform::owned_handle& theirs, platform::pipe_step& failed,
                            int& taken_names);
    platform::os_error attach(std::int64_t handle_value);
    bool open() const { return pipe_.is_open(); }
    // Reads the pipe from now on, and sends the version packet.
    void start();
    // Ends the pending read and write before the queue goes; channels are forgotten.
    void close();
    // Closes the relayed pipes of every channel not yet ended, a restarted one
    // included: their output has nowhere to go.
    void close_channel_pipes();

    void send(std::uint32_t channel, std::uint32_t type, std::uint32_t flags, const void* data,
              std::uint32_t size) override;
    bool backlogged() const override { return out_.size() >= ipc_high_mark; }
    void wait_for_room(std::weak_ptr<process> writer) override {
        waiting_.push_back(std::move(writer));
    }
    void count_backlogged_channel(bool backlogged) override {
        backlogged_channels_ += backlogged ? 1 : -1;
    }
    void resume_reads() override;
    void join(process* channel) override { own_channels_.insert(channel); }
    void leave(std::uint32_t id, process* channel) override;

  private:
    // in: a read at a time into the framer (process/ipc_pipe.cpp)
    void read();
    void on_read(const boost::system::error_code& error, std::size_t bytes);
    void on_packet(const packet_header& header, const char* payload);
    void route_stdin(const packet_header& header, const char* payload);
    // execute requests (process/execute.cpp)
    void execute(const packet_header& header, const char* payload);
    void send_and_forget(std::uint32_t channel, std::uint32_t type, std::uint32_t flags);
    // out: one gathered write at a time; room wakes the writers that wait
    void pump();
    void trace(const packet_header& header, const char* payload, bool sent);

    process& self_;
    platform::stream pipe_;
    std::unique_ptr<framer> in_; // made with the pipe: channels have none
    byte_queue out_;
    bool writing_ = false;
    bool read_paused_ = false;
    bool attached_ = false;               // made by another program: its close ends us
    std::size_t backlogged_channels_ = 0; // channels whose stdin is over its mark
    std::vector<std::weak_ptr<process>> waiting_;
    // Channels by id while open; and every process made as a channel of ours
    // that has not reported its end: a restarted channel has left channels_
    // at its predecessor's end, but is still ours. Each joins in its
    // constructor and leaves in its report of its end, at the latest in its
    // destructor, so a plain pointer here is always to a living object.
    std::map<std::uint32_t, std::weak_ptr<process>> channels_;
    std::unordered_set<process*> own_channels_;
};

} // namespace torvad
