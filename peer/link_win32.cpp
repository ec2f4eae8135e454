#include <windows.h>

#include <cstdint>

#include "peer/link.hpp"
#include "peer/peer.hpp"

namespace torvad::peer {

namespace {

HANDLE handle_of(long value) {
    return reinterpret_cast<HANDLE>(static_cast<std::intptr_t>(value));
}

// torvad opens our end for overlapped input and output, so every read and
// write names an OVERLAPPED and waits for its own completion.
struct overlapped_call {
    overlapped_call() { call.hEvent = CreateEventA(nullptr, TRUE, FALSE, nullptr); }
    ~overlapped_call() {
        if (call.hEvent != nullptr)
            CloseHandle(call.hEvent);
    }
    // The bytes moved, or -1: started is what ReadFile or WriteFile returned.
    long finish(HANDLE link, BOOL started, DWORD wait_ms) {
        if (!started && GetLastError() != ERROR_IO_PENDING)
            return -1;
        if (WaitForSingleObject(call.hEvent, wait_ms) != WAIT_OBJECT_0) {
            CancelIoEx(link, &call);
        }
        DWORD moved = 0;
        if (!GetOverlappedResult(link, &call, &moved, TRUE))
            return -1;
        return static_cast<long>(moved);
    }
    OVERLAPPED call{};
};

// The close and the shutdown end the program once a handler returns, so the
// handler holds its thread until the program has ended on its own.
BOOL WINAPI await_sigterm(DWORD event) {
    if (event == CTRL_CLOSE_EVENT || event == CTRL_SHUTDOWN_EVENT)
        Sleep(INFINITE);
    return event != CTRL_C_EVENT;
}

} // namespace

void outlive_console_events() {
    // Without it the program ends as before; there is nothing better to do.
    (void)SetConsoleCtrlHandler(await_sigterm, TRUE);
}

bool link_is_open(long value) {
    DWORD flags = 0;
    return value > 0 && GetHandleInformation(handle_of(value), &flags) != 0;
}

void close_link(int link) {
    CloseHandle(handle_of(link));
}

long read_link(int link, char* buffer, std::size_t size) {
    overlapped_call read;
    if (read.call.hEvent == nullptr)
        return -1;
    BOOL started = ReadFile(handle_of(link), buffer, static_cast<DWORD>(size), nullptr, &read.call);
    long got = read.finish(handle_of(link), started, INFINITE);
    // The far end's close shows as a broken pipe: the end of the stream.
    return got == -1 && GetLastError() == ERROR_BROKEN_PIPE ? 0 : got;
}

bool write_link(int link, const char* data, std::size_t size, int wait_ms) {
    std::size_t sent = 0;
    while (sent < size) {
        overlapped_call write;
        if (write.call.hEvent == nullptr)
            return false;
        BOOL started = WriteFile(handle_of(link), data + sent, static_cast<DWORD>(size - sent),
                                 nullptr, &write.call);
        long put = write.finish(handle_of(link), started,
                                wait_ms < 0 ? INFINITE : static_cast<DWORD>(wait_ms));
        if (put <= 0)
            return false;
        sent += static_cast<std::size_t>(put);
    }
    return true;
}

} // namespace torvad::peer
