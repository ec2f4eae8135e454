#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <fstream>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include "tests/child/child_host.hpp"

namespace child_host {

void prepare_streams() {}

// A clean start is exactly fds 0, 1, 2 and the ipc end (a leak takes the lowest
// free numbers), and no blocked or ignored signal; then the account.
std::vector<std::string> start_state(int ipc_fd) {
    std::string fds, ignored, groups;
    for (int fd = 0; fd < 1024; ++fd)
        if (fcntl(fd, F_GETFD) != -1)
            fds += " " + std::to_string(fd);
    sigset_t mask;
    sigprocmask(SIG_SETMASK, nullptr, &mask);
    bool blocked = false;
    for (int number = 1; number < NSIG; ++number) {
        struct sigaction action = {};
        blocked = blocked || sigismember(&mask, number) == 1;
        if (sigaction(number, nullptr, &action) == 0 && action.sa_handler == SIG_IGN)
            ignored += " " + std::to_string(number);
    }
    gid_t group[256];
    for (int i = 0, count = getgroups(256, group); i < count; ++i)
        groups += (i == 0 ? "" : ",") + std::to_string(group[i]);
    bool clean = fds == " 0 1 2" + (ipc_fd > 2 ? " " + std::to_string(ipc_fd) : "");
    return {"fds " + std::string(clean ? "clean" : "leaked") + fds,
            std::string("sigmask ") + (blocked ? "blocked" : "empty"), "ignored" + ignored + ".",
            "uid=" + std::to_string(getuid()) + " gid=" + std::to_string(getgid()) +
                " groups=" + groups};
}

// Each orphan ends when the pipe's last writer does: the supervised child.
bool leave_orphans(int count) {
    int fds[2];
    if (pipe(fds) == -1)
        return false;
    if (pid_t middle = fork(); middle != 0)
        return waitpid(middle, nullptr, 0) == middle;
    for (pid_t parent = getpid(); count-- > 0;)
        if (fork() == 0) {
            close(fds[1]);
            sigset_t adopted;
            sigemptyset(&adopted);
            sigaddset(&adopted, SIGUSR1);
            sigprocmask(SIG_BLOCK, &adopted, nullptr);
            prctl(PR_SET_PDEATHSIG, SIGUSR1);
            if (getppid() == parent)
                sigwaitinfo(&adopted, nullptr);
            std::ifstream adopter("/proc/" + std::to_string(getppid()) + "/comm");
            std::string name;
            adopter >> name;
            std::printf("child: orphan adopted by %s\n", name.c_str());
            std::fflush(stdout);
            for (char byte; read(fds[0], &byte, 1) > 0;) {
            }
            _exit(0);
        }
    _exit(0);
}

// Our end of the socket pair is closed on exec; torvad's is not.
bool start_attached(const std::string& torvad, int& ours, long& theirs) {
    int ends[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, ends) == -1 || fcntl(ends[0], F_SETFD, FD_CLOEXEC))
        return false;
    ours = ends[0];
    theirs = ends[1];
    std::string pid = std::to_string(getpid()), fd = std::to_string(theirs);
    if (fork() == 0 && execl(torvad.c_str(), torvad.c_str(), "-v", "-a", pid.c_str(), fd.c_str(),
                             "--", "never_run", nullptr) == -1)
        _exit(127);
    return close(ends[1]) == 0;
}

int stand_in_for_tool(const char*) {
    return -1;
}

bool squat(const std::string&) {
    return false;
}

bool notify(const std::string& message) {
    std::string path = std::getenv("NOTIFY_SOCKET") ? std::getenv("NOTIFY_SOCKET") : "";
    sockaddr_un to{AF_UNIX, {}};
    path.copy(to.sun_path, sizeof to.sun_path - 1);
    to.sun_path[0] = to.sun_path[0] == '@' ? '\0' : to.sun_path[0];
    int fd = socket(AF_UNIX, SOCK_DGRAM, 0);
    bool sent = sendto(fd, message.data(), message.size(), 0, reinterpret_cast<sockaddr*>(&to),
                       sizeof to.sun_family + path.size()) >= 0;
    return close(fd), sent;
}

bool console_event(int) {
    return false;
}

} // namespace child_host
