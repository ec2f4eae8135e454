// The service path under the system's service control manager: created,
// started, queried and stopped with sc.exe, the child ending through its
// sigterm packet, as an installation runs torvad.
#include <boost/process/child.hpp>
#include <boost/process/environment.hpp>
#include <boost/process/io.hpp>
#include <boost/process/pipe.hpp>
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <thread>

#include "tests/e2e/harness.hpp"

using namespace e2e;
namespace bp = boost::process;

namespace {

// Runs a tool of the system to its end; its output, both streams, and its
// exit code in exit_code.
std::string run_tool(const std::string& command, int* exit_code = nullptr) {
    bp::ipstream out;
    bp::child tool(command, (bp::std_out & bp::std_err) > out);
    std::string output{std::istreambuf_iterator<char>(out), {}};
    tool.wait();
    if (exit_code != nullptr)
        *exit_code = tool.exit_code();
    return output;
}

// A bounded wait for what the manager or a file shows: they tell no event.
bool becomes_true(const std::function<bool()>& condition) {
    for (int tries = 0; tries < 100; ++tries) {
        if (condition())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    return false;
}

} // namespace

// An explicit command, and the product found in the working directory (a copy
// of the test child as core.exe, which records to core.log when that is there):
// either way the child's record shows version first and the sigterm last.
TEST(service, the_manager_starts_queries_and_stops_it_in_order) {
    for (bool product : {false, true}) {
        SCOPED_TRACE(product ? "core.exe" : "explicit command");
        scratch_dir dir;
        std::string name = "torvad_test_" + std::to_string(boost::this_process::get_id());
        std::string record = dir.path + (product ? "/core.log" : "/child.log");
        std::string pid_file = dir.path + "/pid";
        std::string command =
            std::string("\\\"") + torvad_binary + "\\\" -p " + pid_file + " -d " + dir.path;
        if (product) {
            std::filesystem::copy(std::string(child_binary) + ".exe", dir.path + "/core.exe");
            std::ofstream{record};
        } else {
            command += " -- \\\"" + std::string(child_binary) + "\\\" record " + record;
        }
        // Wine's sc tells a success by its exit code alone.
        int created = 1;
        std::string said =
            run_tool("sc create " + name + " binpath= \"" + command + "\"", &created);
        ASSERT_EQ(created, 0) << said;

        run_tool("sc start " + name);
        auto state_is = [&name](const char* state) {
            return [&name, state] {
                return run_tool("sc query " + name).find(state) != std::string::npos;
            };
        };
        EXPECT_TRUE(becomes_true(state_is("RUNNING")));
        EXPECT_TRUE(becomes_true([&] { return read_file(record).starts_with("version 1.1.21.0"); }))
            << read_file(record);
        EXPECT_TRUE(file_exists(pid_file));

        run_tool("sc stop " + name);
        EXPECT_TRUE(becomes_true(state_is("STOPPED")));
        EXPECT_TRUE(becomes_true([&] { return read_file(record).ends_with("sigterm\n"); }))
            << read_file(record);
        EXPECT_TRUE(becomes_true([&] { return !file_exists(pid_file); }));
        run_tool("sc delete " + name);
    }
}
