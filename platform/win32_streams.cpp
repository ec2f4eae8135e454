// Pipes on Windows: named pipes whose end of ours is overlapped and bound to
// the loop's completion port; relayed output is read straight into the
// stream's own buffer.
#include <windows.h>

#include <bcrypt.h>
#include <sddl.h>

#include <algorithm>
#include <memory>
#include <utility>

#include <boost/asio/buffer.hpp>
#include <boost/asio/error.hpp>

#include "platform/platform.hpp"

namespace torvad::platform {

namespace {

os_error last_error(const char* call) {
    return {static_cast<int>(GetLastError()), call};
}

// A name nobody can tell in advance, 128 bits from the system's generator: a
// counted one could be read off a child's own handles and the next taken
// first, by the child or by another account.
os_error random_pipe_name(std::string& name) {
    unsigned char bytes[16];
    if (!BCRYPT_SUCCESS(
            BCryptGenRandom(nullptr, bytes, sizeof bytes, BCRYPT_USE_SYSTEM_PREFERRED_RNG)))
        return {ERROR_GEN_FAILURE, "BCryptGenRandom"};
    name = "\\\\.\\pipe\\torvad_";
    for (unsigned char byte : bytes) {
        name += "0123456789abcdef"[byte >> 4];
        name += "0123456789abcdef"[byte & 15];
    }
    return {};
}

// A descriptor whose one list admits our own account and the system, and
// nobody else: "D:P" protects it from inherited entries, GA is all access.
os_error own_account_only(std::shared_ptr<void>& descriptor) {
    HANDLE token = nullptr;
    if (!OpenProcessToken(GetCurrentProcess(), TOKEN_QUERY, &token))
        return last_error("OpenProcessToken");
    owned_handle token_owner(token);
    DWORD size = 0;
    GetTokenInformation(token, TokenUser, nullptr, 0, &size);
    if (size == 0)
        return last_error("GetTokenInformation");
    std::unique_ptr<char[]> user(new char[size]);
    if (!GetTokenInformation(token, TokenUser, user.get(), size, &size))
        return last_error("GetTokenInformation");
    char* sid_text = nullptr;
    if (!ConvertSidToStringSidA(reinterpret_cast<TOKEN_USER*>(user.get())->User.Sid, &sid_text))
        return last_error("ConvertSidToStringSidA");
    std::string sddl = std::string("D:P(A;;GA;;;SY)(A;;GA;;;") + sid_text + ")";
    LocalFree(sid_text);
    PSECURITY_DESCRIPTOR made = nullptr;
    if (!ConvertStringSecurityDescriptorToSecurityDescriptorA(sddl.c_str(), SDDL_REVISION_1, &made,
                                                              nullptr))
        return last_error("ConvertStringSecurityDescriptorToSecurityDescriptorA");
    descriptor.reset(made, LocalFree);
    return {};
}

// Binds handle to ours; on failure it stays in handle.
os_error bind(stream& ours, owned_handle& handle) {
    return adopt_handle(ours, handle);
}

const char* const name_taken = "CreateNamedPipeA, its name taken by another program";
const char* const connected_elsewhere = "CreateFileA, connected to another program's pipe";

// One instance of the pipe name, ours bound to the loop, theirs opened on it,
// which connects the pipe. Each pipe is made ours alone rather than left open
// to any local user: a name somebody took first fails, only our own account
// and the system, on this machine, may connect, and the server may identify
// the opener but never act as it. Where the first-instance flag is not
// enforced (Wine), ours may have joined the instances of somebody else's
// pipe, and the open could connect to one of theirs: so the instances are
// counted (which takes read access: our end is always duplex) and the
// opened end must lead back to us. Theirs is not inheritable: the launch
// that hands it on makes it so.
os_error make_pipe_named(const std::string& name, DWORD open_mode, DWORD pipe_mode,
                         DWORD buffer_size, stream& ours, DWORD their_access, DWORD their_flags,
                         owned_handle& theirs, pipe_step& failed) {
    failed = pipe_step::create;
    std::shared_ptr<void> descriptor;
    if (os_error error = own_account_only(descriptor))
        return error;
    SECURITY_ATTRIBUTES ours_alone{sizeof ours_alone, descriptor.get(), FALSE};
    HANDLE made = CreateNamedPipeA(name.c_str(),
                                   PIPE_ACCESS_DUPLEX | open_mode | FILE_FLAG_FIRST_PIPE_INSTANCE,
                                   pipe_mode | PIPE_WAIT | PIPE_REJECT_REMOTE_CLIENTS, 1,
                                   buffer_size, buffer_size, 0, &ours_alone);
    if (made == INVALID_HANDLE_VALUE && GetLastError() == ERROR_ACCESS_DENIED)
        return {ERROR_ACCESS_DENIED, name_taken};
    if (made == INVALID_HANDLE_VALUE)
        return last_error("CreateNamedPipeA");
    owned_handle server(made);
    DWORD instances = 0;
    if (!GetNamedPipeHandleStateA(made, nullptr, &instances, nullptr, nullptr, nullptr, 0))
        return last_error("GetNamedPipeHandleStateA");
    if (instances != 1)
        return {ERROR_ACCESS_DENIED, name_taken};
    if (os_error error = bind(ours, server))
        return error;
    failed = pipe_step::open;
    HANDLE client =
        CreateFileA(name.c_str(), their_access, 0, nullptr, OPEN_EXISTING,
                    their_flags | SECURITY_SQOS_PRESENT | SECURITY_IDENTIFICATION, nullptr);
    if (client == INVALID_HANDLE_VALUE)
        return last_error("CreateFileA");
    owned_handle opened(client);
    ULONG server_id = 0;
    if (!GetNamedPipeServerProcessId(client, &server_id))
        return last_error("GetNamedPipeServerProcessId");
    if (server_id != GetCurrentProcessId())
        return {ERROR_ACCESS_DENIED, connected_elsewhere};
    theirs = std::move(opened);
    failed = pipe_step::none;
    return {};
}

// A name found taken is tried again under a fresh one, so that a squatter
// who guessed a name can't keep a launch from succeeding; with random names
// a second guess is as unlikely as the first, and a few tries are plenty.
constexpr int name_tries = 4;

os_error make_pipe(DWORD open_mode, DWORD pipe_mode, DWORD buffer_size, stream& ours,
                   DWORD their_access, DWORD their_flags, owned_handle& theirs, pipe_step& failed,
                   int& taken_names) {
    os_error error;
    for (int attempt = 0; attempt < name_tries; ++attempt) {
        std::string name;
        if ((error = random_pipe_name(name))) {
            failed = pipe_step::create;
            return error;
        }
        error = make_pipe_named(name, open_mode, pipe_mode, buffer_size, ours, their_access,
                                their_flags, theirs, failed);
        if (error.call != name_taken && error.call != connected_elsewhere)
            return error;
        ++taken_names;
        boost::system::error_code ignored;
        ours.close(ignored);
    }
    return error;
}

} // namespace

os_error make_ipc_pipe(stream& ours, owned_handle& theirs, pipe_step& failed, int& taken_names) {
    return make_pipe(FILE_FLAG_OVERLAPPED, PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE, 8192, ours,
                     GENERIC_READ | GENERIC_WRITE, FILE_FLAG_OVERLAPPED, theirs, failed,
                     taken_names);
}

// Our end overlapped for the loop; the child's end plain, as a program's
// standard handles are, and one way only.
os_error make_relay_pipe(int stream_number, stream& ours, owned_handle& theirs, int& taken_names) {
    pipe_step failed = pipe_step::none;
    os_error error = make_pipe(FILE_FLAG_OVERLAPPED, PIPE_TYPE_BYTE | PIPE_READMODE_BYTE, 65536,
                               ours, stream_number == 0 ? GENERIC_READ : GENERIC_WRITE, 0, theirs,
                               failed, taken_names);
    boost::system::error_code ignored;
    if (failed == pipe_step::open)
        ours.close(ignored);
    return error;
}

os_error attach_pipe(stream& ours, std::int64_t value) {
    // -1 would name this process itself, and 0 no handle at all.
    if (value <= 0)
        return {ERROR_INVALID_HANDLE, "attach"};
    HANDLE handle = reinterpret_cast<HANDLE>(static_cast<std::intptr_t>(value));
    // It came to us by inheritance; left so, it would pass on to every
    // program that the peer has us run.
    if (!SetHandleInformation(handle, HANDLE_FLAG_INHERIT, 0))
        return last_error("SetHandleInformation");
    owned_handle given(handle);
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

// A read on its way completes at once: with what it had already read, or
// with nothing.
bool end_output(stream& pipe, output_buffer& buffer) {
    if (!buffer.reading)
        return true;
    boost::system::error_code ignored;
    pipe.cancel(ignored);
    return false;
}

} // namespace torvad::platform
