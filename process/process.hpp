// One supervised child: a top-level program, or a channel that another child
// asked for. It is made of three parts that each hold their own state (the
// launched program, its relayed streams, its ipc link), which act on their own
// and report the events of its life to it; its life (process/life.hpp) says
// what each event does.
//
// Who keeps a process alive:
// - Its owner's set, from create() to owner.remove().
// - Every pending operation of its own (the exit wait, the reads of its ipc
//   pipe and relayed output, the writes) holds shared_from_this(). finish()
//   closes all of them, so once it has run nothing keeps the object but
//   completions already on their way, which carry no output: finish runs
//   only once the output pipes are drained, and sends a channel's closing
//   packet in that same turn.
// Parent and channel know each other by weak_ptr alone. The owner must
// outlive every process.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "ipc/execute.hpp"
#include "process/ipc_link.hpp"
#include "process/launched_child.hpp"
#include "process/life.hpp"
#include "process/owner.hpp"
#include "process/relayed_streams.hpp"

namespace torvad {

// The place of a process on its parent's ipc pipe; empty for a top-level program.
struct channel_ref {
    std::weak_ptr<process> parent;
    std::uint32_t channel = 0;
};

class process : public std::enable_shared_from_this<process> {
  public:
    // What to run and how: a top-level program's options, or a channel's
    // request; ref is the channel's place on its requester's pipe.
    static std::shared_ptr<process> create(process_owner& owner, execute_request what,
                                           channel_ref ref = {});
    ~process();
    process(const process&) = delete;
    process& operator=(const process&) = delete;

    // Launches the child; false when it could not be, or was ended at once
    // (the object has then left its owner's set). (process/launch.cpp)
    bool start();
    // Serves a pipe another program made instead of launching. (process/launch.cpp)
    void attach(std::int32_t attach_pid, std::int64_t handle_value);
    // Asks a persistent child to stop with sigterm (continuing it if the
    // terminal had stopped it), ends any other by force.
    void terminate() { on(life_event::stop); }
    // Closes every handle it holds, for the owner's shutdown: its pending
    // operations then end without a word.
    void close_all() { on(life_event::shut_down); }
    // "'name' (pid N)", for a log line; the terminal's stop is named too.
    std::string description() const;
    // Takes an event of its life through the table (process/life.hpp) and
    // does what it calls for. The parts report theirs here.
    void on(life_event event, std::uint32_t value = 0);
    // What its channels and its requester use of it: the link its channels
    // send on and wait at; and its streams, which its requester's link
    // routes stdin to, wakes when there is room, and closes at its end.
    requester_link& link() { return link_; }
    relayed_streams& streams() { return streams_; }

    process_owner& owner;
    // The request, as a successor is made from it; and its place.
    const execute_request what;
    const channel_ref place;
    const std::string name; // the program's file name, for log lines and the trace

  private:
    process(process_owner& owner, execute_request what, channel_ref ref);
    // The child runs: its exit, output and ipc pipe are waited for.
    void watch();
    // Tells the owner (a closed end) and the requester, closes everything and
    // leaves the owner's set. (process/end.cpp)
    void finish(std::uint32_t status, std::uint32_t end_packet);
    void stop_child();

    child_life life_;
    launched_child child_;
    relayed_streams streams_;
    ipc_link link_;
};

} // namespace torvad
