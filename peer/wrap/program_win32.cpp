#include <windows.h>

#include <atomic>
#include <csignal>
#include <cstdint>
#include <thread>

#include "peer/wrap/program.hpp"

namespace torvad::wrap {

namespace {

// The C runtime's number for Ctrl-Break, the one stop a console program has.
constexpr int break_signal = 21;

HANDLE handle_of(std::intptr_t value) {
    return reinterpret_cast<HANDLE>(value);
}

// One item as the C runtime reads it back whole: in double quotes, a quote
// behind a backslash, and a run of backslashes doubled before a quote.
void append_item(std::string& line, const std::string& item) {
    line += '"';
    std::size_t backslashes = 0;
    for (char c : item) {
        if (c == '\\') {
            ++backslashes;
            continue;
        }
        line.append(c == '"' ? 2 * backslashes + 1 : backslashes, '\\');
        line += c;
        backslashes = 0;
    }
    line.append(2 * backslashes, '\\');
    line += '"';
}

// Ctrl-Break reaches only processes on our console: a service's wrapper has
// none, so it makes one, keeping the standard handles torvad gave it.
void own_a_console() {
    if (GetConsoleWindow() != nullptr)
        return;
    HANDLE streams[] = {GetStdHandle(STD_INPUT_HANDLE), GetStdHandle(STD_OUTPUT_HANDLE),
                        GetStdHandle(STD_ERROR_HANDLE)};
    if (!AllocConsole())
        return;
    SetStdHandle(STD_INPUT_HANDLE, streams[0]);
    SetStdHandle(STD_OUTPUT_HANDLE, streams[1]);
    SetStdHandle(STD_ERROR_HANDLE, streams[2]);
}

// Where a stop goes once serve runs; until then one is held.
std::atomic<void (*)()> stop_request = nullptr;
std::atomic<bool> stop_held = false;

// Ctrl-C and Ctrl-Break at torvad's console are torvad's to act on; the
// console's close, a logoff or a shutdown stops the program.
BOOL WINAPI on_console_event(DWORD event) {
    if (event == CTRL_C_EVENT || event == CTRL_BREAK_EVENT)
        return TRUE;
    // Whichever of us and serve takes the held stop sends it: once.
    stop_held = true;
    if (auto stop = stop_request.load(); stop != nullptr && stop_held.exchange(false))
        stop();
    return TRUE;
}

program_end wait_for_program(const running_program& program) {
    DWORD code = 0;
    if (WaitForSingleObject(handle_of(program.handle), INFINITE) != WAIT_OBJECT_0 ||
        !GetExitCodeProcess(handle_of(program.handle), &code))
        return {128, 0};
    int status = static_cast<int>(code);
    return {status, code == STATUS_CONTROL_C_EXIT ? program.stop_signal : 0};
}

} // namespace

int signal_by_name(const std::string& name) {
    return name == "BREAK" || name == "SIGBREAK" || name == "21" ? break_signal : -1;
}

int default_stop_signal() {
    return break_signal;
}

void keep_link_from_program(long link) {
    SetHandleInformation(handle_of(link), HANDLE_FLAG_INHERIT, 0);
}

int start_program(const std::vector<std::string>& command, const std::string& /*notify_address*/,
                  int stop_signal, running_program& out) {
    // No notify socket here: a program that has one from further up must not
    // report to a manager that isn't ours.
    SetEnvironmentVariableA("NOTIFY_SOCKET", nullptr);
    own_a_console();
    std::string line;
    for (const auto& item : command) {
        line += line.empty() ? "" : " ";
        append_item(line, item);
    }
    STARTUPINFOA start{};
    start.cb = sizeof start;
    start.dwFlags = STARTF_USESTDHANDLES;
    start.hStdInput = GetStdHandle(STD_INPUT_HANDLE);
    start.hStdOutput = GetStdHandle(STD_OUTPUT_HANDLE);
    start.hStdError = GetStdHandle(STD_ERROR_HANDLE);
    for (HANDLE stream : {start.hStdInput, start.hStdOutput, start.hStdError})
        SetHandleInformation(stream, HANDLE_FLAG_INHERIT, HANDLE_FLAG_INHERIT);
    PROCESS_INFORMATION started{};
    if (!CreateProcessA(nullptr, line.data(), nullptr, nullptr, TRUE, CREATE_NEW_PROCESS_GROUP,
                        nullptr, nullptr, &start, &started))
        return static_cast<int>(GetLastError());
    CloseHandle(started.hThread);
    out.pid = static_cast<long>(started.dwProcessId);
    out.handle = reinterpret_cast<std::intptr_t>(started.hProcess);
    out.stop_signal = stop_signal;
    return 0;
}

// A new process group's id is its first process's.
stop_failure stop_program(const running_program& program) {
    if (!GenerateConsoleCtrlEvent(CTRL_BREAK_EVENT, static_cast<DWORD>(program.pid)))
        return {static_cast<int>(GetLastError()), "GenerateConsoleCtrlEvent"};
    return {};
}

std::string error_text(int error) {
    char text[512] = {};
    if (FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                       static_cast<DWORD>(error), 0, text, sizeof text, nullptr) == 0)
        return "error " + std::to_string(error);
    std::string message = text;
    while (!message.empty() && (message.back() == '\n' || message.back() == '\r'))
        message.pop_back();
    return message;
}

// The notify protocol is systemd's; a Windows program says nothing of the kind.
notify_socket open_notify_socket() {
    return {-1, {}, ERROR_NOT_SUPPORTED};
}

long receive_notification(const notify_socket&, char*, std::size_t, bool& too_long) {
    too_long = false;
    return -1;
}

void hold_own_stop_requests() {
    SetConsoleCtrlHandler(on_console_event, TRUE);
}

// The link is read on a thread of its own, blocked in its reads to the end:
// the process's exit ends it. There is no notify socket to read here.
program_end serve(const running_program& program, long, const notify_socket&, const handlers& on) {
    stop_request = on.on_stop;
    if (stop_held.exchange(false))
        on.on_stop();
    std::thread([on_link = on.on_link] {
        while (on_link()) {
        }
    }).detach();
    return wait_for_program(program);
}

} // namespace torvad::wrap
