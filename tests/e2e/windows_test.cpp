// The product on Windows, under Wine: the test child stands in for core.exe,
// powershell.exe and schtasks.exe, acting by its name; sc.exe drives the
// service path. The init script's command line is built as schtasks' is, and
// run as on Linux.
#include <gtest/gtest.h>

#include <boost/process.hpp>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

// Runs a program of Wine's to its end; its output, both streams. Through a
// file: a program of Wine's own session that it starts holds a pipe open.
std::string run_wine(const std::vector<std::string>& args, int* exit_code = nullptr) {
    namespace bp = boost::process;
    scratch_dir dir;
    int code = bp::system(bp::search_path("wine"), bp::args(args),
                          (bp::std_out & bp::std_err) > dir.path + "/out");
    if (exit_code != nullptr)
        *exit_code = code;
    return read_file(dir.path + "/out");
}

// A bounded wait for what the manager or a file shows: they tell no event.
bool becomes_true(const std::function<bool()>& condition) {
    for (int tries = 0; tries < 100 && !condition(); ++tries)
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    return condition();
}

} // namespace

// core stays silent on "version": the service is handed over to it, the task
// scheduler gets its two command lines byte for byte, and torvad ends with 1,
// its PID file left.
TEST(windows, silent_core_hands_the_service_over_and_ends_with_1) {
    if (!under_wine)
        GTEST_SKIP() << "the Windows build under Wine";
    // A product directory with a blank in its path; the stand-ins in front of PATH.
    scratch_dir root;
    std::string product = root.path + "/my product", pid_file = root.path + "/pid";
    std::filesystem::create_directories(root.path + "/bin");
    std::filesystem::create_directories(product);
    std::ofstream(product + "/silent");
    for (const char* tool : {"/bin/schtasks.exe", "/bin/powershell.exe", "/my product/core.exe"})
        std::filesystem::copy(child_file, root.path + tool);
    run_scenario({"-f", "acme", "-p", pid_file, "-d", product}, {"=1", "-successfully started"},
                 {.terminal = false, .env = {"WINEPATH=" + windows_form(root.path + "/bin")}});
    EXPECT_TRUE(std::filesystem::exists(pid_file));
    EXPECT_EQ(read_file(product + "/powershell.log"), "");
    EXPECT_EQ(read_file(product + "/schtasks.log"),
              R"(/create /f /tn startts /sc onstart /ru system /tr "powershell -command )"
              R"(""start-sleep -s 10; sc.exe config acmeServer binpath= \\"")" +
                  windows_form(product) +
                  R"(\core.exe\\""; sc.exe start torvaSentryServer; schtasks.exe /delete /f )"
                  "/tn startts\"\"\"\n/run /tn startts\n");
}

// Created, started, queried and stopped with sc.exe, as an installation runs
// torvad on the product in its working directory: core.exe reports to
// core.log, with no console to write to, its version first and its sigterm last.
TEST(service, the_manager_starts_queries_and_stops_it_in_order) {
    if (!under_wine)
        GTEST_SKIP() << "the Windows build under Wine";
    scratch_dir dir;
    std::string name = "torvad_test_" + std::to_string(getpid());
    std::string record = dir.path + "/core.log", pid = dir.path + "/pid";
    std::filesystem::copy(child_file, dir.path + "/core.exe");
    std::ofstream{record};
    // A service starts elsewhere than on drive Z:.
    std::string command =
        "\"" + torvad_binary + "\" -p " + windows_form(pid) + " -d " + windows_form(dir.path);
    // Wine's sc tells a success by its exit code alone.
    int created = 1;
    std::string said = run_wine({"sc", "create", name, "binpath=", command}, &created);
    ASSERT_EQ(created, 0) << said;
    auto in_state = [&name](const char* state) {
        return run_wine({"sc", "query", name}).find(state) != std::string::npos;
    };
    run_wine({"sc", "start", name});
    EXPECT_TRUE(becomes_true([&] { return in_state("RUNNING"); }));
    EXPECT_TRUE(becomes_true([&] {
        return read_file(record).starts_with("child: version torvad.exe 1.1.21.0 Background:true");
    })) << read_file(record);
    EXPECT_TRUE(std::filesystem::exists(pid));
    run_wine({"sc", "stop", name});
    EXPECT_TRUE(becomes_true([&] { return in_state("STOPPED"); }));
    EXPECT_TRUE(becomes_true([&] { return read_file(record).ends_with("child: sigterm\r\n"); }))
        << read_file(record);
    EXPECT_TRUE(becomes_true([&] { return !std::filesystem::exists(pid); }));
    run_wine({"sc", "delete", name});
}
