// The product on Linux: the service path's reports to the manager, and the
// start of the server family or web service with stubs on PATH that record
// their arguments, the hand-over's systemd-run among them.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <unistd.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

// A product directory ("my product", a blank in its path) and a bin directory
// that is all of torvad's PATH; stubs record their arguments under log/.
struct installation {
    installation() {
        for (const char* sub : {"/my product/scripts", "/bin", "/log"})
            std::filesystem::create_directories(root.path + sub);
    }
    // A shell script; `body` runs with the stub's arguments appended to log/name.
    void stub(const std::string& path, const std::string& body) {
        std::string name = std::filesystem::path(path).filename();
        std::ofstream(root.path + path)
            << "#!/bin/sh\nPATH=/usr/bin:/bin\nprintf '%s\\n' \"$@\" --- >> '" << root.path
            << "/log/" << name << "'\n"
            << body << "\n";
        std::filesystem::permissions(root.path + path, std::filesystem::perms(0755));
    }
    std::string log(const std::string& name) { return read_file(root.path + "/log/" + name); }
    scratch_dir root;
    std::string product = root.path + "/my product";
    std::vector<std::string> env = {"PATH=" + root.path + "/bin"};
};

const char* const answers_version = "[ \"$1\" = -h ] && { echo 'core version 7' >&2; exit 0; }\n"
                                    "echo core runs as $(id -un)";
const char* const core_ran = "?core runs as";

} // namespace

// The status text follows the state, naming the persistent children. The
// PID file goes at the end.
TEST(product, service_path_reports_its_states_and_ends_children_in_order) {
    scratch_dir dir;
    const std::vector<std::string> files = {"-p", dir.path + "/pid", "-d", dir.path};
    const char* const running_0 = "@READY=1\nSTATUS=running, 0 children";
    const char* const running_1 = "@READY=1\nSTATUS=running, 1 child";
    const char* const stopping_0 = "@STOPPING=1\nSTATUS=stopping, waiting for 0 children";
    const char* const stopping_1 = "@STOPPING=1\nSTATUS=stopping, waiting for 1 child";
    const options service{.terminal = false, .manager = true, .where = systems::linux_only};
    options first = service;
    first.first_process = first.as_root = true;
    first.shell = "mount --make-rprivate / && mount -t proc p /proc";
    run_rows({
        // a stray SIGUSR2 changes nothing; a SIGTERM after the end can't kill
        // us; the manager's socket is ours, not the child's
        {child({"fds"}, files),
         {"@STATUS=starting", running_1, "&successfully started", "&child: ready", "!USR2", "!TERM",
          stopping_1, "?child: sigterm", "?'test_child' exited with 0x0.", "@STATUS=stopped",
          "!TERM", "=0", "-\x1b", "&child: fds clean", "-notify socket", "@"},
         service},
        // a stop during the start: the first run returns at once, the second
        // still ends the child through its sigterm
        {child({"peer"}, files),
         {"@STATUS=starting", "!TERM", running_1, stopping_1, "?child: sigterm", "@STATUS=stopped",
          "=0", "@"},
         service},
        // a persistent channel counts; the order of the two ends at the stop is open
        {child({"execute", "1", child_binary, "peer"}, files),
         {"@STATUS=starting", running_1, "@STATUS=running, 2 children", "!TERM",
          "@STOPPING=1\nSTATUS=stopping, waiting for 2 children", "=0", "@*"},
         service},
        {files,
         {"@STATUS=starting", "?successfully started", running_0, stopping_0, "?stopping torvad",
          "@STATUS=stopped", "=0", "@"},
         service},
        {child({"exit", "0"}, files),
         {"@STATUS=starting", running_1, "?exited with 0x0.", stopping_0, "@STATUS=stopped", "=0",
          "@"},
         service},
        // as a container's first process, with the runtime's socket: the same
        // reports, and the orphans that come to it are reaped
        {child({"orphans", "2", dir.path + "/orphaned"}),
         {"@STATUS=starting", running_1, "?child: orphans made", "?'test_child' exited with 0x3.",
          "?child: ready", "&child: orphan adopted by torvad\n", "z", "!TERM", stopping_1,
          "?child: sigterm", "@STATUS=stopped", "=0", "@"},
         first},
    });
    EXPECT_FALSE(std::filesystem::exists(dir.path + "/pid"));
}

// core runs under the account its init script names (the stub powershell's
// output), and wins over wfe; wfe alone runs as the local service account and
// runs no script.
TEST(product, the_program_here_starts_with_its_account) {
    if (!holds_here(systems::linux_only))
        GTEST_SKIP() << "the service manager and shell-script stubs are Linux's";
    struct row {
        const char* script; // the stub powershell's body; none when null
        std::vector<std::string> steps, programs = {"core"};
        bool beside = false; // a copy of torvad in the product, run without -d
    };
    const row rows[] = {
        {"printf 'no_such\\ruser\\r\\nnobody\\n'",
         {"?Failed to logon as user 'no_suchuser': error 2", "=0", "-deelevate"}},
        {"echo root; exit 3",
         {"?server init script exited with '3', will not deelevate.", core_ran, "=0"}},
        {nullptr, {"?failed to execute server init script, will not deelevate.", core_ran, "=0"}},
        // the service manager's socket is kept from the script, whose account core runs under
        {"echo ${NOTIFY_SOCKET}nobody",
         {"?core runs as nobody", "=0", "-deelevate", "-failed to open patterns"}},
        // exec.patterns there (a socket file) but unreadable
        {"printf '\\r\\r\\n'",
         {core_ran, "=0", "-Failed to logon", "&failed to open patterns file 'exec.patterns'"}},
        // a megabyte on one line, then more: cut, never blocking
        {"head -c 1048576 /dev/zero | tr '\\0' x; echo; seq 100000",
         {"?Failed to logon as user 'xxxxxxxx", "=0"}},
        // core wins over wfe; without -d the product is the one beside torvad's own file
        {"", {core_ran, "=0", "-wfe runs"}, {"core", "wfe"}, true},
        {"",
         geteuid() == 0
             ? std::vector<std::string>{"?wfe runs as nobody", "?'wfe' exited with 0x0.", "=0"}
             : std::vector<std::string>{"?Failed to logon as user 'NT Authority\\LocalService'",
                                        "=0"},
         {"wfe"}},
    };
    for (const auto& [script, steps, programs, beside] : rows) {
        SCOPED_TRACE(script ? script : "no powershell");
        installation site;
        for (const auto& program : programs)
            site.stub("/my product/" + program,
                      program == "core" ? answers_version : "echo wfe runs as $(id -un)");
        if (script)
            site.stub("/bin/powershell", script);
        if (steps.back().starts_with("&failed to open patterns"))
            close(bound_datagram_socket(site.product + "/exec.patterns"));
        site.env.push_back("NOTIFY_SOCKET=/run/x");
        options how{.env = site.env};
        if (beside)
            std::filesystem::copy(torvad_binary, how.program = site.product + "/torvad");
        run_scenario(beside ? std::vector<std::string>{}
                            : std::vector<std::string>{"-d", site.product},
                     steps, how);
        EXPECT_EQ(site.log("powershell"),
                  script && programs[0] == "core"
                      ? "-noprofile\n-noninteractive\n-executionpolicy\nbypass\n-file\n" +
                            site.product + "/./scripts/init.ps1\n.\n---\n"
                      : "");
    }
}

// core stays silent on "version": the service is handed over to it by a
// transient systemd timer, its path escaped for the unit file, and torvad
// ends with 1, leaving its PID file.
TEST(product, silent_core_hands_the_service_over_and_ends_with_1) {
    if (!holds_here(systems::linux_only))
        GTEST_SKIP() << "shell-script stubs are Linux's";
    installation site;
    const std::string product = "/a \"b\\ $c%", pid = site.root.path + "/pid";
    std::filesystem::create_directories(site.root.path + product);
    site.stub(product + "/core", "echo usage >&2");
    site.stub("/bin/systemd-run", "");
    run_scenario({"-f", "acme", "-p", pid, "-d", site.root.path + product},
                 {"=1", "P" + pid, "-successfully"}, {.env = site.env});
    const std::string unit = "'/run/systemd/system/acmeServer.service.d";
    EXPECT_EQ(site.log("systemd-run"),
              "--unit=startts\n--description=hand the service over to core\n--collect\n--quiet\n"
              "--on-active=10\n--timer-property=AccuracySec=100ms\n--uid=root\n/bin/sh\n-c\n"
              "set -e\nmkdir -p " +
                  unit + "'\ncat > " + unit +
                  "/handover.conf' <<'END_OF_DROP_IN'\n"
                  "[Service]\nType=exec\nExecStart=\nExecStart=\"" +
                  site.root.path +
                  R"(/a \"b\\ $$$$c%%/core")"
                  "\nEND_OF_DROP_IN\nsystemctl daemon-reload\n"
                  "systemctl start torvaSentryServer\n\n---\n");
}

// The Python peer: the demo's core in Python as the product's core (the
// patterns hold, it fails once, is ready once started again, ends at
// sigterm), and a child that checks its promises, then speaks through asyncio.
TEST(product, python_peer) {
    scratch_dir dir;
    const std::string source = SOURCE_DIR;
    std::filesystem::copy(source + "/examples/demo_core.py", dir.path + "/core");
    std::filesystem::copy(DEMO_PATTERNS, dir.path + "/exec.patterns");
    const options python{.env = {"PYTHONPATH=" + source + "/peer/python"},
                         .where = systems::linux_only};
    run_rows({
        {{"-r", "-d", dir.path},
         {"?core: supervised by torvad 1.1.21.0", "?failing once on purpose",
          "?starting 'core' again.", "?the product is ready.", "&core: 'uname -sr' says: Linux",
          "&'cat /etc/shadow' refused with status 13", "!INT",
          "?core: asked to stop, ending cleanly", "?'core' exited with 0x0.", "=0"},
         python},
        {{"-r", "--", "python3", source + "/tests/child/test_child.py"},
         {"?child: promises kept", "?child: version torvad 1.1.21.0",
          "?child: cat says: relayed through cat", "?child: cat ended with 0",
          "&the product is ready.", "!INT", "?child: sigterm", "?'python3' exited with 0x0.", "=0"},
         python},
    });
}
