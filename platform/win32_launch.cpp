// Launching, watching and ending children on Windows: a logon for another
// account, CreateProcessAsUserA with the quoted command line and handle
// inheritance, and the process handle as what tells the child's end.
#include <windows.h>

#include "platform/platform.hpp"

namespace torvad::platform {

namespace {

launch_result failed_launch(launch_step step, const char* call) {
    launch_result result;
    result.failed_step = step;
    result.error = {static_cast<int>(GetLastError()), call};
    return result;
}

// "domain\name" split at its first backslash; no backslash: an empty domain.
bool log_on(const std::string& user, owned_handle& token) {
    auto slash = user.find('\\');
    std::string domain = slash == std::string::npos ? std::string() : user.substr(0, slash);
    std::string name = slash == std::string::npos ? user : user.substr(slash + 1);
    HANDLE logged_on = nullptr;
    // A service's account has no password to give.
    if (!LogonUserA(name.c_str(), domain.c_str(), nullptr, LOGON32_LOGON_SERVICE,
                    LOGON32_PROVIDER_DEFAULT, &logged_on))
        return false;
    token.reset(logged_on);
    return true;
}

// No child opens a visible window; its standard handles are ours, the pipes'
// child ends, or none at all.
STARTUPINFOA startup_info(const launch_request& request) {
    STARTUPINFOA start{};
    start.cb = sizeof start;
    start.dwFlags = STARTF_USESHOWWINDOW;
    start.wShowWindow = SW_HIDE;
    if (request.stdio == stdio_source::none)
        return start;
    start.dwFlags |= STARTF_USESTDHANDLES;
    if (request.stdio == stdio_source::inherit) {
        start.hStdInput = GetStdHandle(STD_INPUT_HANDLE);
        start.hStdOutput = GetStdHandle(STD_OUTPUT_HANDLE);
        start.hStdError = GetStdHandle(STD_ERROR_HANDLE);
        return start;
    }
    start.hStdInput = request.stdio_handles[0];
    start.hStdOutput = request.stdio_handles[1];
    start.hStdError = request.stdio_handles[2];
    for (HANDLE end : {start.hStdInput, start.hStdOutput, start.hStdError})
        SetHandleInformation(end, HANDLE_FLAG_INHERIT, HANDLE_FLAG_INHERIT);
    return start;
}

} // namespace

launch_result launch_child(const launch_request& request) {
    owned_handle token;
    if (!request.user.empty() && !log_on(request.user, token))
        return failed_launch(launch_step::logon, "LogonUserA");
    STARTUPINFOA start = startup_info(request);
    // A child with neither pipes nor handles of ours inherits nothing.
    BOOL inherit = request.stdio != stdio_source::none || request.ipc != no_handle;
    std::string command_line = request.command_line;
    PROCESS_INFORMATION created{};
    if (!CreateProcessAsUserA(token.get(), request.executable.c_str(), command_line.data(), nullptr,
                              nullptr, inherit, 0, nullptr,
                              request.working_directory.empty() ? nullptr
                                                                : request.working_directory.c_str(),
                              &start, &created))
        return failed_launch(launch_step::create, "CreateProcessAsUserA");
    CloseHandle(created.hThread);
    launch_result result;
    result.pid = static_cast<int>(created.dwProcessId);
    result.process.reset(created.hProcess);
    return result;
}

// The wait completes only once the process has ended.
exit_status exit_status_of(exit_watch& watch) {
    DWORD code = 0;
    if (!GetExitCodeProcess(watch.native_handle(), &code))
        return {true, true, 0, {static_cast<int>(GetLastError()), "GetExitCodeProcess"}};
    return {true, true, static_cast<int>(code), {}};
}

os_error end_by_force(exit_watch& watch) {
    if (!TerminateProcess(watch.native_handle(), 0))
        return {static_cast<int>(GetLastError()), "TerminateProcess"};
    return {};
}

// A console's job control never stops a child here.
bool continue_if_stopped(exit_watch&) {
    return false;
}

void end_now(owned_handle& process) {
    // A child we can't watch is one we never started as far as anyone knows:
    // a failed kill leaves nothing better to do than let the handle go.
    (void)TerminateProcess(process.get(), 0);
    process.reset();
}

} // namespace torvad::platform
