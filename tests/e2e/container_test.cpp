// The reaper of its own descendants: off PID 1 the orphans of our children
// come to us, at a console and as a service alike, and are reaped there. (As
// a container's PID 1, the image's tests under podman show the same.)
#include <gtest/gtest.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

// Two orphans end the moment their supervised ancestor exits with 3: each is
// reaped, and the supervised exit is still read as 3, so the child restarts.
TEST(container, a_supervisor_reaps_its_own_orphans) {
    if (!holds_here(systems::linux_only))
        GTEST_SKIP() << "nothing adopts a Windows process";
    for (bool terminal : {true, false}) {
        scratch_dir dir;
        notify_socket manager;
        auto orphan_adopted = [](const std::string& step, daemon_run& run) {
            if (step != "^")
                return false;
            std::string adopter = std::to_string(run.pid());
            EXPECT_TRUE(run.wait_anywhere("child: orphan adopted by " + adopter + "\n"))
                << run.output();
            return true;
        };
        run_scenario({"--", child_binary, "orphans", "2", dir.path + "/orphaned"},
                     {"?child: orphans made", "?'test_child' exited with 0x3.",
                      "?starting 'test_child' again.", "?child: ready", "^", "z", "!TERM",
                      "?child: sigterm", "=0"},
                     {.terminal = terminal, .env = {manager.env()}}, orphan_adopted);
    }
}
