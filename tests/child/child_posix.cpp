#include <algorithm>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <dirent.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include "tests/child/child_host.hpp"

namespace child_host {

namespace {

// "clean" when the open fds are exactly 0, 1, 2 and the ipc end, if any.
std::string descriptor_report(int ipc_fd) {
    std::vector<int> fds, expected = {0, 1, 2};
    if (ipc_fd > 2)
        expected.push_back(ipc_fd);
    DIR* dir = opendir("/proc/self/fd");
    while (dirent* entry = readdir(dir))
        if (entry->d_name[0] != '.' && std::atoi(entry->d_name) != dirfd(dir))
            fds.push_back(std::atoi(entry->d_name));
    closedir(dir);
    std::sort(fds.begin(), fds.end());
    std::string report = fds == expected ? "clean" : "leaked";
    for (int fd : fds)
        report += " " + std::to_string(fd);
    return report;
}

// An orphan of ours, once its parent has gone: it reports who adopted it, and
// ends when the pipe's last writer does (the supervised child).
[[noreturn]] void be_orphan(pid_t parent, int pipe_read) {
    sigset_t adopted;
    sigemptyset(&adopted);
    sigaddset(&adopted, SIGUSR1);
    sigprocmask(SIG_BLOCK, &adopted, nullptr);
    prctl(PR_SET_PDEATHSIG, SIGUSR1);
    if (getppid() == parent)
        sigwaitinfo(&adopted, nullptr);
    std::printf("child: orphan adopted by %d\n", getppid());
    std::fflush(stdout);
    char byte;
    while (read(pipe_read, &byte, 1) > 0) {
    }
    _exit(0);
}

} // namespace

void prepare_streams() {}

std::vector<std::string> start_state(int ipc_fd) {
    std::vector<std::string> lines{"fds " + descriptor_report(ipc_fd)};
    if (std::getenv("NOTIFY_SOCKET") != nullptr)
        lines.push_back("notify socket inherited");
    sigset_t mask;
    sigprocmask(SIG_SETMASK, nullptr, &mask);
    std::string ignored;
    bool blocked = false;
    for (int number = 1; number < NSIG; ++number) {
        struct sigaction action {};
        blocked = blocked || sigismember(&mask, number) == 1;
        if (sigaction(number, nullptr, &action) == 0 && action.sa_handler == SIG_IGN)
            ignored += " " + std::to_string(number);
    }
    lines.push_back(std::string("sigmask ") + (blocked ? "blocked" : "empty"));
    lines.push_back("ignored" + ignored + ".");
    gid_t groups[256];
    int count = getgroups(256, groups);
    std::string group_list;
    for (int i = 0; i < count; ++i)
        group_list += (i == 0 ? "" : ",") + std::to_string(groups[i]);
    lines.push_back("uid=" + std::to_string(getuid()) + " gid=" + std::to_string(getgid()) +
                    " groups=" + group_list);
    return lines;
}

bool leave_orphans(int count) {
    int fds[2];
    if (pipe(fds) == -1)
        return false;
    pid_t middle = fork();
    if (middle == 0) {
        pid_t parent = getpid();
        for (int i = 0; i < count; ++i)
            if (fork() == 0) {
                close(fds[1]);
                be_orphan(parent, fds[0]);
            }
        _exit(0);
    }
    waitpid(middle, nullptr, 0);
    return true;
}

int stand_in_for_tool(const char*) {
    return -1;
}

bool take_pipe_name(int) {
    return false;
}

bool console_event(int) {
    return false;
}

} // namespace child_host
