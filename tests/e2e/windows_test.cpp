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
// With -r the start stays pending, its checkpoint growing, until core says it
// is ready (when a file "ready" is there).
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
    auto in_state = [&name](const char* state, unsigned checkpoint = 0) {
        std::string query = run_wine({"sc", "query", name});
        return query.find(state) != std::string::npos &&
               (checkpoint == 0 ||
                std::stoul(query.substr(query.find("0x", query.find("CHECKPOINT"))), nullptr, 16) >=
                    checkpoint);
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
    name += "_r";
    command.insert(command.find(" -p"), " -r");
    ASSERT_EQ((run_wine({"sc", "create", name, "binpath=", command}, &created), created), 0);
    for (bool ready : {false, true}) {
        run_wine({"sc", "start", name});
        EXPECT_TRUE(becomes_true([&] {
            return ready ? in_state("RUNNING") : in_state("START_PENDING", 3);
        })) << ready;
        run_wine({"sc", "stop", name});
        EXPECT_TRUE(becomes_true([&] { return in_state("STOPPED"); }));
        std::ofstream(dir.path + "/ready");
    }
    run_wine({"sc", "delete", name});
}

// Items whole on code page 932 (a locale of the test's own), or refused; squatters on
// each pipe of a launch (torvad's names known through a bcrypt.dll stand-in).
TEST(windows, items_and_pipes_stay_the_requesters) {
    if (!under_wine)
        GTEST_SKIP() << "the Windows build under Wine";
    scratch_dir ja, known;
    ASSERT_EQ(std::system(("localedef -i ja_JP -f UTF-8 " + ja.path + "/ja_JP.UTF-8").c_str()), 0);
    for (const char* file : {"../torvad.exe", "../stand_in/bcrypt.dll"})
        std::filesystem::copy(std::filesystem::path(child_file).parent_path() / file, known.path);
    run_rows({
        // U+2015 and U+8868 end in a backslash's byte there; a lone 0x81 is no text
        {child({"execute", "2", child_binary, "args", "\u2015\" --delete-all", "C:\\\u8868\\",
                "next", "+", "2x", child_binary, "args", "81"}),
         {"&child: 1 stdout child: args [\\x81\\\" --delete-all][C:\\\\x95\\\\][next]\n",
          "&refused to run '" + child_binary + "': an item is no text of the system's code page.",
          "&child: 2 failed 1113", "!INT", "=0"},
         {.env = {"LOCPATH=" + ja.path, "LC_ALL=ja_JP.UTF-8"}}},
        // the first request's four pipes each find a name taken once, the second's stdin four times
        {{"-v", "--", child_binary, "squat", "1,3,5,7,9,10,11,12", "3", child_binary, "peer", "+",
          "3", child_binary, "peer"},
         {"?child: squat taken", "&child: 1 stdout child: version", "&took 4 pipe names first",
          "&its name taken by", "&child: 2 failed 5", "!INT", "?child: squat heard nothing", "=0",
          "-child: 2 opened"},
         {.env = {"WINEDLLOVERRIDES=mscoree,mshtml=;bcrypt=n"},
          .program = known.path + "/torvad.exe"}},
    });
}
