#include "entry/product_start.hpp"

#include <boost/filesystem/path.hpp>

#include "daemon/daemon.hpp"
#include "entry/first_line.hpp"
#include "entry/handover.hpp"
#include "platform/platform.hpp"
#include "process/process.hpp"

namespace torvad {

namespace {

const char* const patterns_name = "exec.patterns";

// An account name is a few hundred bytes at most (a domain and a user name);
// a longer first line is no account, and cut here the logon refuses it just as
// it would the whole line, while a script printing megabytes costs us nothing.
constexpr std::size_t account_cap = 4096;

// Runs scripts/init.ps1 through the interpreter on PATH, keeping the first
// line of its output in account.
platform::program_end run_init_script(first_line_reader& account) {
    const std::vector<std::string>& wrapper = platform::script_wrapper();
    std::string interpreter = platform::search_path(wrapper[0]);
    if (interpreter.empty())
        return {.error = platform::error_not_found};
    platform::os_error error;
    auto script =
        boost::filesystem::path(platform::absolute_path(".", error)) / "scripts" / "init.ps1";
    if (error)
        return {.error = error.code};
    std::vector<std::string> args(wrapper.begin() + 1, wrapper.end());
    args.insert(args.end(), {script.string(), "."});
    return platform::run_program(
        interpreter, args, platform::returned_stream::output,
        [&account](const char* data, std::size_t size) { account.feed(data, size); });
}

// The account the init script names for core, or empty: core then runs under
// our own account. A failing script never stops the server, it only says so.
std::string core_account(daemon& supervisor) {
    try {
        first_line_reader account(account_cap, true);
        platform::program_end end = run_init_script(account);
        if (end.error == 0 && end.exit_code == 0)
            return account.text();
        if (end.error == 0) {
            supervisor.log_error("server init script exited with '%d', will not deelevate.",
                                 end.exit_code);
            return {};
        }
    } catch (...) {
    }
    supervisor.log_error("failed to execute server init script, will not deelevate.");
    return {};
}

} // namespace

bool start_server_family(daemon& supervisor, const std::string& family) {
    std::string service_name = family + "Server";
    // Decided before the script runs: a file the script makes counts next time.
    bool patterns_present = platform::path_exists(patterns_name);
    if (check_service_program(service_name) == service_check::handed_over)
        return false;
    std::string user = core_account(supervisor);
    process::create(supervisor, {.command = {"./core"},
                                 .user = std::move(user),
                                 .working_directory = ".",
                                 .persistent = true,
                                 .stdio_mode = stdio_inherit});
    supervisor.configure(service_name, patterns_present ? patterns_name : nullptr);
    return true;
}

void start_web_service(daemon& supervisor) {
    process::create(supervisor, {.command = {"./wfe"},
                                 .user = "NT Authority\\LocalService",
                                 .working_directory = ".",
                                 .persistent = true,
                                 .stdio_mode = stdio_inherit});
    supervisor.configure("WebService", nullptr);
}

} // namespace torvad
