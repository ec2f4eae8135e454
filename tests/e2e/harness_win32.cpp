// Windows, under Wine: torvad runs with its output on a plain pipe, or at a
// console. Wine gives a console only to a program on a Unix pseudo-terminal
// (its own pseudo console passes no output), so a console run goes through
// script(1), whose terminal Wine's console draws on, over a socket (Wine hands
// a Unix program no pipe of ours). console_host runs torvad there and tells
// its pid and exit code; Ctrl-C is the terminal's, typed into script. A
// thread of ours reads the output, so that a wait for text is a wait for an
// event.
#include <winsock2.h>

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
#include "tests/e2e/quote_win32.hpp"

namespace e2e {

namespace {

const char* const console_host_binary = CONSOLE_HOST_BINARY;

std::string shell_word(const std::string& text) {
    std::string word = "'";
    for (char c : text)
        word += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return word + "'";
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

// The length of the escape sequence at text[at], 0 when it isn't complete yet.
std::size_t sequence_length(const std::string& text, std::size_t at) {
    if (at + 1 >= text.size())
        return 0;
    if (text[at + 1] != '[')
        return 1;
    for (std::size_t end = at + 2; end < text.size(); ++end)
        if (text[end] >= 0x40 && text[end] <= 0x7e)
            return end + 1 - at;
    return 0;
}

// Undoes how Wine's console draws on a terminal: a run of blanks drawn as an
// erase and a move over it, a trailing blank as an erase, the cursor hidden
// and shown around each change, lines ending in CR LF. Appends to text what
// can be told; gives how much of raw that took.
std::size_t console_text(const std::string& raw, std::string& text) {
    std::size_t at = 0;
    while (at < raw.size()) {
        if (raw[at] == '\r') {
            if (at + 1 == raw.size())
                break; // a line feed may follow
            if (raw[at + 1] != '\n')
                text += '\r';
            ++at;
            continue;
        }
        if (raw[at] != '\x1b') {
            text += raw[at++];
            continue;
        }
        std::size_t length = sequence_length(raw, at);
        if (length == 0)
            break;
        std::string sequence = raw.substr(at, length);
        if (sequence == "\x1b[K") {
            std::size_t next = at + length;
            std::size_t move =
                next < raw.size() && raw[next] == '\x1b' ? sequence_length(raw, next) : 0;
            if (next == raw.size() || (raw[next] == '\x1b' && move == 0))
                break; // what the erase stands for comes next
            if (move > 0 && raw[next + move - 1] == 'C') {
                std::string count = raw.substr(next + 2, move - 3);
                text.append(count.empty() ? 1 : std::stoul(count), ' ');
                length += move;
            } else if (raw[next] == '\r') {
                text += ' ';
            }
        } else if (sequence != "\x1b[?25l" && sequence != "\x1b[?25h") {
            text += sequence;
        }
        at += length;
    }
    return at;
}

} // namespace

struct daemon_run::system_part {
    HANDLE process = nullptr;         // torvad
    HANDLE host = nullptr;            // console_host, at a console
    HANDLE output = nullptr;          // our end of torvad's pipe
    SOCKET terminal = INVALID_SOCKET; // our end of script's stdin and stdout
    std::thread reader;
    std::mutex guard;
    std::condition_variable arrived;
    std::string pending;   // read by the thread, not yet in output_
    bool ended = false;    // the output has closed
    std::string raw, line; // at a console: what is drawn, what is told of it
    int child_pid = 0, host_pid = 0, exit_code = -1;
    bool host_ended = false;

    // Bytes as they came; at a console, lines of text, less the host's own.
    void take(const char* data, std::size_t size) {
        std::lock_guard lock(guard);
        if (terminal == INVALID_SOCKET) {
            pending.append(data, size);
        } else {
            raw.append(data, size);
            std::string text;
            raw.erase(0, console_text(raw, text));
            for (char c : text) {
                line += c;
                if (c == '\n')
                    take_line();
            }
        }
        arrived.notify_all();
    }

    void take_line() {
        if (line.rfind("console-host ", 0) != 0)
            pending += line;
        else if (auto at = line.find("pid="); at != std::string::npos)
            std::sscanf(line.c_str() + at, "pid=%d host=%d", &child_pid, &host_pid);
        else if (auto at = line.find("exit="); at != std::string::npos)
            host_ended = std::sscanf(line.c_str() + at, "exit=%d", &exit_code) == 1;
        line.clear();
    }

    void read_output() {
        char buffer[4096];
        for (;;) {
            DWORD got = 0;
            int received = 0;
            bool more = terminal == INVALID_SOCKET
                            ? ReadFile(output, buffer, sizeof buffer, &got, nullptr) && got > 0
                            : (received = recv(terminal, buffer, sizeof buffer, 0)) > 0;
            if (!more)
                break;
            take(buffer, terminal == INVALID_SOCKET ? got : static_cast<std::size_t>(received));
        }
        std::lock_guard lock(guard);
        pending += line;
        ended = true;
        arrived.notify_all();
    }

    // A connected pair of sockets: one for script's stdin and stdout, one ours.
    SOCKET socket_pair() {
        WSADATA data;
        WSAStartup(MAKEWORD(2, 2), &data);
        SOCKET listener = WSASocketA(AF_INET, SOCK_STREAM, 0, nullptr, 0, 0);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        int size = sizeof address;
        bind(listener, reinterpret_cast<sockaddr*>(&address), size);
        getsockname(listener, reinterpret_cast<sockaddr*>(&address), &size);
        listen(listener, 1);
        SOCKET theirs = WSASocketA(AF_INET, SOCK_STREAM, 0, nullptr, 0, 0);
        connect(theirs, reinterpret_cast<sockaddr*>(&address), size);
        terminal = accept(listener, nullptr, nullptr);
        closesocket(listener);
        return theirs;
    }
};

// Wine's dispatcher connects to the control pipe of the service process its
// manager started last; that pipe is taken (by winedevice, at least), so it
// waits out the pipe's 10 s before it fails with 1063.
const int dispatcher_refusal_ms = 30000;
const int event_wait_ms = 30000;

bool holds_here(systems where) {
    return where != systems::linux_only;
}

namespace {

// torvad, or at a console script running console_host running torvad.
std::string command_of(const std::vector<std::string>& args, const options& how) {
    std::vector<std::string> argv = {torvad_binary};
    argv.insert(argv.end(), args.begin(), args.end());
    if (how.terminal) {
        std::string inner = "stty cols 8192 rows 100 -echo -onlcr; exec /usr/bin/wine " +
                            shell_word(console_host_binary);
        if (how.inherit != -1)
            inner += " -handle " + std::to_string(GetCurrentProcessId()) + " " +
                     std::to_string(how.inherit);
        for (const auto& arg : argv)
            inner += " " + shell_word(arg);
        argv = {"/usr/bin/script", "-qfec", inner, "/dev/null"};
    }
    std::string command;
    for (const auto& arg : argv)
        command += (command.empty() ? "" : " ") + quote(arg);
    return command;
}

void check(bool done, const char* call) {
    if (!done)
        FAIL() << call << " failed with error " << GetLastError();
}

} // namespace

daemon_run::daemon_run(const std::vector<std::string>& args, const options& how)
    : system_(std::make_unique<system_part>()) {
    SECURITY_ATTRIBUTES inheritable{sizeof inheritable, nullptr, TRUE};
    HANDLE theirs_out = nullptr, theirs_in = nullptr;
    STARTUPINFOA start{};
    start.cb = sizeof start;
    start.dwFlags = STARTF_USESTDHANDLES;
    if (how.terminal) {
        theirs_out = theirs_in = reinterpret_cast<HANDLE>(system_->socket_pair());
        SetHandleInformation(theirs_out, HANDLE_FLAG_INHERIT, HANDLE_FLAG_INHERIT);
    } else {
        check(CreatePipe(&system_->output, &theirs_out, &inheritable, 0), "CreatePipe");
        SetHandleInformation(system_->output, HANDLE_FLAG_INHERIT, 0);
        theirs_in = CreateFileA("NUL", GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_WRITE,
                                &inheritable, OPEN_EXISTING, 0, nullptr);
        if (how.inherit != -1)
            SetHandleInformation(reinterpret_cast<HANDLE>(how.inherit), HANDLE_FLAG_INHERIT,
                                 HANDLE_FLAG_INHERIT);
    }
    start.hStdInput = how.close_stdin ? nullptr : theirs_in;
    start.hStdOutput = start.hStdError = theirs_out;
    std::string command = command_of(args, how);
    std::string environment = environment_block(how.env);
    PROCESS_INFORMATION started{};
    check(CreateProcessA(nullptr, command.data(), nullptr, nullptr, TRUE, 0, environment.data(),
                         how.directory.empty() ? nullptr : how.directory.c_str(), &start, &started),
          "CreateProcessA");
    // Only the child holds its ends now, so its end closes ours.
    if (how.terminal) {
        closesocket(reinterpret_cast<SOCKET>(theirs_out));
    } else {
        CloseHandle(theirs_out);
        CloseHandle(theirs_in);
        system_->process = started.hProcess;
        CloseHandle(started.hThread);
        pid_ = static_cast<int>(started.dwProcessId);
    }
    system_->reader = std::thread([part = system_.get()] { part->read_output(); });
    if (!how.terminal)
        return;
    // A Unix program has no process for us to hold: the host tells the pid.
    std::unique_lock lock(system_->guard);
    system_->arrived.wait_for(lock, std::chrono::seconds(30), [this] {
        return system_->child_pid != 0 || system_->host_ended || system_->ended;
    });
    pid_ = system_->child_pid;
    DWORD access = SYNCHRONIZE | PROCESS_TERMINATE | PROCESS_QUERY_INFORMATION | PROCESS_VM_READ;
    system_->process = OpenProcess(access, FALSE, static_cast<DWORD>(pid_));
    system_->host =
        OpenProcess(SYNCHRONIZE | PROCESS_TERMINATE, FALSE, static_cast<DWORD>(system_->host_pid));
}

daemon_run::~daemon_run() {
    if (!exited_) {
        for (HANDLE process : {system_->process, system_->host})
            if (process != nullptr)
                TerminateProcess(process, 1);
    }
    if (system_->terminal != INVALID_SOCKET) {
        // script ends with the host; should it linger, the socket's close
        // ends the read.
        std::unique_lock lock(system_->guard);
        system_->arrived.wait_for(lock, std::chrono::seconds(10),
                                  [this] { return system_->ended; });
        shutdown(system_->terminal, SD_BOTH);
    }
    if (system_->reader.joinable())
        system_->reader.join();
    if (system_->terminal != INVALID_SOCKET)
        closesocket(system_->terminal);
    for (HANDLE handle : {system_->process, system_->host, system_->output})
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
    if (!exited_ && system_->terminal != INVALID_SOCKET) {
        // The host's last line is the exit code.
        std::unique_lock lock(system_->guard);
        exited_ = system_->arrived.wait_for(lock, std::chrono::milliseconds(timeout_ms),
                                            [this] { return system_->host_ended; });
        exit_code_ = system_->exit_code;
    } else if (!exited_ && system_->process != nullptr &&
               WaitForSingleObject(system_->process, timeout_ms) == WAIT_OBJECT_0) {
        DWORD code = 0;
        GetExitCodeProcess(system_->process, &code);
        exited_ = true;
        exit_code_ = static_cast<int>(code);
    }
    // What it wrote last may still be on its way.
    while (read_some(exited_ ? 200 : 0)) {
    }
    return exited_ ? exit_code_ : -1;
}

// A console run has one stop request, Ctrl-C, whatever was asked for; a run
// without a console has none.
void daemon_run::signal(int) {
    interrupt_group();
}

// Typed into the terminal, whose whole foreground group gets it.
void daemon_run::interrupt_group() {
    if (system_->terminal != INVALID_SOCKET)
        send(system_->terminal, "\x03", 1, 0);
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
