// One supervised child: a top-level program, or a channel that another child
// asked for. Owned by daemon::children from create() to daemon::remove(), and
// kept alive beyond that only by its pending reads. Parent and channel know
// each other by weak_ptr alone; the daemon must outlive every process.
#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <boost/asio/posix/stream_descriptor.hpp>
#include <boost/process/async_pipe.hpp>

#include "platform/platform.hpp"

namespace torvad {

class daemon;
class process;

// The place of a process on its parent's ipc pipe; empty for a top-level program.
struct channel_ref {
    std::weak_ptr<process> parent;
    std::uint32_t channel = 0;
};

enum stdio_mode_t : std::int32_t { stdio_inherit = 0, stdio_pipes = 1, stdio_none = 2 };

class process : public std::enable_shared_from_this<process> {
  public:
    static std::shared_ptr<process> create(daemon* owner, std::vector<std::string> command,
                                           std::string user, std::string working_directory,
                                           channel_ref ref, bool persistent,
                                           std::int32_t stdio_mode);
    virtual ~process();
    process(const process&) = delete;
    process& operator=(const process&) = delete;

    virtual std::shared_ptr<process> spawn(daemon* owner, std::vector<std::string> command,
                                           std::string user, std::string working_directory,
                                           channel_ref ref, bool persistent,
                                           std::int32_t stdio_mode);
    virtual bool start();
    virtual void write_stdin(const char* data, std::uint32_t size);
    virtual void send_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                             const void* data, std::uint32_t size);
    virtual void read_output(std::int32_t stream);
    virtual void read_ipc();

    // end of a child (process/end.cpp)
    void finish(std::uint32_t status, std::uint32_t end_packet);
    void on_exit(const boost::system::error_code& error);
    void terminate();
    void close_pipes();

    // the standard streams (process/streams.cpp)
    void on_output(const boost::system::error_code& error, std::size_t bytes, std::int32_t stream);
    void pump_stdin();
    void pump_ipc();

    // the ipc pipe (ipc/transport.cpp)
    int create_ipc_pipe(int& error);
    void on_ipc_read(const boost::system::error_code& error, std::size_t bytes);
    // Frames the bytes just added behind ipc_fill and acts on every whole packet.
    void frame_ipc(std::uint32_t bytes);
    void attach(std::int32_t attach_pid, int fd);
    // execute requests (ipc/execute.cpp)
    void handle_execute(const char* packet);
    void send_and_forget(std::uint32_t channel, std::uint32_t type, std::uint32_t flags);
    void send_version();
    void trace_packet(const char* packet, bool sent);

    daemon* const owner;
    const std::vector<std::string> command;
    const std::string user;
    const std::string working_directory;
    const std::weak_ptr<process> parent;
    const std::uint32_t channel;
    const bool persistent;
    std::int32_t stdio_mode;
    boost::asio::posix::stream_descriptor process_handle; // the child's pidfd
    std::string name;
    std::uint32_t pid = 0;
    std::uint32_t end_packet;
    std::uint32_t status = 0;
    std::unique_ptr<boost::process::async_pipe> stdin_pipe;
    std::unique_ptr<boost::process::async_pipe> stdout_pipe;
    std::unique_ptr<boost::process::async_pipe> stderr_pipe;
    boost::asio::posix::stream_descriptor ipc_pipe;
    bool stdin_close_requested = false;
    std::map<std::uint32_t, std::weak_ptr<process>> channels;
    std::deque<std::vector<char>> stdin_queue;
    std::deque<std::vector<char>> ipc_queue;
    char stdout_buffer[4096];
    char stderr_buffer[4096];
    char ipc_buffer[65536];
    std::uint32_t ipc_fill = 0;
    // Set when terminate ended the child by force: such an end counts as 0.
    bool forced = false;
    // Relayed output streams still being read; an exit waits for them to end.
    int open_streams = 0;
    bool exit_pending = false;
    std::uint32_t pending_status = 0;

  private:
    process(daemon* owner, std::vector<std::string> command, std::string user,
            std::string working_directory, channel_ref ref, bool persistent,
            std::int32_t stdio_mode);

    // launch steps (process/launch.cpp)
    bool fail_launch(std::uint32_t status);
    bool prepare_stdio(platform::launch_request& request);
    void watch_child(int pidfd, int child_pid);
    void watch_exit();
    void route_stdin(const char* packet);
};

} // namespace torvad
