#include <windows.h>

#include <tlhelp32.h>

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <io.h>
#include <sstream>

#include "tests/child/child_host.hpp"

namespace child_host {

namespace {
// Ctrl-Break at the console reaches every program on it, whatever its group
// (Ctrl-C is off in the group of its own that torvad gives each child); a
// peer ends by its sigterm packet, as it does when torvad runs as a service.
BOOL WINAPI ignore_interrupt(DWORD event) {
    return event == CTRL_BREAK_EVENT;
}
} // namespace

void prepare_streams() {
    for (int stream : {0, 1, 2})
        _setmode(stream, _O_BINARY);
    SetConsoleCtrlHandler(ignore_interrupt, TRUE);
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

namespace {

DWORD parent_id() {
    HANDLE all = CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0);
    PROCESSENTRY32 entry{};
    entry.dwSize = sizeof entry;
    DWORD parent = 0;
    for (BOOL more = Process32First(all, &entry); more; more = Process32Next(all, &entry))
        if (entry.th32ProcessID == GetCurrentProcessId())
            parent = entry.th32ParentProcessID;
    CloseHandle(all);
    return parent;
}

} // namespace

bool take_pipe_name(int n) {
    std::string name =
        "\\\\.\\pipe\\torvad_" + std::to_string(parent_id()) + "_" + std::to_string(n);
    // Left open until we end, as a squatter would hold it.
    return CreateNamedPipeA(name.c_str(), PIPE_ACCESS_DUPLEX, PIPE_TYPE_BYTE,
                            PIPE_UNLIMITED_INSTANCES, 4096, 4096, 0,
                            nullptr) != INVALID_HANDLE_VALUE;
}

// GenerateConsoleCtrlEvent fails on Wine's terminal console, so the event
// goes the way the console itself sends it: kernelbase's CtrlRoutine, which
// lies at the same address in every process, run on a thread in the parent.
bool console_event(int n) {
    auto routine = reinterpret_cast<LPTHREAD_START_ROUTINE>(
        reinterpret_cast<void*>(GetProcAddress(GetModuleHandleA("kernelbase"), "CtrlRoutine")));
    HANDLE parent = OpenProcess(PROCESS_ALL_ACCESS, FALSE, parent_id());
    HANDLE thread =
        routine == nullptr || parent == nullptr
            ? nullptr
            : CreateRemoteThread(parent, nullptr, 0, routine,
                                 reinterpret_cast<void*>(static_cast<INT_PTR>(n)), 0, nullptr);
    if (parent != nullptr)
        CloseHandle(parent);
    return thread != nullptr && CloseHandle(thread);
}

namespace {

// What follows the program on the command line, exactly as the line holds it.
std::string command_line_arguments() {
    std::string line = GetCommandLineA();
    std::size_t end = line[0] == '"' ? line.find('"', 1) + 1 : line.find(' ');
    return end >= line.size() ? std::string() : line.substr(end + 1);
}

} // namespace

// schtasks and powershell append their arguments as
// a line to <tool>.log in the working directory; powershell then prints the
// script behind -file, and fails when there is none.
int stand_in_for_tool(const char* self) {
    std::string tool = std::filesystem::path(self).stem().string();
    for (auto& c : tool)
        c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    if (tool != "schtasks" && tool != "powershell")
        return -1;
    std::ofstream(tool + ".log", std::ios::app | std::ios::binary)
        << command_line_arguments() << "\n";
    if (tool == "schtasks")
        return 0;
    for (int i = 1; i + 1 < __argc; ++i) {
        if (std::string(__argv[i]) != "-file")
            continue;
        std::ifstream script(__argv[i + 1], std::ios::binary);
        std::stringstream text;
        text << script.rdbuf();
        std::string content = text.str();
        return script && std::fwrite(content.data(), 1, content.size(), stdout) == content.size()
                   ? 0
                   : 1;
    }
    return 1;
}

} // namespace child_host
