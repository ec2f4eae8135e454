// The child program of the end-to-end tests: one mode per behaviour a
// supervised program can show. It reports on stdout in lines "child: ...".
//   test_child <mode> [args...] [ipc fd, appended by torvad]
#include <algorithm>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <string>
#include <unistd.h>
#include <vector>

#include "peer/peer.hpp"

namespace {

using torvad::peer::connection;

void say(const char* format, ...) __attribute__((format(printf, 1, 2)));
void say(const char* format, ...) {
    va_list args;
    va_start(args, format);
    std::printf("child: ");
    std::vprintf(format, args);
    std::printf("\n");
    std::fflush(stdout);
    va_end(args);
}

struct context {
    std::vector<std::string> args; // behind the mode, without the ipc fd
    int ipc_fd = -1;
};

// Reads version, then reports every packet until sigterm or end of stream.
int serve(const context& how, bool obey_sigterm) {
    if (how.ipc_fd < 0)
        return 0;
    connection link(how.ipc_fd);
    torvad::peer::version_info version;
    if (!torvad::peer::read_version(link, version)) {
        say("no version");
        return 5;
    }
    say("version %s %s Background:%s", version.program_name.c_str(), version.version.c_str(),
        version.background ? "true" : "false");
    say("ready pid=%d", getpid());
    torvad::peer::packet packet;
    while (link.receive(packet)) {
        if (packet.header.type != torvad::packet_sigterm) {
            say("packet type=%u channel=%u flags=%u size=%zu", packet.header.type,
                packet.header.channel, packet.header.flags, packet.payload.size());
            continue;
        }
        say(obey_sigterm ? "sigterm" : "sigterm ignored");
        if (obey_sigterm)
            return 0;
    }
    say("eof");
    return obey_sigterm ? 4 : 0;
}

int mode_exit(const context& how) {
    say("started pid=%d", getpid());
    return how.args.empty() ? 0 : std::atoi(how.args[0].c_str());
}

int mode_fail_once(const context& how) {
    if (how.args.empty())
        return 64;
    if (access(how.args[0].c_str(), F_OK) != 0) {
        close(open(how.args[0].c_str(), O_CREAT | O_WRONLY, 0644));
        say("failing");
        return 3;
    }
    return serve(how, true);
}

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
    if (fds == expected)
        return "clean";
    std::string list = "leaked";
    for (int fd : fds)
        list += " " + std::to_string(fd);
    return list;
}

// Has two channels run (one lists its fds, one sleeps), then fails once;
// started again, it ignores sigterm.
int mode_spawn_once(const context& how, const char* self) {
    if (how.args.empty() || access(how.args[0].c_str(), F_OK) == 0)
        return serve(how, false);
    close(open(how.args[0].c_str(), O_CREAT | O_WRONLY, 0644));
    connection link(how.ipc_fd);
    torvad::peer::version_info version;
    torvad::peer::read_version(link, version);
    link.execute(1, 0, {self, "fds"});
    link.execute(2, 0, {"sleep", "30"});
    torvad::peer::packet packet;
    for (int opened = 0; opened < 2 && link.receive(packet);) {
        if (packet.header.type != torvad::packet_opened)
            continue;
        if (packet.header.channel == 2)
            say("spawned pid=%u", packet.header.flags);
        ++opened;
    }
    return 3;
}

int mode_fds(const context& how) {
    say("fds %s", descriptor_report(how.ipc_fd).c_str());
    sigset_t mask;
    sigprocmask(SIG_SETMASK, nullptr, &mask);
    std::string ignored;
    bool blocked = false;
    for (int number = 1; number < NSIG; ++number) {
        struct sigaction action {};
        blocked = blocked || sigismember(&mask, number) == 1;
        if (sigaction(number, nullptr, &action) == 0 && action.sa_handler == SIG_IGN)
            ignored += (ignored.empty() ? "" : " ") + std::to_string(number);
    }
    say("sigmask %s", blocked ? "blocked" : "empty");
    say("ignored %s", ignored.c_str());
    gid_t groups[256];
    int count = getgroups(256, groups);
    std::string group_list;
    for (int i = 0; i < count; ++i)
        group_list += (i == 0 ? "" : ",") + std::to_string(groups[i]);
    say("uid=%u gid=%u groups=%s", getuid(), getgid(), group_list.c_str());
    return serve(how, true);
}

int mode_signal(const context& how) {
    int number = how.args.empty() ? SIGKILL : std::atoi(how.args[0].c_str());
    say("raising %d", number);
    std::signal(number, SIG_DFL);
    raise(number);
    return 0;
}

int mode_echo(const context&) {
    char buffer[4096];
    ssize_t got;
    while ((got = read(0, buffer, sizeof buffer)) > 0)
        if (write(1, buffer, static_cast<std::size_t>(got)) != got)
            return 1;
    const char eof[] = "child: echo eof\n";
    return write(2, eof, sizeof eof - 1) == sizeof eof - 1 ? 0 : 1;
}

// Writes hex bytes to the pipe; each "/" ends one write and pauses, so the
// supervisor sees the pieces in separate reads.
int mode_raw(const context& how) {
    if (how.args.empty() || how.ipc_fd < 0)
        return 64;
    const std::string& hex = how.args[0];
    std::string bytes;
    for (std::size_t i = 0; i <= hex.size(); ++i) {
        if (i == hex.size() || hex[i] == '/') {
            if (write(how.ipc_fd, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()))
                return 6;
            bytes.clear();
            usleep(50000);
            continue;
        }
        bytes += static_cast<char>(std::stoi(hex.substr(i++, 2), nullptr, 16));
    }
    return serve(how, true);
}

int mode_close_ipc(const context& how) {
    connection link(how.ipc_fd);
    torvad::peer::version_info version;
    torvad::peer::read_version(link, version);
    link = connection(-1);
    say("closed ipc pid=%d", getpid());
    for (int waited = 0; waited < 30; ++waited)
        sleep(1);
    return 0;
}

struct mode {
    const char* name;
    int (*run)(const context&);
};

const mode modes[] = {
    {"exit", mode_exit},
    {"fail-once", mode_fail_once},
    {"peer",
     [](const context& how) {
         return serve(how, true);
     }},
    {"ignore-sigterm",
     [](const context& how) {
         return serve(how, false);
     }},
    {"fds", mode_fds},
    {"signal", mode_signal},

    {"echo", mode_echo},
    {"raw", mode_raw},
    {"close-ipc", mode_close_ipc},
};

} // namespace

int main(int argc, char** argv) {
    context how;
    how.ipc_fd = torvad::peer::ipc_fd_from_arguments(argc, argv);
    int end = how.ipc_fd >= 0 ? argc - 1 : argc;
    for (int i = 2; i < end; ++i)
        how.args.emplace_back(argv[i]);
    if (argc > 1 && std::strcmp(argv[1], "spawn-once") == 0)
        return mode_spawn_once(how, argv[0]);
    for (const auto& entry : modes)
        if (argc > 1 && std::strcmp(argv[1], entry.name) == 0)
            return entry.run(how);
    std::fprintf(stderr, "usage: test_child <mode> [args...] [ipc fd]\n");
    return 64;
}
