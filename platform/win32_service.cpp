// The service control manager on Windows: the dispatcher on our first thread,
// the service's main on the thread it makes, and the status record that
// reports the four states.
#include <windows.h>

#include "platform/platform.hpp"

namespace torvad::platform {

namespace {

// What the dispatcher's callbacks need; set before the dispatcher starts.
std::string service_name;
std::function<void()> service_body;
std::function<void()> stop_request;
SERVICE_STATUS_HANDLE status_handle = nullptr;

// Runs on the dispatcher's thread, ours; only stop and shutdown mean anything.
void WINAPI control_handler(DWORD control) {
    if (control == SERVICE_CONTROL_STOP || control == SERVICE_CONTROL_SHUTDOWN)
        stop_request();
}

void WINAPI service_main(DWORD, LPSTR*) {
    status_handle = RegisterServiceCtrlHandlerA(service_name.c_str(), control_handler);
    // Without a handle there is nothing to report to: nothing is started.
    if (status_handle == nullptr)
        return;
    service_body();
}

} // namespace

// No signal can stop a service: its stop comes as a control.
os_error hold_stop_requests() {
    return {};
}

bool run_service_dispatcher(const std::string& name, const std::function<void()>& body,
                            const std::function<void()>& on_stop) {
    service_name = name;
    service_body = body;
    stop_request = on_stop;
    SERVICE_TABLE_ENTRYA table[] = {{service_name.data(), service_main}, {nullptr, nullptr}};
    return StartServiceCtrlDispatcherA(table) != 0;
}

namespace {

// A pending start names a checkpoint that grows, and how long until the next.
DWORD start_checkpoint = 0;

os_error set_status(service_state state) {
    static const DWORD states[] = {SERVICE_START_PENDING, SERVICE_RUNNING, SERVICE_STOP_PENDING,
                                   SERVICE_STOPPED};
    SERVICE_STATUS status{};
    status.dwServiceType = SERVICE_WIN32_OWN_PROCESS;
    status.dwCurrentState = states[static_cast<int>(state)];
    status.dwControlsAccepted = SERVICE_ACCEPT_STOP | SERVICE_ACCEPT_SHUTDOWN;
    if (state == service_state::start_pending) {
        status.dwCheckPoint = ++start_checkpoint;
        status.dwWaitHint = 3000;
    }
    if (!SetServiceStatus(status_handle, &status))
        return {static_cast<int>(GetLastError()), "SetServiceStatus"};
    return {};
}

} // namespace

os_error report_service_state(service_state state, std::size_t) {
    return set_status(state);
}

os_error report_start_progress() {
    return set_status(service_state::start_pending);
}

// The record has no text to name the children in.
os_error report_service_children(std::size_t) {
    return {};
}

} // namespace torvad::platform
