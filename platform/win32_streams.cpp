// Pipes on Windows: named pipes whose end of ours is overlapped and bound to
// the loop's completion port; relayed output is read straight into the
// stream's own buffer.
#include <windows.h>

#include <algorithm>

#include <boost/asio/buffer.hpp>
#include <boost/asio/error.hpp>

#include "platform/platform.hpp"

namespace torvad::platform {

namespace {

// The number in the name of each ipc pipe; the relayed streams count apart.
std::uint64_t ipc_pipe_counter = 0;
std::uint64_t relay_pipe_counter = 0;

std::string pipe_name(const char* kind, std::uint64_t number) {
    return std::string("\\\\.\\pipe\\torvad_") + kind + std::to_string(GetCurrentProcessId()) +
           "_" + std::to_string(number);
}

os_error last_error(const char* call) {
    return {static_cast<int>(GetLastError()), call};
}

// Binds handle to ours; on failure it stays in handle.
os_error bind(stream& ours, owned_handle& handle) {
    return adopt_handle(ours, handle);
}

} // namespace

os_error make_ipc_pipe(stream& ours, owned_handle& theirs) {
    std::string name = pipe_name("", ipc_pipe_counter++);
    HANDLE made = CreateNamedPipeA(name.c_str(), PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                                   PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, 1, 8192,
                                   8192, 0, nullptr);
    if (made == INVALID_HANDLE_VALUE)
        return last_error("CreateNamedPipeA");
    owned_handle server(made);
    if (os_error error = bind(ours, server))
        return error;
    // Opening the other end connects the pipe; the child inherits this handle.
    SECURITY_ATTRIBUTES inheritable{sizeof inheritable, nullptr, TRUE};
    HANDLE client = CreateFileA(name.c_str(), GENERIC_READ | GENERIC_WRITE, 0, &inheritable,
                                OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr);
    if (client == INVALID_HANDLE_VALUE)
        return last_error("CreateFileA");
    theirs.reset(client);
    return {};
}

// Our end overlapped for the loop; the child's end plain, as a program's
// standard handles are, and made inheritable only at its launch.
os_error make_relay_pipe(int stream_number, stream& ours, owned_handle& theirs) {
    bool child_reads = stream_number == 0;
    std::string name = pipe_name("stdio_", relay_pipe_counter++);
    DWORD direction = child_reads ? PIPE_ACCESS_OUTBOUND : PIPE_ACCESS_INBOUND;
    HANDLE made = CreateNamedPipeA(name.c_str(), direction | FILE_FLAG_OVERLAPPED,
                                   PIPE_TYPE_BYTE | PIPE_READMODE_BYTE | PIPE_WAIT, 1, 65536, 65536,
                                   0, nullptr);
    if (made == INVALID_HANDLE_VALUE)
        return last_error("CreateNamedPipeA");
    owned_handle server(made);
    if (os_error error = bind(ours, server))
        return error;
    HANDLE client = CreateFileA(name.c_str(), child_reads ? GENERIC_READ : GENERIC_WRITE, 0,
                                nullptr, OPEN_EXISTING, 0, nullptr);
    if (client == INVALID_HANDLE_VALUE) {
        os_error error = last_error("CreateFileA");
        boost::system::error_code ignored;
        ours.close(ignored);
        return error;
    }
    theirs.reset(client);
    return {};
}

os_error attach_pipe(stream& ours, std::int64_t value) {
    // -1 would name this process itself, and 0 no handle at all.
    if (value <= 0)
        return {ERROR_INVALID_HANDLE, "attach"};
    owned_handle given(reinterpret_cast<HANDLE>(static_cast<std::intptr_t>(value)));
    os_error error = bind(ours, given);
    // A handle that was given to us stays open, whatever we could do with it.
    given.release();
    return error;
}

boost::system::error_code take_output(stream& pipe, output_buffer& buffer, const char*& data,
                                      std::size_t& size) {
    data = buffer.bytes;
    size = 0;
    if (buffer.reading)
        return boost::asio::error::would_block;
    if (buffer.held > 0) {
        std::swap(size, buffer.held);
        return {};
    }
    // Only what the pipe holds now is read, so the read can't wait.
    DWORD available = 0;
    if (!PeekNamedPipe(pipe.native_handle(), nullptr, 0, nullptr, &available, nullptr))
        return {static_cast<int>(GetLastError()), boost::system::system_category()};
    if (available == 0)
        return boost::asio::error::would_block;
    boost::system::error_code error;
    size = pipe.read_some(
        boost::asio::buffer(buffer.bytes, std::min<std::size_t>(available, buffer.capacity)),
        error);
    return error;
}

bool output_in_flight(const output_buffer& buffer) {
    return buffer.reading;
}

// The read completes at once: with what it had already read, or with nothing.
void cut_output_short(stream& pipe) {
    boost::system::error_code ignored;
    pipe.cancel(ignored);
}

} // namespace torvad::platform
