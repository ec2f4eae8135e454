#include <windows.h>

#include <tlhelp32.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <io.h>
#include <sstream>

#include "peer/peer.hpp"
#include "tests/child/child_host.hpp"

namespace child_host {

// A console's events reach every program on it, whatever its group (Ctrl-C
// is off in the group of its own that torvad gives each child); a peer ends
// by its sigterm packet, as it does when torvad runs as a service.
void prepare_streams() {
    for (int stream : {0, 1, 2})
        _setmode(stream, _O_BINARY);
    torvad::peer::outlive_console_events();
}

// A process's handles can't be listed here, and no row asks after the account.
std::vector<std::string> start_state(int) {
    return {};
}

bool leave_orphans(int) {
    return false;
}

// The process that started us: torvad, whose pipes and console we aim at.
static DWORD parent_id() {
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

bool notify(const std::string&) {
    return false;
}

// Left open until we end, as a squatter would hold them; then whether any
// was connected (a look at a pipe that nobody opened fails, listening).
bool squat(const std::string& calls) {
    static std::vector<HANDLE> taken;
    std::istringstream list(calls);
    for (std::string call; std::getline(list, call, ',');) {
        char name[64] = "\\\\.\\pipe\\torvad_";
        for (int i = 0; i < 16; ++i)
            std::snprintf(name + 16 + 2 * i, 3, "%02x", std::atoi(call.c_str()));
        taken.push_back(CreateNamedPipeA(name, PIPE_ACCESS_DUPLEX, 0, 9, 64, 64, 0, nullptr));
    }
    if (!calls.empty())
        return std::ranges::count(taken, INVALID_HANDLE_VALUE) == 0;
    for (HANDLE pipe : taken)
        if (PeekNamedPipe(pipe, nullptr, 0, nullptr, nullptr, nullptr) ||
            GetLastError() == ERROR_BROKEN_PIPE)
            return true;
    return false;
}

// As the console sends it (Wine's GenerateConsoleCtrlEvent fails): kernelbase's
// CtrlRoutine, at the same address in every process, on a thread in torvad and
// in us; waited for where the handlers return (Ctrl-Break, logoff).
bool console_event(int n) {
    auto routine = reinterpret_cast<LPTHREAD_START_ROUTINE>(
        reinterpret_cast<void*>(GetProcAddress(GetModuleHandleA("kernelbase"), "CtrlRoutine")));
    HANDLE threads[2] = {};
    for (HANDLE& thread : threads) {
        HANDLE process = &thread == threads ? OpenProcess(PROCESS_ALL_ACCESS, FALSE, parent_id())
                                            : GetCurrentProcess();
        thread = CreateRemoteThread(process, nullptr, 0, routine,
                                    reinterpret_cast<void*>(static_cast<INT_PTR>(n)), 0, nullptr);
        if (thread == nullptr)
            return false;
    }
    bool returns = n == CTRL_BREAK_EVENT || n == CTRL_LOGOFF_EVENT;
    return !returns || WaitForMultipleObjects(2, threads, TRUE, 10000) == WAIT_OBJECT_0;
}

// A named pipe: torvad reads it overlapped, which an anonymous pipe can't be.
bool start_attached(const std::string& torvad, int& ours, long& theirs) {
    std::string name = "\\\\.\\pipe\\torvad_caller_" + std::to_string(GetCurrentProcessId());
    HANDLE server =
        CreateNamedPipeA(name.c_str(), PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                         PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE, 1, 8192, 8192, 0, nullptr);
    HANDLE client = CreateFileA(name.c_str(), GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                                OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr);
    theirs = static_cast<long>(reinterpret_cast<std::intptr_t>(server));
    std::string command = "\"" + torvad + "\" -v -a " + std::to_string(GetCurrentProcessId()) +
                          " " + std::to_string(theirs) + " -- never_run";
    STARTUPINFOA start{};
    start.cb = sizeof start;
    PROCESS_INFORMATION started{};
    if (client == INVALID_HANDLE_VALUE ||
        !SetHandleInformation(server, HANDLE_FLAG_INHERIT, HANDLE_FLAG_INHERIT) ||
        !CreateProcessA(nullptr, command.data(), nullptr, nullptr, TRUE, 0, nullptr, nullptr,
                        &start, &started))
        return false;
    CloseHandle(started.hThread);
    CloseHandle(started.hProcess);
    CloseHandle(server); // torvad holds its own copy
    ours = static_cast<int>(reinterpret_cast<std::intptr_t>(client));
    return true;
}

// schtasks and powershell append their command line behind the program, as the
// line holds it, to <tool>.log here.
int stand_in_for_tool(const char* self) {
    std::string tool = std::filesystem::path(self).stem().string(), line = GetCommandLineA();
    if (tool != "schtasks" && tool != "powershell")
        return -1;
    std::size_t end = line[0] == '"' ? line.find('"', 1) + 1 : line.find(' ');
    std::ofstream(tool + ".log", std::ios::app | std::ios::binary)
        << (end >= line.size() ? "" : line.substr(end + 1)) << "\n";
    return 0;
}

} // namespace child_host
