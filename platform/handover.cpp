// The service's hand-over to core, the same on both systems where a task
// scheduler ("schtasks") is on PATH: a one-time job, run as the system account
// at the next start, that points the service at core and starts it.
#include "platform/platform.hpp"

namespace torvad::platform {

namespace {

const char* const task_name = "startts";
// The service the job starts: always this one, also for another family.
const char* const started_service = "torvaSentryServer";

// The job's action: after ten seconds, point the service at core, start it,
// and delete the task.
std::string task_action(const std::string& service_name, const std::string& core_path) {
    return R"(powershell -command "start-sleep -s 10; sc.exe config )" + service_name +
           R"( binpath= \\")" + core_path + R"(\\"; sc.exe start )" + started_service +
           R"(; schtasks.exe /delete /f /tn )" + task_name + R"(")";
}

// Both runs of the tool must have started before we may end; their exit codes
// tell us nothing we could act on.
bool schedule_with_task_scheduler(const std::string& tool, const std::string& service_name,
                                  const std::string& core_path) {
    const std::vector<std::string> create = {
        "/create", "/f",  "/tn",    task_name, "/sc",
        "onstart", "/ru", "system", "/tr",     task_action(service_name, core_path)};
    auto none = returned_stream::none;
    return run_program(tool, create, none, {}).error == 0 &&
           run_program(tool, {"/run", "/tn", task_name}, none, {}).error == 0;
}

} // namespace

bool schedule_handover(const std::string& service_name, const std::string& core_path) {
    std::string tool = search_path("schtasks");
    if (!tool.empty())
        return schedule_with_task_scheduler(tool, service_name, core_path);
    // Where no task scheduler is found the system schedules the same job its own way.
    return schedule_system_job(service_name, core_path);
}

} // namespace torvad::platform
