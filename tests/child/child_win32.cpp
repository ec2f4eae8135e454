#include <windows.h>

#include <fcntl.h>
#include <io.h>

#include "tests/child/child_host.hpp"

namespace child_host {

namespace {
// Ctrl-C at the console reaches every program on it; a peer ends by its
// sigterm packet, as it does when torvad runs as a service.
BOOL WINAPI ignore_interrupt(DWORD event) {
    return event == CTRL_C_EVENT || event == CTRL_BREAK_EVENT;
}
} // namespace

void prepare_streams() {
    for (int stream : {0, 1, 2})
        _setmode(stream, _O_BINARY);
    SetConsoleCtrlHandler(ignore_interrupt, TRUE);
}

int own_pid() {
    return static_cast<int>(GetCurrentProcessId());
}

long read_input(char* buffer, std::size_t size) {
    DWORD got = 0;
    if (ReadFile(GetStdHandle(STD_INPUT_HANDLE), buffer, static_cast<DWORD>(size), &got, nullptr))
        return static_cast<long>(got);
    // The writer's close shows as a broken pipe: the end of the input.
    return GetLastError() == ERROR_BROKEN_PIPE ? 0 : -1;
}

bool write_stream(int stream, const char* data, std::size_t size) {
    HANDLE out = GetStdHandle(stream == 2 ? STD_ERROR_HANDLE : STD_OUTPUT_HANDLE);
    while (size > 0) {
        DWORD put = 0;
        if (!WriteFile(out, data, static_cast<DWORD>(size), &put, nullptr))
            return false;
        data += put;
        size -= put;
    }
    return true;
}

// Which handles a process holds can't be listed here; the account can.
std::vector<std::string> start_state(int) {
    std::vector<std::string> lines;
    char name[256];
    DWORD size = sizeof name;
    lines.push_back(std::string("user=") + (GetUserNameA(name, &size) ? name : "?"));
    if (GetEnvironmentVariableA("NOTIFY_SOCKET", nullptr, 0) != 0)
        lines.push_back("notify socket inherited");
    return lines;
}

bool leave_orphans(int) {
    return false;
}

} // namespace child_host
