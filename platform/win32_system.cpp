// The supervisor's own process, its files, its console and the event log on
// Windows.
#include <windows.h>

#include <csignal>
#include <direct.h>
#include <fcntl.h>
#include <io.h>

#include "platform/platform.hpp"

namespace torvad::platform {

const char* const exe_suffix = ".exe";
const int error_not_found = ERROR_FILE_NOT_FOUND;

std::string describe(const os_error& error) {
    char text[512];
    DWORD length =
        FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                       static_cast<DWORD>(error.code), 0, text, sizeof text, nullptr);
    // The system's texts end in a line break of their own.
    while (length > 0 && (text[length - 1] == '\n' || text[length - 1] == '\r'))
        --length;
    std::string reason = length > 0 ? std::string(text, length)
                                    : "error " + std::to_string(static_cast<DWORD>(error.code));
    return std::string(error.call) + ": " + reason;
}

namespace {

// The runtime turns the console's Ctrl-C into SIGINT, which the loop waits
// for; Ctrl-Break, the closing of the console and the system's shutdown
// would end us at once, without a sigterm to any child and with the PID file
// left behind. They are made the same SIGINT. The close and the shutdown end
// us when this returns, so it waits here, within the few seconds Windows
// grants, while the loop stops the children and the program returns. A
// logoff ends a user's session, not a service's: it is ignored, as a
// service must, or the default handler would end us with the session.
BOOL WINAPI stop_on_console_event(DWORD event) {
    if (event == CTRL_LOGOFF_EVENT)
        return TRUE;
    if (event != CTRL_BREAK_EVENT && event != CTRL_CLOSE_EVENT && event != CTRL_SHUTDOWN_EVENT)
        return FALSE;
    std::raise(SIGINT);
    if (event != CTRL_BREAK_EVENT)
        Sleep(INFINITE);
    return TRUE;
}

} // namespace

// Windows starts us as we are: standard handles that are missing stay null,
// and a child's end is seen on its process handle, not by a signal. Whichever
// console handler is asked first, the runtime's takes Ctrl-C alone. Without
// ours, those events end us as before, and -v says why.
os_error prepare_own_process() {
    if (!SetConsoleCtrlHandler(stop_on_console_event, TRUE))
        return {static_cast<int>(GetLastError()), "SetConsoleCtrlHandler"};
    return {};
}

void unbuffer_output() {
    // The runtime knows no line buffering, so nothing is buffered; and a line
    // ends in a line feed alone, as the log's formats give it, also in a file.
    std::setvbuf(stdout, nullptr, _IONBF, 0);
    _setmode(_fileno(stdout), _O_BINARY);
    _setmode(_fileno(stderr), _O_BINARY);
}

int current_process_id() {
    return static_cast<int>(GetCurrentProcessId());
}

bool stdout_is_terminal() {
    return _isatty(_fileno(stdout)) != 0;
}

// A console takes escape sequences once it is told to process them; output
// that isn't a console has no mode to read.
bool console_takes_colour() {
    HANDLE output = GetStdHandle(STD_OUTPUT_HANDLE);
    DWORD mode = 0;
    if (!GetConsoleMode(output, &mode))
        return false;
    return SetConsoleMode(output, mode | ENABLE_VIRTUAL_TERMINAL_PROCESSING) != 0;
}

bool change_directory(const std::string& path) {
    return _chdir(path.c_str()) == 0;
}

std::tm local_time_now() {
    __time64_t now = _time64(nullptr);
    std::tm local{};
    _localtime64_s(&local, &now);
    return local;
}

os_error read_file(const std::string& path, std::string& content) {
    HANDLE file = CreateFileA(path.c_str(), GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_WRITE,
                              nullptr, OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, nullptr);
    if (file == INVALID_HANDLE_VALUE)
        return {static_cast<int>(GetLastError()), "CreateFileA"};
    owned_handle owner(file);
    char buffer[65536];
    for (;;) {
        DWORD got = 0;
        if (!ReadFile(file, buffer, sizeof buffer, &got, nullptr))
            return {static_cast<int>(GetLastError()), "ReadFile"};
        if (got == 0)
            return {};
        content.append(buffer, got);
    }
}

void close_handle(native_handle handle) {
    CloseHandle(handle);
}

void write_event_record(event_type type, const char* text) {
    // Opened once, by whichever thread logs first; the static's guard makes
    // the others wait for it. A failed opening is not tried again.
    static const HANDLE source = RegisterEventSourceA(nullptr, "torvad");
    const char* strings[] = {"torvad", text};
    ReportEventA(source, static_cast<WORD>(type), 0, 0, nullptr, 2, 0, strings, nullptr);
}

} // namespace torvad::platform
