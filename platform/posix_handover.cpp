// The hand-over's job where the task scheduler is missing: a transient systemd
// timer that fires once, 10 s from now, and runs a shell as root. The shell
// points the service's ExecStart at core with a drop-in under /run (gone at
// the next boot, like a one-time task), reloads, and starts the service. core
// is then a plain service of the manager: it need not speak the notify
// protocol that torvad speaks.
#include "platform/platform.hpp"

namespace torvad::platform {

namespace {

// A word of a unit file: quoted, with the escapes of the unit syntax and of
// its specifier and variable expansion.
std::string unit_file_word(const std::string& text) {
    std::string word = "\"";
    for (char c : text) {
        if (c == '\\' || c == '"')
            word += '\\';
        if (c == '%' || c == '$')
            word += c;
        if (c == '\n')
            word += "\\n";
        else
            word += c;
    }
    return word + "\"";
}

std::string shell_word(const std::string& text) {
    std::string word = "'";
    for (char c : text)
        word += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return word + "'";
}

// systemd expands variables in the command line it runs; "$$" is a plain "$".
std::string escape_variables(const std::string& text) {
    std::string escaped;
    for (char c : text)
        escaped += c == '$' ? std::string("$$") : std::string(1, c);
    return escaped;
}

std::string job_script(const std::string& service_name, const std::string& core_path) {
    std::string directory = "/run/systemd/system/" + service_name + ".service.d";
    // The heredoc's quoted delimiter keeps the shell off the unit text; no
    // line of it can equal the delimiter, as the path's line feeds are escaped.
    return "set -e\n"
           "mkdir -p " +
           shell_word(directory) + "\ncat > " + shell_word(directory + "/handover.conf") +
           " <<'END_OF_DROP_IN'\n"
           "[Service]\n"
           "Type=exec\n"
           "ExecStart=\n"
           "ExecStart=" +
           unit_file_word(core_path) +
           "\nEND_OF_DROP_IN\n"
           "systemctl daemon-reload\n"
           "systemctl start torvaSentryServer\n";
}

// The timer's default accuracy is a minute; the job is meant for 10 s.
// Without a description the manager takes the whole script for one, and
// its lines break the transient unit's file at every reload.
std::vector<std::string> systemd_run_arguments(const std::string& service_name,
                                               const std::string& core_path) {
    return {"--unit=startts",
            "--description=hand the service over to core",
            "--collect",
            "--quiet",
            "--on-active=10",
            "--timer-property=AccuracySec=100ms",
            "--uid=root",
            "/bin/sh",
            "-c",
            escape_variables(job_script(service_name, core_path))};
}

} // namespace

bool schedule_system_job(const std::string& service_name, const std::string& core_path) {
    std::string tool = search_path("systemd-run");
    return !tool.empty() && run_program(tool, systemd_run_arguments(service_name, core_path),
                                        returned_stream::none, {})
                                    .error == 0;
}

} // namespace torvad::platform
