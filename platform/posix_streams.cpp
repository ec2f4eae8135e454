// Pipes on Linux: the ipc pipe is a socket pair, the relayed streams are
// pipes, and relayed output is taken once the reactor reports it readable.
#include "platform/platform.hpp"

#include <cerrno>
#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <boost/asio/buffer.hpp>

namespace torvad::platform {

namespace {

// Only one handler runs at a time and a read is copied into a packet at
// once, so every channel reads into this one buffer: an idle channel holds
// none of its own.
constexpr std::size_t output_read_size = 4096;
char shared_output[output_read_size];

// Takes the descriptor into ours, non-blocking; on failure it stays in handle.
os_error bind(stream& ours, owned_handle& handle) {
    if (os_error error = adopt_handle(ours, handle))
        return error;
    boost::system::error_code failure;
    ours.non_blocking(true, failure);
    return failure ? os_error{failure.value(), "fcntl"} : os_error{};
}

} // namespace

// Both ends come from one call, so only their making can fail.
os_error make_ipc_pipe(stream& ours, owned_handle& theirs, pipe_step& failed, int&) {
    failed = pipe_step::create;
    int ends[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) == -1)
        return {errno, "socketpair"};
    owned_handle our_end(ends[0]);
    theirs.reset(ends[1]);
    if (os_error error = bind(ours, our_end)) {
        theirs.reset();
        return error;
    }
    failed = pipe_step::none;
    return {};
}

os_error make_relay_pipe(int stream_number, stream& ours, owned_handle& theirs, int&) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) == -1)
        return {errno, "pipe2"};
    // The child reads its stdin and writes its stdout and stderr.
    bool child_reads = stream_number == 0;
    owned_handle our_end(child_reads ? ends[1] : ends[0]);
    theirs.reset(child_reads ? ends[0] : ends[1]);
    if (os_error error = bind(ours, our_end)) {
        theirs.reset();
        return error;
    }
    return {};
}

os_error attach_pipe(stream& ours, std::int64_t value) {
    // A value that is no descriptor number is asked as -1, which none is.
    int fd = value < 0 || value != static_cast<int>(value) ? -1 : static_cast<int>(value);
    if (fcntl(fd, F_GETFD) == -1)
        return {errno, "fcntl"};
    owned_handle given(fd);
    os_error error = bind(ours, given);
    // A descriptor that was given to us stays open, whatever we could do with it.
    given.release();
    return error;
}

boost::system::error_code take_output(stream& pipe, output_buffer&, const char*& data,
                                      std::size_t& size) {
    boost::system::error_code error;
    size = pipe.read_some(boost::asio::buffer(shared_output), error);
    data = shared_output;
    return error;
}

// Readiness moves no bytes: nothing is ever on its way.
bool end_output(stream&, output_buffer&) {
    return true;
}

} // namespace torvad::platform
