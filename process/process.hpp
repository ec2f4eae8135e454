// One supervised child: a top-level program, or a channel that another child
// asked for. It is made of three parts that each hold their own state (the
// launched program, its relayed streams, its ipc link); the process routes
// between them, and between itself and its requester and channels.
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
    // Serves a pipe another program made instead of launching. (process/ipc_pipe.cpp)
    void attach(std::int32_t attach_pid, std::int64_t handle_value);
    // Asks a persistent child to stop with sigterm (continuing it if the
    // terminal had stopped it), ends any other by force.
    void terminate();
    void close_pipes();
    // close_pipes on every channel of this process, a restarted one included.
    void close_channel_pipes();
    // Closes every handle it holds, for the owner's shutdown: its pending
    // operations then end without a word.
    void close_all();
    // "'name' (pid N)", for a log line; the terminal's stop is named too.
    std::string description() const;
    const std::string& name() const { return name_; }
    // The request a successor is made from, and its place.
    execute_request request() const {
        return {command, user, working_directory, persistent, stdio_mode_};
    }
    channel_ref place() const { return {parent, channel}; }

    process_owner& owner;
    const std::vector<std::string> command;
    const std::string user;
    const std::string working_directory;
    const std::weak_ptr<process> parent;
    const std::uint32_t channel;
    const bool persistent;

  private:
    process(process_owner& owner, execute_request what, channel_ref ref);

    // launch (process/launch.cpp)
    bool fail_launch(std::uint32_t status, const platform::os_error& error);
    bool prepare_stdio(platform::launch_request& request, platform::owned_handle (&theirs)[3]);
    bool watch_child(platform::launch_result& launched);
    void wait_for_exit();

    // end (process/end.cpp)
    void on_exit(const boost::system::error_code& error);
    void finish_after_output();
    void finish(std::uint32_t status, std::uint32_t end_packet);
    // Sends the parent end_packet with status and frees the channel id, once.
    void report_end();
    void leave_parent();

    // relayed standard streams (process/streams.cpp)
    void wait_output(int stream);
    void on_output(int stream, const boost::system::error_code& error);
    boost::system::error_code forward_output(int stream, process* requester);
    void relay_output(int stream);
    bool drain_output();
    void resume_output();
    void write_stdin(const char* data, std::uint32_t size, bool close);
    void pump_stdin();
    void count_stdin_backlog();

    // the ipc pipe (process/ipc_pipe.cpp)
    void read_ipc();
    void on_ipc_read(const boost::system::error_code& error, std::size_t bytes);
    void on_packet(const packet_header& header, const char* payload);
    void route_stdin(const packet_header& header, const char* payload);
    void send_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                     const void* data, std::uint32_t size);
    void pump_ipc();
    void resume_ipc_read();
    void send_version();
    void trace_packet(const packet_header& header, const char* payload, bool sent);

    // execute requests (process/execute.cpp)
    void handle_execute(const packet_header& header, const char* payload);
    void send_and_forget(std::uint32_t channel, std::uint32_t type, std::uint32_t flags);

    std::int32_t stdio_mode_;
    std::string name_;
    std::uint32_t end_packet_;
    std::uint32_t status_ = 0;
    bool end_reported_ = false;
    bool stdin_counted_ = false;       // in the requester's count of backlogged channels
    bool stopped_by_terminal_ = false; // found stopped at the last terminate
    bool shut_ = false;                // closed by the owner's shutdown: handlers do nothing more
    launched_child child_;
    relayed_streams streams_;
    ipc_link link_;
};

} // namespace torvad
