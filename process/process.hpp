// One supervised child: a top-level program, or a channel that another child
// asked for.
//
// Who keeps a process alive:
// - The daemon's set of children owns it, from create() to daemon::remove().
// - Every pending operation of its own (the exit wait, the reads of its ipc
//   pipe and relayed output, the writes) holds shared_from_this(). finish()
//   closes all of them, so once it has run nothing keeps the object but
//   completions already on their way, which carry no output: finish runs
//   only once the output pipes are drained, and sends a channel's closing
//   packet in that same turn.
// Parent and channel know each other by weak_ptr alone. The daemon must
// outlive every process.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "ipc/execute.hpp"
#include "ipc/framer.hpp"
#include "platform/platform.hpp"
#include "process/byte_queue.hpp"

namespace torvad {

class daemon;
class process;

// The place of a process on its parent's ipc pipe; empty for a top-level program.
struct channel_ref {
    std::weak_ptr<process> parent;
    std::uint32_t channel = 0;
};

// The code a reaped child's end counts as: its exit status, 128 + the signal
// of a death by signal (0 when we forced it), and 0 when it can't be read.
std::uint32_t exit_code_of(const platform::exit_status& exit, bool forced);

class process : public std::enable_shared_from_this<process> {
  public:
    // What to run and how: a top-level program's options, or a channel's
    // request; ref is the channel's place on its requester's pipe.
    static std::shared_ptr<process> create(daemon* owner, execute_request what,
                                           channel_ref ref = {});
    ~process();
    process(const process&) = delete;
    process& operator=(const process&) = delete;

    // Launches the child; false when it could not be (the object has then
    // left the daemon's set). (process/launch.cpp)
    bool start();
    // Serves a pipe another program made instead of launching. (process/ipc_pipe.cpp)
    void attach(std::int32_t attach_pid, std::int64_t handle_value);
    // Asks a persistent child to stop with sigterm, ends any other by force.
    void terminate();
    void close_pipes();
    // "'name' (pid N)", for a log line.
    std::string description() const;

    daemon* const owner;
    const std::vector<std::string> command;
    const std::string user;
    const std::string working_directory;
    const std::weak_ptr<process> parent;
    const std::uint32_t channel;
    const bool persistent;

  private:
    process(daemon* owner, execute_request what, channel_ref ref);

    // launch (process/launch.cpp)
    bool fail_launch(std::uint32_t status, const platform::os_error& error);
    bool prepare_stdio(platform::launch_request& request, platform::owned_handle (&theirs)[3]);
    void watch_child(platform::launch_result& launched);
    void wait_for_exit();

    // end (process/end.cpp)
    void on_exit(const boost::system::error_code& error);
    void finish_after_output();
    void finish(std::uint32_t status, std::uint32_t end_packet);
    // Sends the parent end_packet with status and frees the channel id, once.
    void report_end();
    void restart();

    // relayed standard streams (process/streams.cpp)
    platform::stream& output_pipe(int stream);
    platform::output_buffer& output_buffer_of(int stream);
    void wait_output(int stream);
    void on_output(int stream, const boost::system::error_code& error);
    boost::system::error_code forward_output(int stream, process* requester);
    void relay_output(int stream);
    bool drain_output();
    void resume_output();
    void write_stdin(const char* data, std::uint32_t size, bool close);
    void pump_stdin();
    bool stdin_backlogged() const;

    // the ipc pipe (process/ipc_pipe.cpp)
    platform::os_error create_ipc_pipe(platform::owned_handle& theirs);
    void read_ipc();
    void on_ipc_read(const boost::system::error_code& error, std::size_t bytes);
    void on_packet(const packet_header& header, const char* payload);
    void route_stdin(const packet_header& header, const char* payload);
    void send_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                     const void* data, std::uint32_t size);
    void pump_ipc();
    void on_ipc_written(std::size_t bytes);
    bool ipc_backlogged() const;
    void wait_for_room(const std::shared_ptr<process>& writer);
    void resume_ipc_read();
    void send_version();
    void trace_packet(const packet_header& header, const char* payload, bool sent);

    // execute requests (process/execute.cpp)
    void handle_execute(const packet_header& header, const char* payload);
    void send_and_forget(std::uint32_t channel, std::uint32_t type, std::uint32_t flags);

    std::int32_t stdio_mode;
    std::string name;
    std::uint32_t pid = 0;
    std::uint32_t end_packet;
    std::uint32_t status = 0;
    bool forced = false; // terminate ended the child by force: its end counts as 0
    bool end_reported = false;
    // The child has ended and a read was on its way: its status waits here
    // until that read has landed and the pipes are drained behind it.
    bool ending = false;
    std::uint32_t ended_status = 0;
    platform::exit_watch exit_watch;

    platform::stream stdin_pipe, stdout_pipe, stderr_pipe; // our ends of the relayed streams
    platform::output_buffer output_buffers[2];             // stdout's, stderr's
    byte_queue stdin_queue;
    bool stdin_writing = false;
    bool stdin_close_requested = false;
    bool output_paused[3] = {false, false, false}; // by stream number, 1 and 2

    platform::stream ipc_pipe;
    std::unique_ptr<framer> ipc_in; // made with the pipe: channels have none
    byte_queue ipc_queue;
    bool ipc_writing = false;
    bool ipc_read_paused = false; // a channel's stdin backlog holds the reads back
    std::map<std::uint32_t, std::weak_ptr<process>> channels;
    std::vector<std::weak_ptr<process>> waiting_for_room; // channels paused on our queue
};

} // namespace torvad
