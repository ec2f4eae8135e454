// torvad as a container's entrypoint: the first process of a PID namespace of
// its own, stdout on a pipe, with or without the runtime's notify socket; and,
// off that place, the reaper of its own descendants all the same.
#include <gtest/gtest.h>

#include <unistd.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

// "^N" waits for an orphan's report that process N adopted it, "^" for one
// naming torvad's own pid.
step_hook container_steps(notify_socket& manager) {
    return [&manager](const std::string& step, daemon_run& run) {
        if (step[0] != '^')
            return service_steps(manager)(step, run);
        std::string adopter = step.size() > 1 ? step.substr(1) : std::to_string(run.pid());
        EXPECT_TRUE(run.wait_anywhere("child: orphan adopted by " + adopter + "\n"))
            << run.output();
        return true;
    };
}

// Eight orphans end the moment their supervised ancestor exits with 3: each is
// reaped, and the supervised exit is still read as 3, so the child restarts.
std::vector<std::string> orphans_then_restart(const std::string& adopter) {
    return {"?child: orphans made",
            "?'test_child' exited with 0x3.",
            "?starting 'test_child' again.",
            "?child: ready",
            "^" + adopter,
            "z"};
}

} // namespace

TEST(container, first_process_runs_the_product_reaps_orphans_and_stops_on_sigterm) {
    if (geteuid() != 0)
        GTEST_SKIP() << "needs root for a PID namespace";
    scratch_dir dir;
    struct row {
        std::vector<std::string> mode, steps;
        bool notify = false;
    };
    auto restarted = orphans_then_restart("1");
    restarted.insert(restarted.end(), {"!TERM", "?child: sigterm", "?'test_child' exited with 0x0.",
                                       "=0", "-failed to read", "-\x1b"});
    const row rows[] = {
        // a container stop, with no notify socket
        {{"orphans", "8", dir.path + "/orphaned"}, restarted},
        // the runtime's socket gets the states; the stop is the same
        {{"peer"},
         {"@STATUS=starting", "@READY=1\nSTATUS=running, 1 child", "?child: ready", "!TERM",
          "@STOPPING=1\nSTATUS=stopping, waiting for 1 child", "?child: sigterm", "@STATUS=stopped",
          "=0"},
         true},
        // the last persistent child's end ends the container
        {{"exit", "0"}, {"?'test_child' exited with 0x0.", "=0"}},
    };
    for (const auto& r : rows) {
        SCOPED_TRACE(::testing::PrintToString(r.mode));
        notify_socket manager;
        std::vector<std::string> args = {"--", child_binary};
        args.insert(args.end(), r.mode.begin(), r.mode.end());
        options how{.terminal = false, .pid_namespace = true};
        if (r.notify)
            how.env = {manager.env()};
        run_scenario(args, r.steps, how, container_steps(manager));
    }
}

// Off PID 1 the orphans of our children come to us, at a console and as a
// service alike, and are reaped there.
TEST(container, a_supervisor_off_pid_1_reaps_its_own_orphans) {
    for (bool terminal : {true, false}) {
        scratch_dir dir;
        notify_socket manager;
        auto steps = orphans_then_restart("");
        steps.insert(steps.end(), {"!TERM", "?child: sigterm", "=0"});
        run_scenario({"--", child_binary, "orphans", "2", dir.path + "/orphaned"}, steps,
                     {.terminal = terminal, .env = {manager.env()}}, container_steps(manager));
    }
}
