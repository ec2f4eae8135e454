// The least any program in front of a child can do under torvad: start the
// child (the arguments but torvad's pipe, the last), wait for it and end with
// its status. bench_restart runs it beside torvad-wrap, so that the cost of
// a process in front, which every restart through a wrapper pays, is told
// apart from the wrapper's own work.
#include <spawn.h>
#include <sys/wait.h>

extern char** environ;

int main(int argc, char** argv) {
    if (argc < 3)
        return 2;
    argv[argc - 1] = nullptr;
    pid_t pid = 0;
    if (posix_spawn(&pid, argv[1], nullptr, nullptr, argv + 1, environ) != 0)
        return 127;
    int status = 0;
    if (waitpid(pid, &status, 0) == -1)
        return 128;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}
