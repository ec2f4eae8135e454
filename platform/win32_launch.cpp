// Launching, watching and ending children on Windows: a logon for another
// account, CreateProcessAsUserA with a command line that gives back exactly
// the items asked for, the handles the child is to have and no others, and
// the process handle as what tells the child's end.
#include <windows.h>

#include <userenv.h>

#include <algorithm>
#include <cctype>
#include <memory>

#include "platform/platform.hpp"

namespace torvad::platform {

namespace {

launch_result failed_launch(launch_step step, const char* call) {
    launch_result result;
    result.failed_step = step;
    result.error = {static_cast<int>(GetLastError()), call};
    return result;
}

// One item as the C runtime reads it back whole: in double quotes, a quote
// behind a backslash, and a run of backslashes doubled where it stands before
// a quote or the closing quote. The item's bytes are permitted as they are;
// were a backslash left single there, it would end the item early and let
// the rest of it pass as arguments nobody permitted.
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

// The runtime reads the program's name up to its closing quote, without
// escapes; it is an absolute path, which can hold no quote.
std::string command_line_of(const std::vector<std::string>& argv) {
    std::string line = '"' + argv[0] + '"';
    for (std::size_t i = 1; i < argv.size(); ++i) {
        line += ' ';
        append_item(line, argv[i]);
    }
    return line;
}

// Windows runs a batch file through cmd.exe, whose reading of a command line
// no quoting makes safe (% and ! expand even within quotes): such a program
// is refused rather than handed text that could run something else. The
// name is taken as the file system takes it, trailing dots and blanks gone.
bool is_batch_file(const std::string& path) {
    std::string name = path.substr(0, path.find_last_not_of(". ") + 1);
    std::string extension = name.size() >= 4 ? name.substr(name.size() - 4) : std::string();
    std::transform(extension.begin(), extension.end(), extension.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return extension == ".bat" || extension == ".cmd";
}

bool log_on(const std::string& user, owned_handle& token) {
    auto [domain, name] = split_account(user);
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
void set_standard_handles(const launch_request& request, STARTUPINFOA& start) {
    start.dwFlags = STARTF_USESHOWWINDOW;
    start.wShowWindow = SW_HIDE;
    if (request.stdio == stdio_source::none)
        return;
    start.dwFlags |= STARTF_USESTDHANDLES;
    if (request.stdio == stdio_source::inherit) {
        start.hStdInput = GetStdHandle(STD_INPUT_HANDLE);
        start.hStdOutput = GetStdHandle(STD_OUTPUT_HANDLE);
        start.hStdError = GetStdHandle(STD_ERROR_HANDLE);
        return;
    }
    start.hStdInput = request.stdio_handles[0];
    start.hStdOutput = request.stdio_handles[1];
    start.hStdError = request.stdio_handles[2];
}

// What the child inherits, each once: the pipes' child ends and its ipc end,
// made inheritable here, and those of our own standard handles that are
// inheritable already (a console's may not be real handles at all).
std::vector<HANDLE> inherited_handles(const launch_request& request, const STARTUPINFOA& start,
                                      os_error& error) {
    std::vector<HANDLE> handles;
    bool ours = request.stdio == stdio_source::inherit;
    for (HANDLE handle : {start.hStdInput, start.hStdOutput, start.hStdError, request.ipc}) {
        if (handle == nullptr || handle == INVALID_HANDLE_VALUE ||
            std::find(handles.begin(), handles.end(), handle) != handles.end())
            continue;
        DWORD flags = 0;
        if (ours && handle != request.ipc) {
            if (GetHandleInformation(handle, &flags) && (flags & HANDLE_FLAG_INHERIT) != 0)
                handles.push_back(handle);
            continue;
        }
        if (!SetHandleInformation(handle, HANDLE_FLAG_INHERIT, HANDLE_FLAG_INHERIT)) {
            error = {static_cast<int>(GetLastError()), "SetHandleInformation"};
            return {};
        }
        handles.push_back(handle);
    }
    return handles;
}

// The attribute list that names the only handles a child inherits: with
// inheritance merely switched on, it would get every inheritable handle of
// ours, other children's pipe ends among them.
struct handle_list {
    std::unique_ptr<char[]> storage;
    LPPROC_THREAD_ATTRIBUTE_LIST list = nullptr;
    ~handle_list() {
        if (list != nullptr)
            DeleteProcThreadAttributeList(list);
    }
};

os_error make_handle_list(std::vector<HANDLE>& handles, handle_list& made) {
    SIZE_T size = 0;
    InitializeProcThreadAttributeList(nullptr, 1, 0, &size);
    if (size == 0)
        return {static_cast<int>(GetLastError()), "InitializeProcThreadAttributeList"};
    made.storage.reset(new char[size]);
    auto list = reinterpret_cast<LPPROC_THREAD_ATTRIBUTE_LIST>(made.storage.get());
    if (!InitializeProcThreadAttributeList(list, 1, 0, &size))
        return {static_cast<int>(GetLastError()), "InitializeProcThreadAttributeList"};
    made.list = list;
    if (!UpdateProcThreadAttribute(list, 0, PROC_THREAD_ATTRIBUTE_HANDLE_LIST, handles.data(),
                                   handles.size() * sizeof(HANDLE), nullptr, nullptr))
        return {static_cast<int>(GetLastError()), "UpdateProcThreadAttribute"};
    return {};
}

// Another account's child gets that account's own variables, not ours.
struct environment_block {
    void* block = nullptr;
    ~environment_block() {
        if (block != nullptr)
            DestroyEnvironmentBlock(block);
    }
};

} // namespace

launch_result launch_child(const launch_request& request) {
    if (is_batch_file(request.executable)) {
        SetLastError(ERROR_BAD_EXE_FORMAT);
        return failed_launch(launch_step::refused, "batch file");
    }
    owned_handle token;
    if (!request.user.empty() && !log_on(request.user, token))
        return failed_launch(launch_step::logon, "LogonUserA");
    STARTUPINFOEXA start{};
    set_standard_handles(request, start.StartupInfo);
    os_error error;
    std::vector<HANDLE> handles = inherited_handles(request, start.StartupInfo, error);
    if (error)
        return {0, {}, launch_step::create, error};
    handle_list inherited;
    if (!handles.empty())
        error = make_handle_list(handles, inherited);
    if (error)
        return {0, {}, launch_step::create, error};
    start.lpAttributeList = inherited.list;
    start.StartupInfo.cb = inherited.list != nullptr ? sizeof start : sizeof start.StartupInfo;
    DWORD flags = inherited.list != nullptr ? EXTENDED_STARTUPINFO_PRESENT : 0;
    // At a console the keyboard's Ctrl-C is for us alone: a child in a group
    // of its own starts with it switched off, and ends through its sigterm.
    if (request.own_process_group)
        flags |= CREATE_NEW_PROCESS_GROUP;
    environment_block environment;
    // Another account gets its own desktop, not ours, and its own environment.
    char own_desktop[] = "";
    if (token.valid()) {
        start.StartupInfo.lpDesktop = own_desktop;
        flags |= CREATE_UNICODE_ENVIRONMENT;
        if (!CreateEnvironmentBlock(&environment.block, token.get(), FALSE))
            return failed_launch(launch_step::create, "CreateEnvironmentBlock");
    }
    std::string command_line = command_line_of(request.argv);
    PROCESS_INFORMATION created{};
    if (!CreateProcessAsUserA(token.get(), request.executable.c_str(), command_line.data(), nullptr,
                              nullptr, !handles.empty(), flags, environment.block,
                              request.working_directory.empty() ? nullptr
                                                                : request.working_directory.c_str(),
                              &start.StartupInfo, &created))
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
