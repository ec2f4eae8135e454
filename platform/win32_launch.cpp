// Launching, watching and ending children on Windows: a logon for another
// account, CreateProcessAsUserW with a command line that gives back exactly
// the items asked for, the handles the child is to have and no others, and
// the process handle as what tells the child's end.
#include <windows.h>

#include <userenv.h>

#include <algorithm>
#include <cwctype>
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

// Text of the system's code page in UTF-16, whole or not at all: a byte that
// is no character there is refused rather than guessed at.
bool to_wide(const std::string& text, std::wstring& wide) {
    wide.clear();
    if (text.empty())
        return true;
    int size = MultiByteToWideChar(CP_ACP, MB_ERR_INVALID_CHARS, text.data(),
                                   static_cast<int>(text.size()), nullptr, 0);
    if (size == 0)
        return false;
    wide.resize(static_cast<std::size_t>(size));
    return MultiByteToWideChar(CP_ACP, MB_ERR_INVALID_CHARS, text.data(),
                               static_cast<int>(text.size()), wide.data(), size) == size;
}

// One item as the C runtime reads it back whole: in double quotes, a quote
// behind a backslash, and a run of backslashes doubled where it stands before
// a quote or the closing quote. The item's bytes are permitted as they are;
// were a backslash left single there, it would end the item early and let
// the rest of it pass as arguments nobody permitted. The quoting counts
// characters, never bytes: on a double-byte code page the second byte of a
// character may be a backslash that the child never sees as one.
void append_item(std::wstring& line, const std::wstring& item) {
    line += L'"';
    std::size_t backslashes = 0;
    for (wchar_t c : item) {
        if (c == L'\\') {
            ++backslashes;
            continue;
        }
        line.append(c == L'"' ? 2 * backslashes + 1 : backslashes, L'\\');
        line += c;
        backslashes = 0;
    }
    line.append(2 * backslashes, L'\\');
    line += L'"';
}

// The runtime reads the program's name up to its closing quote, without
// escapes; it is an absolute path, which can hold no quote. False when an
// item is no text of the system's code page.
bool command_line_of(const std::vector<std::string>& argv, std::wstring& line) {
    std::wstring item;
    if (!to_wide(argv[0], item))
        return false;
    line = L'"' + item + L'"';
    for (std::size_t i = 1; i < argv.size(); ++i) {
        if (!to_wide(argv[i], item))
            return false;
        line += L' ';
        append_item(line, item);
    }
    return true;
}

bool has_batch_extension(std::wstring name) {
    name.erase(name.find_last_not_of(L". ") + 1);
    std::wstring extension = name.size() >= 4 ? name.substr(name.size() - 4) : std::wstring();
    std::transform(extension.begin(), extension.end(), extension.begin(),
                   [](wchar_t c) { return static_cast<wchar_t>(std::towlower(c)); });
    return extension == L".bat" || extension == L".cmd";
}

// Windows runs a batch file through cmd.exe, whose reading of a command line
// no quoting makes safe (% and ! expand even within quotes): such a program
// is refused rather than handed text that could run something else. The name
// is taken as the file system takes it: a stream named behind a colon beyond
// the drive ("x.bat::$DATA") is the file itself, trailing dots and blanks
// go, and a short name stands for the long one.
bool is_batch_file(const std::wstring& path) {
    std::size_t drive = path.starts_with(L"\\\\?\\") || path.starts_with(L"\\\\.\\") ? 4 : 0;
    if (path.size() > drive + 1 && path[drive + 1] == L':')
        drive += 2;
    std::wstring file = path.substr(0, path.find(L':', drive));
    std::wstring long_name(32768, L'\0');
    DWORD size =
        GetLongPathNameW(file.c_str(), long_name.data(), static_cast<DWORD>(long_name.size()));
    long_name.resize(size < long_name.size() ? size : 0);
    return has_batch_extension(file) || has_batch_extension(long_name);
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
void set_standard_handles(const launch_request& request, STARTUPINFOW& start) {
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
std::vector<HANDLE> inherited_handles(const launch_request& request, const STARTUPINFOW& start,
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
    std::wstring executable, directory, command_line;
    if (!to_wide(request.executable, executable) ||
        !to_wide(request.working_directory, directory) ||
        !command_line_of(request.argv, command_line))
        return failed_launch(launch_step::unconvertible, "MultiByteToWideChar");
    if (is_batch_file(executable)) {
        SetLastError(ERROR_BAD_EXE_FORMAT);
        return failed_launch(launch_step::refused, "batch file");
    }
    owned_handle token;
    if (!request.user.empty() && !log_on(request.user, token))
        return failed_launch(launch_step::logon, "LogonUserA");
    STARTUPINFOEXW start{};
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
    // Our own account's child inherits our environment, which the system
    // keeps in UTF-16; another account gets its own, also in UTF-16, and its
    // own desktop, not ours.
    environment_block environment;
    wchar_t own_desktop[] = L"";
    if (token.valid()) {
        start.StartupInfo.lpDesktop = own_desktop;
        flags |= CREATE_UNICODE_ENVIRONMENT;
        if (!CreateEnvironmentBlock(&environment.block, token.get(), FALSE))
            return failed_launch(launch_step::create, "CreateEnvironmentBlock");
    }
    PROCESS_INFORMATION created{};
    if (!CreateProcessAsUserW(token.get(), executable.c_str(), command_line.data(), nullptr,
                              nullptr, !handles.empty(), flags, environment.block,
                              directory.empty() ? nullptr : directory.c_str(), &start.StartupInfo,
                              &created))
        return failed_launch(launch_step::create, "CreateProcessAsUserW");
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
