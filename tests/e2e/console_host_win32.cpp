// Runs a program at this process's console and says how it went, for the
// harness under Wine: Wine gives a console only to a program on a Unix
// pseudo-terminal, and what runs there can pass nothing to the harness but
// what appears on that terminal.
//   console_host [-handle <pid> <value>] <program> [args...]
// Its lines: "console-host pid=<program's pid> host=<ours>", and at the end
// "console-host exit=<code>". With -handle, the handle <value> of process
// <pid> is copied here to be inherited, and an argument that names it names
// the copy.
#include <windows.h>

#include <cstdio>
#include <string>
#include <vector>

#include "tests/e2e/quote_win32.hpp"

namespace {

using e2e::quote;

void say(const std::string& line) {
    DWORD put = 0;
    std::string text = "console-host " + line + "\n";
    WriteFile(GetStdHandle(STD_OUTPUT_HANDLE), text.data(), static_cast<DWORD>(text.size()), &put,
              nullptr);
}

// Ctrl-C is for the program; we only wait for it. A handler, unlike ignoring
// the event, is not inherited.
BOOL WINAPI keep_running(DWORD) {
    return TRUE;
}

} // namespace

int main(int argc, char** argv) {
    SetConsoleCtrlHandler(keep_running, TRUE);
    std::vector<std::string> args(argv + 1, argv + argc);
    if (args.size() > 3 && args[0] == "-handle") {
        HANDLE owner = OpenProcess(PROCESS_DUP_HANDLE, FALSE, std::stoul(args[1]));
        HANDLE copy = nullptr;
        auto value = reinterpret_cast<HANDLE>(static_cast<std::intptr_t>(std::stoll(args[2])));
        if (owner == nullptr || !DuplicateHandle(owner, value, GetCurrentProcess(), &copy, 0, TRUE,
                                                 DUPLICATE_SAME_ACCESS))
            say("handle failed " + std::to_string(GetLastError()));
        std::string given = args[2];
        for (auto& arg : args)
            if (arg == given)
                arg = std::to_string(reinterpret_cast<std::intptr_t>(copy));
        args.erase(args.begin(), args.begin() + 3);
    }
    std::string command;
    for (const auto& arg : args)
        command += (command.empty() ? "" : " ") + quote(arg);
    STARTUPINFOA start{};
    start.cb = sizeof start;
    PROCESS_INFORMATION started{};
    if (args.empty() || !CreateProcessA(nullptr, command.data(), nullptr, nullptr, TRUE, 0, nullptr,
                                        nullptr, &start, &started)) {
        say("failed " + std::to_string(GetLastError()));
        say("exit=-1");
        return 1;
    }
    say("pid=" + std::to_string(started.dwProcessId) +
        " host=" + std::to_string(GetCurrentProcessId()));
    WaitForSingleObject(started.hProcess, INFINITE);
    DWORD code = 0;
    GetExitCodeProcess(started.hProcess, &code);
    say("exit=" + std::to_string(code));
    return 0;
}
