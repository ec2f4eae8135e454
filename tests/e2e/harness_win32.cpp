// Windows: torvad runs with a console of its own, a pseudo console whose
// output comes to us through a pipe and whose input takes our Ctrl-C, or with
// its output on a plain pipe. A thread of ours reads that output, so that a
// wait for text is a wait for an event.
#include <windows.h>

#include <psapi.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <map>
#include <mutex>
#include <thread>

#include "tests/e2e/harness.hpp"

namespace e2e {

struct daemon_run::system_part {
    HANDLE process = nullptr;
    HANDLE output = nullptr;        // our end of what torvad writes
    HANDLE console_input = nullptr; // our end of its console's input, at a console
    HPCON console = nullptr;
    std::thread reader;
    std::mutex guard;
    std::condition_variable arrived;
    std::string pending; // read by the thread, not yet in output_
    bool ended = false;  // the output pipe has closed

    void read_output() {
        char buffer[4096];
        DWORD got = 0;
        while (ReadFile(output, buffer, sizeof buffer, &got, nullptr) && got > 0) {
            std::lock_guard lock(guard);
            pending.append(buffer, got);
            arrived.notify_all();
        }
        std::lock_guard lock(guard);
        ended = true;
        arrived.notify_all();
    }
};

namespace {

// The command line that gives the program exactly these arguments back.
std::string quote(const std::string& argument) {
    if (!argument.empty() && argument.find_first_of(" \t\"") == std::string::npos)
        return argument;
    std::string quoted = "\"";
    std::size_t backslashes = 0;
    for (char c : argument) {
        if (c == '\\') {
            ++backslashes;
            continue;
        }
        quoted.append(c == '"' ? 2 * backslashes + 1 : backslashes, '\\');
        backslashes = 0;
        quoted += c;
    }
    quoted.append(2 * backslashes, '\\');
    return quoted + "\"";
}

std::string lower(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return text;
}

// Our environment with the given NAME=value entries put over it.
std::string environment_block(const std::vector<std::string>& changes) {
    std::map<std::string, std::string> variables; // by the name in lower case
    char* ours = GetEnvironmentStringsA();
    for (const char* entry = ours; *entry != '\0'; entry += std::strlen(entry) + 1) {
        std::string text = entry;
        variables[lower(text.substr(0, text.find('=', 1)))] = text;
    }
    FreeEnvironmentStringsA(ours);
    for (const auto& change : changes)
        variables[lower(change.substr(0, change.find('=')))] = change;
    std::string block;
    for (const auto& [name, entry] : variables)
        block += entry + '\0';
    return block + '\0';
}

void check(bool done, const char* call) {
    if (!done)
        FAIL() << call << " failed with error " << GetLastError();
}

} // namespace

bool holds_here(systems where) {
    return where != systems::linux_only;
}

daemon_run::daemon_run(const std::vector<std::string>& args, const options& how)
    : system_(std::make_unique<system_part>()) {
    SECURITY_ATTRIBUTES inheritable{sizeof inheritable, nullptr, TRUE};
    HANDLE theirs_out = nullptr, theirs_in = nullptr;
    STARTUPINFOEXA start{};
    start.StartupInfo.cb = sizeof start;
    SIZE_T list_size = 0;
    InitializeProcThreadAttributeList(nullptr, 1, 0, &list_size);
    std::vector<char> list(list_size);
    start.lpAttributeList = reinterpret_cast<LPPROC_THREAD_ATTRIBUTE_LIST>(list.data());
    check(InitializeProcThreadAttributeList(start.lpAttributeList, 1, 0, &list_size),
          "InitializeProcThreadAttributeList");
    if (how.terminal) {
        check(CreatePipe(&theirs_in, &system_->console_input, nullptr, 0), "CreatePipe");
        check(CreatePipe(&system_->output, &theirs_out, nullptr, 0), "CreatePipe");
        check(CreatePseudoConsole({200, 50}, theirs_in, theirs_out, 0, &system_->console) == S_OK,
              "CreatePseudoConsole");
        check(UpdateProcThreadAttribute(start.lpAttributeList, 0,
                                        PROC_THREAD_ATTRIBUTE_PSEUDOCONSOLE, system_->console,
                                        sizeof system_->console, nullptr, nullptr),
              "UpdateProcThreadAttribute");
    } else {
        check(CreatePipe(&system_->output, &theirs_out, &inheritable, 0), "CreatePipe");
        SetHandleInformation(system_->output, HANDLE_FLAG_INHERIT, 0);
        theirs_in = CreateFileA("NUL", GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_WRITE,
                                &inheritable, OPEN_EXISTING, 0, nullptr);
        start.StartupInfo.dwFlags = STARTF_USESTDHANDLES;
        start.StartupInfo.hStdInput = how.close_stdin ? nullptr : theirs_in;
        start.StartupInfo.hStdOutput = theirs_out;
        start.StartupInfo.hStdError = theirs_out;
    }
    if (how.inherit != -1)
        SetHandleInformation(reinterpret_cast<HANDLE>(how.inherit), HANDLE_FLAG_INHERIT,
                             HANDLE_FLAG_INHERIT);
    std::string command = quote(torvad_binary);
    for (const auto& arg : args)
        command += " " + quote(arg);
    std::string environment = environment_block(how.env);
    PROCESS_INFORMATION started{};
    bool inherit = !how.terminal || how.inherit != -1;
    check(CreateProcessA(nullptr, command.data(), nullptr, nullptr, inherit,
                         EXTENDED_STARTUPINFO_PRESENT, environment.data(),
                         how.directory.empty() ? nullptr : how.directory.c_str(),
                         &start.StartupInfo, &started),
          "CreateProcessA");
    DeleteProcThreadAttributeList(start.lpAttributeList);
    // Only torvad holds its ends now, so its end closes our pipe.
    CloseHandle(theirs_out);
    CloseHandle(theirs_in);
    system_->process = started.hProcess;
    CloseHandle(started.hThread);
    pid_ = static_cast<int>(started.dwProcessId);
    system_->reader = std::thread([part = system_.get()] { part->read_output(); });
}

daemon_run::~daemon_run() {
    if (system_->process != nullptr && !exited_) {
        TerminateProcess(system_->process, 1);
        WaitForSingleObject(system_->process, INFINITE);
    }
    // Closing the console, or torvad's exit for a plain pipe, ends the reader.
    if (system_->console != nullptr)
        ClosePseudoConsole(system_->console);
    if (system_->reader.joinable())
        system_->reader.join();
    for (HANDLE handle : {system_->process, system_->output, system_->console_input})
        if (handle != nullptr)
            CloseHandle(handle);
}

bool daemon_run::read_some(int timeout_ms) {
    std::unique_lock lock(system_->guard);
    system_->arrived.wait_for(lock, std::chrono::milliseconds(timeout_ms),
                              [this] { return !system_->pending.empty() || system_->ended; });
    eof_ = system_->ended && system_->pending.empty();
    if (system_->pending.empty())
        return false;
    output_ += system_->pending;
    system_->pending.clear();
    return true;
}

int daemon_run::wait_exit(int timeout_ms) {
    if (!exited_ && WaitForSingleObject(system_->process, timeout_ms) == WAIT_OBJECT_0) {
        DWORD code = 0;
        GetExitCodeProcess(system_->process, &code);
        exited_ = true;
        exit_code_ = static_cast<int>(code);
    }
    // What it wrote last may still be on its way through the console.
    while (read_some(exited_ ? 200 : 0)) {
    }
    return exited_ ? exit_code_ : -1;
}

// A console run has one stop request, Ctrl-C, whatever was asked for; a run
// without a console has none.
void daemon_run::signal(int) {
    interrupt_group();
}

void daemon_run::interrupt_group() {
    DWORD put = 0;
    if (system_->console_input != nullptr)
        WriteFile(system_->console_input, "\x03", 1, &put, nullptr);
}

void kill_process(int pid, int signal_number) {
    HANDLE process = OpenProcess(PROCESS_TERMINATE, FALSE, static_cast<DWORD>(pid));
    if (process == nullptr)
        return;
    TerminateProcess(process, static_cast<UINT>(128 + signal_number));
    CloseHandle(process);
}

bool make_link_pair(int& ours, long& theirs) {
    std::string name = "\\\\.\\pipe\\torvad_test_" + std::to_string(GetCurrentProcessId()) + "_" +
                       std::to_string(GetTickCount64());
    HANDLE server =
        CreateNamedPipeA(name.c_str(), PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                         PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE, 1, 8192, 8192, 0, nullptr);
    if (server == INVALID_HANDLE_VALUE)
        return false;
    HANDLE client = CreateFileA(name.c_str(), GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                                OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr);
    if (client == INVALID_HANDLE_VALUE) {
        CloseHandle(server);
        return false;
    }
    ours = static_cast<int>(reinterpret_cast<std::intptr_t>(client));
    theirs = static_cast<long>(reinterpret_cast<std::intptr_t>(server));
    return true;
}

bool running_as_root() {
    return false;
}

// The build's own copy serves: no account here is kept out of it.
reachable_child::reachable_child() : path(child_binary) {}

long peak_memory_kib(int pid) {
    HANDLE process = OpenProcess(PROCESS_QUERY_LIMITED_INFORMATION, FALSE, static_cast<DWORD>(pid));
    PROCESS_MEMORY_COUNTERS counters{};
    bool known = process != nullptr && GetProcessMemoryInfo(process, &counters, sizeof counters);
    if (process != nullptr)
        CloseHandle(process);
    return known ? static_cast<long>(counters.PeakWorkingSetSize / 1024) : -1;
}

int zombie_children(int) {
    return 0;
}

} // namespace e2e
