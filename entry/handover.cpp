#include "entry/handover.hpp"

#include "entry/first_line.hpp"
#include "platform/platform.hpp"

namespace torvad {

namespace {

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

} // namespace

service_check check_service_program(const std::string& service_name) {
    try {
        std::string core_name = std::string("core") + platform::exe_suffix;
        if (ask_service_program(core_name) != answer::silent)
            return service_check::go_on;
        // getcwd gives a path with nothing to normalise, so this is the plain
        // absolute name; without a current directory there is nothing to hand over.
        platform::os_error error;
        std::string core_path = platform::absolute_path(core_name, error);
        if (!error && platform::schedule_handover(service_name, core_path))
            return service_check::handed_over;
    } catch (...) {
        // Whatever failed, the check counts as passed and the start goes on.
    }
    return service_check::go_on;
}

} // namespace torvad
