#include "entry/handover.hpp"

#include <cstdlib>

#include "entry/first_line.hpp"
#include "platform/platform.hpp"

namespace torvad {

namespace {

const char* const task_name = "startts";
// The service the job starts: always this one, also for another family.
const char* const started_service = "torvaSentryServer";

enum class answer { version, silent, not_started };

answer ask_service_program(const std::string& core_name) {
    first_line_search search("version");
    auto end = platform::run_program(
        core_name, {"-h"}, platform::returned_stream::error,
        [&search](const char* data, std::size_t size) { search.feed(data, size); });
    if (end.error != 0)
        return answer::not_started;
    return search.found() ? answer::version : answer::silent;
}

// Both runs of the tool must have started before we may end; their exit codes
// tell us nothing we could act on.
bool schedule_with_task_scheduler(const std::string& tool, const std::string& service_name,
                                  const std::string& core_path) {
    const std::vector<std::string> create = {
        "/create", "/f",  "/tn",    task_name, "/sc",
        "onstart", "/ru", "system", "/tr",     task_action(service_name, core_path)};
    auto none = platform::returned_stream::none;
    return platform::run_program(tool, create, none, {}).error == 0 &&
           platform::run_program(tool, {"/run", "/tn", task_name}, none, {}).error == 0;
}

// Where no task scheduler is found the system schedules the same job its own way.
bool hand_over(const std::string& service_name, const std::string& core_path) {
    std::string tool = platform::search_path("schtasks");
    if (!tool.empty())
        return schedule_with_task_scheduler(tool, service_name, core_path);
    return platform::schedule_handover_job(service_name, core_path);
}

} // namespace

std::string task_action(const std::string& service_name, const std::string& core_path) {
    return R"(powershell -command "start-sleep -s 10; sc.exe config )" + service_name +
           R"( binpath= \\")" + core_path + R"(\\"; sc.exe start )" + started_service +
           R"(; schtasks.exe /delete /f /tn )" + task_name + R"(")";
}

void check_service_program(const std::string& service_name) {
    try {
        std::string core_name = std::string("core") + platform::exe_suffix;
        if (ask_service_program(core_name) != answer::silent)
            return;
        // getcwd gives a path with nothing to normalise, so this is the plain
        // absolute name; without a current directory there is nothing to hand over.
        platform::os_error error;
        std::string core_path = platform::absolute_path(core_name, error);
        if (!error && hand_over(service_name, core_path))
            std::exit(1);
    } catch (...) {
        // Whatever failed, the check counts as passed and the start goes on.
    }
}

} // namespace torvad
