// torvad-wrap between torvad and programs that don't speak the protocol, and
// readiness (-r) as the service manager hears it.
#include <gtest/gtest.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

const char* const stopping = "?stopping torvad version 1.1.21.0...";
const char* const running = "@READY=1\nSTATUS=running, 1 child";
const char* const stopping_1 = "@STOPPING=1\nSTATUS=stopping, waiting for 1 child";
const options managed{.terminal = false, .manager = true, .where = systems::linux_only};

} // namespace

TEST(wrap, programs_stopped_their_own_way_and_ready_at_their_word) {
    const char* const wrapped_0 = "?'torvad-wrap' exited with 0x0.";
    run_rows({
        // the first try: Ctrl-C at the console becomes the program's SIGTERM,
        // and its death by it is a clean end
        {{"--", wrap_binary, "sleep", "30"},
         {"?successfully started", "!GROUP", stopping, wrapped_0, "=0", "-again", "-ready"},
         on_linux},
        // a too-long message is dropped whole; READY=1 twice is one ready
        {{"-r", "--", wrap_binary, child_binary, "notify", "big", "STATUS=up\nREADY=1", "READY=1"},
         {"@STATUS=starting", "?a notify message of 5008 bytes ignored.", running,
          "?the product is ready.", "&child: notified", "@", "!TERM", stopping_1, wrapped_0,
          "@STATUS=stopped", "=0"},
         managed},
        // without -r the packet is traced and ignored: running comes at the start
        {{"-v", "--", wrap_binary, "-i", "sleep", "30"},
         {"@STATUS=starting", running, "?<- torvad-wrap:0 ready", "!TERM", stopping_1, wrapped_0,
          "=0", "@*", "-the product is ready"},
         managed},
        // a program that ends before it is ready is never reported ready
        {{"-r", "-o", "--", wrap_binary, "sh", "-c", "exit 3"},
         {"@STATUS=starting", "?'torvad-wrap' exited with 0x3.",
          "@STOPPING=1\nSTATUS=stopping, waiting for 0 children", "=0", "@*", "-ready"},
         managed},
        // a program that can't be found: one clear line, and the error as the status
        {{"-o", "--", wrap_binary, "no_such_program_xyz"},
         {"?torvad-wrap: cannot run 'no_such_program_xyz': ", "?exited with 0x2.", "=0"}},
        // on either system: ready at once (-i) at a console, and the
        // program's status (after a second) is the wrapper's
        {{"-o", "-r", "--", wrap_binary, "-i", child_binary, "exit", "3", "1", "x"},
         {"?the product is ready.", "?exited with 0x3.", "=0"}},
        // a program that outlives the stop (this one ignores Ctrl-Break; Wine 8
        // sends none, and the wrapper says it can't stop the program) leaves
        // torvad waiting for its own end, whose status is the wrapper's
        {{"-r", "--", wrap_binary, "-i", child_binary, "exit", "0", "4", "x"},
         {"?the product is ready.", "!INT", stopping, "?exited with 0x0.", "=0"},
         on_windows},
        // deaf to SIGTERM: torvad keeps waiting and names whom it waits for
        {{"--", wrap_binary, "sh", "-c", "trap '' TERM; echo deaf pid=$$; exec sleep 30"},
         {"#deaf pid", "!INT", stopping, "!INT", "&still waiting for 'torvad-wrap' (pid ", "kill 9",
          "?'torvad-wrap' exited with 0x89.", "=0", "-again"},
         on_linux},
        // another stop signal; a program ended by the one sent has ended cleanly
        {{"--", wrap_binary, "-s", "KILL", "sh", "-c", "trap '' TERM; sleep 30"},
         {"?successfully started", "!INT", stopping, wrapped_0, "=0"},
         on_linux},
        // torvad's pipe closing (torvad killed) stops the program the same way
        {{"--", wrap_binary, "sh", "-c",
          "trap 'echo program stopped; exit 0' TERM; echo top pid=$(cut -d' ' -f4 "
          "/proc/$PPID/stat); sleep 30 & wait"},
         {"#top pid", "kill 9", "?torvad's pipe closed; stopping the program.", "?program stopped"},
         managed},
        // so does the wrapper's own SIGTERM; its status 0 ends the run, the last child gone
        {{"--", wrap_binary, "sh", "-c",
          "trap 'echo program stopped; exit 0' TERM; echo wrapper pid=$PPID; sleep 30 & wait"},
         {"#wrapper pid", "kill 15", "?program stopped", wrapped_0, "=0", "-again"},
         on_linux},
    });
}

// A server nobody here wrote, which speaks the notify protocol: ready only
// once it serves, restarted after a kill -9, stopped through its own shutdown.
TEST(wrap, real_server_under_torvad) {
    scratch_dir dir;
    const std::string ping = "$redis-cli -p 6391 ping >/dev/null";
    run_rows({
        {{"-r", "--", wrap_binary, "redis-server", "--supervised", "systemd", "--port", "6391",
          "--save", "", "--appendonly", "no", "--dir", dir.path},
         {"@STATUS=starting", running, ping, "#pid", "kill 9", "?'torvad-wrap' exited with 0x89.",
          "?starting 'torvad-wrap' again.", "?Ready to accept connections", ping, "@", "!TERM",
          stopping_1, "?Received SIGTERM scheduling shutdown", "?ready to exit, bye bye",
          "?'torvad-wrap' exited with 0x0.", "@STATUS=stopped", "=0"},
         managed},
    });
}
