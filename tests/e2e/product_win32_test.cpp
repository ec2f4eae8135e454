// The product on Windows: the server family's start, with copies of the test
// child standing in for core.exe, powershell.exe and schtasks.exe (each acts
// by its name and logs the arguments its command line held), and the event
// log, whose records Wine writes to its debug channel.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

// A product directory ("my product", a blank in its path) and a folder of
// tool stand-ins in front of PATH.
struct installation {
    installation() {
        for (const char* sub : {"/my product/scripts", "/bin"})
            std::filesystem::create_directories(root.path + sub);
        std::filesystem::copy(std::string(child_binary) + ".exe", product() + "/core.exe");
    }
    void tool(const std::string& name) {
        std::filesystem::copy(std::string(child_binary) + ".exe", root.path + "/bin/" + name);
    }
    std::string product() const { return root.path + "/my product"; }
    std::string log(const std::string& name) const { return read_file(product() + "/" + name); }
    std::string path() const { return "PATH=" + windows_form(root.path + "/bin"); }
    // How the system writes the path back, as torvad passes it on.
    static std::string windows_form(std::string path) {
        std::replace(path.begin(), path.end(), '/', '\\');
        return path;
    }
    scratch_dir root;
};

} // namespace

// Wine can't run core under an account the script names: its LogonUserA
// hands out a token that no other call takes. So the rows here name none.
TEST(product, server_family_start_runs_the_init_script_then_core) {
    const std::pair<const char*, std::vector<std::string>> rows[] = {
        {"", {"-deelevate"}},
        {"\r\r\n", {"-deelevate", "-Failed to logon"}},
        {nullptr, {"+server init script exited with '1', will not deelevate."}},
    };
    for (const auto& [script, checks] : rows) {
        SCOPED_TRACE(script ? script : "no script");
        installation site;
        site.tool("powershell.exe");
        if (script)
            std::ofstream(site.product() + "/scripts/init.ps1", std::ios::binary) << script;
        // Ctrl-C reaches core too: it must be ready to ignore it.
        std::vector<std::string> steps = {"?child: ready", "!INT", "?child: sigterm",
                                          "?'core' exited with 0x0.", "=0"};
        steps.insert(steps.end(), checks.begin(), checks.end());
        run_scenario({"-d", site.product()}, steps, {.env = {site.path()}});
        EXPECT_EQ(site.log("powershell.log"),
                  "-noprofile -noninteractive -executionpolicy bypass -file \"" +
                      installation::windows_form(site.product()) + "\\.\\scripts\\init.ps1\" .\n");
    }
}

// core stays silent on "version": the service is handed over to it, the task
// scheduler gets its two command lines byte for byte, and torvad ends with 1,
// its PID file left.
TEST(product, silent_core_hands_the_service_over_and_ends_with_1) {
    installation site;
    site.tool("schtasks.exe");
    site.tool("powershell.exe");
    std::ofstream(site.product() + "/silent");
    std::string pid_file = site.root.path + "/pid";
    run_scenario({"-f", "acme", "-p", pid_file, "-d", site.product()},
                 {"=1", "-successfully started"}, {.terminal = false, .env = {site.path()}});
    EXPECT_TRUE(file_exists(pid_file));
    EXPECT_EQ(site.log("powershell.log"), "");
    std::string core = installation::windows_form(site.product()) + "\\core.exe";
    EXPECT_EQ(site.log("schtasks.log"),
              R"(/create /f /tn startts /sc onstart /ru system /tr "powershell -command )"
              R"(""start-sleep -s 10; sc.exe config acmeServer binpath= \\"")" +
                  core +
                  R"(\\""; sc.exe start torvaSentryServer; schtasks.exe /delete /f /tn startts""")"
                  "\n/run /tn startts\n");
}

// Wine's event log is a stub that writes the calls and each record's strings
// to its debug channels: the source is registered once, and a record has the
// level's type, category 0, event 0, no user, two strings and no data.
TEST(start, event_log_gets_one_record_per_line_with_source_and_type) {
    const std::string debug = "WINEDEBUG=fixme+advapi,+eventlog";
    const char* const record = ",0x0000,0x00000000,0000000000000000,0x0002,0x00000000,";
    run_scenario(
        {"-l", "-p", "/no/such/dir/pid"},
        {"?failed to create pid file", "?successfully started", "=0",
         "+RegisterEventSourceA ((null),\"torvad\")", std::string("+,0x0001") + record,
         "+err:eventlog:ReportEventW L\"torvad\"\n",
         "+err:eventlog:ReportEventW L\"failed to create pid file\"\n",
         std::string("+,0x0004") + record,
         "+trace:eventlog:ReportEventW L\"successfully started torvad version 1.1.21.0\"\n"},
        {.env = {debug}});
    run_scenario({"-p", "/no/such/dir/pid"}, {"?successfully started", "=0", "-EventSource"},
                 {.env = {debug}});
}
