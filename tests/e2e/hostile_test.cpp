// Children are not trusted, and neither is the start state: each row is a
// fault that once took the supervisor down, stalled it or grew it without
// bound. The run must go on and end in order.
#include <gtest/gtest.h>

#include "tests/e2e/harness.hpp"

using namespace e2e;

TEST(hostile, faults_leave_the_supervisor_serving) {
    scratch_dir dir, doomed;
    const std::string pipes = "2";
    // Not there on either system, in a folder that is: "not found" on both.
    const std::string missing = dir.path + "/no_such_prog";
    std::vector<std::string> many_channels = {"execute"};
    for (int i = 0; i < 40; ++i)
        many_channels.insert(many_channels.end(), {pipes, "/bin/sleep", "1", "+"});
    // Wine hands our UTF-8 to the requester in its ANSI code page; whatever
    // bytes it sends must arrive.
    const std::string utf8 = under_wine ? "\\xe9\\x80" : "\\xc3\\xa9\\xe2\\x82\\xac";
    const std::vector<std::string> ordered_stop = {
        "?stopping torvad", "?child: sigterm", "?'test_child' exited with 0x0.", "=0", "-again"};
    run_rows({
        // refusals carry their statuses: malformed, not permitted, not found
        {child({"execute", "8", "only", "+", "0", "", "+", "8", "someone_else", "/bin/true", "+",
                "0", "no_such_program_xyz"}),
         {"&user not specified", "&executable not specified", "&permission to change user denied",
          "&executable 'no_such_program_xyz' not found.", "?child: 1 failed 22",
          "?child: 2 failed 22", "?child: 3 failed 13", "?child: 4 failed 2", "!INT", "=0"}},
        // out of descriptors: launches fail with the errno, named with its call
        // under -v; the daemon serves on
        {child(many_channels, {"-v"}),
         {"?failed to create child process.", "?: Too many open files\n", "?failed 24", "!INT",
          "=0"},
         {.shell = "ulimit -n 64", .where = systems::linux_only}},
        // a working directory deleted under us (Windows keeps one that is in use):
        // only a relative name is not found; a grandchild holding a channel's
        // pipe does not hold back the channel's end (past the wait)
        {child({"execute", "!rmcwd", "+", "0", "./prog", "+", "0", "/bin/true", "+", "0", "true",
                "+", pipes, "/bin/sh", "-c", "sleep 12 & echo hi"},
               {"-d", doomed.path}),
         {"?child: rmcwd 0", "&executable './prog' not found.", "?child: 1 failed 2",
          "&child: 2 closed 0", "&child: 3 closed 0", "&child: 4 stdout hi", "&child: 4 closed 0",
          "!INT", "=0"},
         on_linux},
        // a peer that floods a child's stdin that is never read is held back
        {child({"flood-in", child_binary, "exit", "0", "3s"}),
         {"?child: flood-in held", "!INT", "=0"}},
        // input for a child that closed its stdin is dropped, and holds nothing back
        {{"--", child_binary, "flood-in", "/bin/sh", "-c", "exec sleep 3 0<&-"},
         {"?child: flood-in sent all", "!INT", "=0"},
         on_linux},
        // an inherited SIGCHLD ignore must not hide exits from us, nor leave zombies
        {{"--", child_binary, "execute", "once", dir.path + "/failed", "0"},
         {"?exited with 0x3.", "?starting 'test_child' again.", "?child: ready", "z", "!INT",
          "?'test_child' exited with 0x0.", "=0"},
         {.shell = "trap '' CHLD", .where = systems::linux_only}},
        // Ctrl-Break, close and shutdown at torvad and a peer alike stop in order; logoff not
        {child({"console-event", "1"}), ordered_stop, on_windows},
        {child({"console-event", "2"}), ordered_stop, on_windows},
        {child({"console-event", "6"}), ordered_stop, on_windows},
        {child({"console-event", "5"}),
         {"?child: logoff passed", "?'test_child' exited with 0x0.", "=0", "-stopping torvad"},
         on_windows},
        // each item reaches the program whole: none of it can become an argument of its own
        {child({"execute", pipes, child_binary, "args", "a\\\" --delete-all", "C:\\dir\\", "x y",
                "\\\\\"q\\", "", "t\tab", "\"", "\\", "\xc3\xa9\xe2\x82\xac", "end"}),
         {"?child: 1 stdout child: args [a\\\" --delete-all][C:\\dir\\][x y][\\\\\"q\\][]"
          "[t\\x09ab][\"][\\][" +
              utf8 + "][end]\n",
          "!INT", "=0"}},
        // a batch file would have cmd.exe read its arguments: refused, by any spelling
        {child({"execute", "0", missing + ".bat", "+", "0", missing + ".CmD. ", "+", "0",
                missing + ".bat::$DATA"}),
         {"?refused to run '", "&child: 1 failed 193", "&child: 2 failed 193",
          "&child: 3 failed 193", "!INT", "=0"},
         on_windows},
        // a program run at an attached peer's request can't write on the peer's pipe
        // and torvad never runs the command behind -a
        {child({"attach", torvad_binary, child_binary}),
         {"?child: attach clean", "?attached ipc pipe closed.", "=0", "-attach forged",
          "-'never_run'"}},
    });
}
