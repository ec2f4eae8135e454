// Children from launch to exit, with the real binary: version first, restarts,
// stops, the trace, launch failures, account switch and descriptor hygiene.
#include <gtest/gtest.h>

#include <filesystem>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

const char* const stopping = "?stopping torvad version 1.1.21.0...";

} // namespace

TEST(children, launch_exit_restart_and_stop) {
    scratch_dir dir, anyone; // a copy of the child that nobody may run from where nobody may be
    const options root{.where = systems::linux_only, .as_root = true};
    std::string once = "test -e " + dir.path + "/sh || { touch " + dir.path + "/sh; exit 3; }; ";
    const std::string copy = anyone.path + "/test_child"; // its rows hold on Linux alone
    std::filesystem::copy(child_file, copy);
    run_rows({
        // version comes first, traced under -v, coloured at a terminal; a stop is
        // a sigterm packet, and 0 ends the run. Ctrl-C reaches the terminal's
        // whole group: the child ends by sigterm, not by it.
        {child({"peer"}, {"-v"}),
         {"?\x1b[36m-> test_child:0\x1b[35m version\x1b[0m \"" + torvad_name +
              "\" \"1.1.21.0\" \"Background:false\" \n",
          "?child: version " + torvad_name + " 1.1.21.0 Background:false", "?child: ready",
          "!GROUP", stopping, "?child: sigterm", "?'test_child' exited with 0x0.", "=0", "-again"}},
        // no -v, no trace
        {child({"exit", "0"}), {"?'test_child' exited with 0x0.", "=0", "-again", "-version\x1b"}},
        {child({"exit", "3"}, {"-o"}), {"?'test_child' exited with 0x3.", "=0", "-again"}},
        // failures restart at once
        {child({"no_such_mode"}),
         {"?exited with 0x40.", "?starting 'test_child' again.", "?starting 'test_child' again.",
          "!TERM", stopping, "=0"}},
        {{"--", "no_such_program_xyz"},
         {"?executable 'no_such_program_xyz' not found.", "?failed to start torvad version", "=0"}},
        {{"--", "/no/such/dir/prog"},
         {"?failed to create child process.", "?failed to start torvad version", "=0"}},
        // nothing escalates after a sigterm that is ignored: the child's own
        // end at its second (137) is read as it is, not as one we forced
        {child({"ignore-sigterm"}),
         {"?child: ready", "!INT", stopping, "?child: sigterm ignored", "!INT", stopping,
          "&still waiting for 'test_child' (pid ", "?child: second sigterm",
          "?'test_child' exited with 0x89.", "=0", "-again"}},
        // writing to a peer that closed its end must not kill us
        {{"--", "/bin/sh", "-c", "exec 3>&-; echo closed ipc pid=$$; exec sleep 30"},
         {"#closed ipc pid", "!INT", stopping, "kill 15", "?'sh' exited with 0x8f.", "=0"},
         on_linux},
        // a child holds fds 0, 1, 2 and its ipc end only, with default signals,
        // also when torvad's own stdin was closed at its start
        {child({"fds"}, {"-v"}),
         {"?child: fds clean", "?child: sigmask empty", "?child: ignored.\n", "!INT", "=0"},
         {.shell = "exec 0<&-", .where = systems::linux_only}},
        {{"-u", "nobody", "-d", anyone.path, "--", copy, "fds"},
         {"?child: uid=65534 gid=65534 groups=65534", "!INT", "=0"},
         root},
        {child({"fds"}, {"-u", "no_such_user_xyz"}),
         {"?Failed to logon as user 'no_such_user_xyz': error 2", "=0", "-child: "},
         root},
        {child({"fds"}, {"-u", "OTHERDOMAIN\\nobody"}),
         {"?Failed to logon as user 'OTHERDOMAIN\\nobody': error 2", "=0", "-child: "},
         root},
        // two orphans end the moment their supervised ancestor exits with 3:
        // they come to us and are reaped, and the exit is still read as 3
        {child({"orphans", "2", dir.path + "/orphaned"}),
         {"?child: orphans made", "?'test_child' exited with 0x3.", "?starting 'test_child' again.",
          "?child: ready", "&child: orphan adopted by torvad\n", "z", "!TERM", "?child: sigterm",
          "=0"},
         on_linux},
        // a container's first process without the runtime's socket: the service path all the same
        {child({"peer"}),
         {"?child: ready", "!TERM", "?child: sigterm", "=0"},
         {.terminal = false,
          .shell = "mount --make-rprivate / && mount -t proc p /proc",
          .first_process = true,
          .where = systems::linux_only,
          .as_root = true}},
        // when a requester ends, its channels lose their pipes and run on: a
        // cat there sees the end of its input and ends; so does one that was
        // restarted, though its id left the requester when its predecessor closed
        {child({"execute", "once", dir.path + "/left-cat", "1", "2", "cat"}),
         {"?child: left", "?starting 'test_child' again.", "?'cat' exited with 0x0.", "!INT", "=0"},
         on_linux},
        {child({"execute", "once", dir.path + "/left-sh", "2", "3", "sh", "-c", once + "exec cat"}),
         {"?child: left", "?starting 'test_child' again.", "&starting 'sh' again.",
          "?'sh' exited with 0x0.", "!INT", "=0"},
         on_linux},
        // a channel outlives its requester and holds none of its descriptors; at
        // the stop, with no living parent, it is ended by force, which counts as
        // 0; the requester is deaf to sigterm, so the run lasts until that end
        // (under Wine it timed out at the stop once in several runs, not yet understood)
        {child({"execute", "once-deaf", dir.path + "/spawned", "2", "0", child_binary, "fds", "+",
                "0", "sleep", "30"}),
         {"?child: left", "?starting 'test_child' again.", "#ready pid", "&child: fds clean",
          "!INT", "?'sleep' exited with 0x0.", "kill 9", "=0", "-leaked"},
         on_linux},
    });
}
