// Restart latency: from a failing child's exit to its successor's start,
// median over 1000 restarts under torvad, against a bare loop that waits on a
// pidfd and spawns the same child at once.
//   bench_restart [path of torvad]
#include <algorithm>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <poll.h>
#include <pty.h>
#include <spawn.h>
#include <string>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

extern char** environ;

namespace {

constexpr int restarts = 1000;
constexpr std::size_t record_size = 32; // "s|e <20 digits>\n", padded
constexpr int run_limit_s = 60;         // a hung torvad fails the run instead

long long now_ns() {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return now.tv_sec * 1000000000LL + now.tv_nsec;
}

void record(int fd, char kind) {
    char line[record_size + 1];
    std::snprintf(line, sizeof line, "%c %-29lld\n", kind, now_ns());
    if (write(fd, line, record_size) != static_cast<ssize_t>(record_size))
        _exit(70);
}

// The child: records its start and its exit; fails until the log holds
// enough starts, then ends with 0 so that torvad ends too.
int run_child(const char* log_path) {
    int log = open(log_path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    record(log, 's');
    struct stat info {};
    fstat(log, &info);
    bool enough = info.st_size / record_size / 2 >= restarts;
    record(log, 'e');
    return enough ? 0 : 1;
}

// The gaps from each exit to the next start in one log, in microseconds.
std::vector<double> restart_gaps_us(const char* log_path) {
    std::FILE* log = std::fopen(log_path, "r");
    std::vector<double> gaps;
    char kind;
    long long stamp, last_exit = -1;
    while (log && std::fscanf(log, " %c %lld", &kind, &stamp) == 2) {
        if (kind == 'e')
            last_exit = stamp;
        else if (last_exit >= 0)
            gaps.push_back((stamp - last_exit) / 1000.0);
    }
    if (log)
        std::fclose(log);
    return gaps;
}

double median(std::vector<double> values) {
    if (values.empty())
        return 0;
    std::nth_element(values.begin(), values.begin() + values.size() / 2, values.end());
    return values[values.size() / 2];
}

// Reads torvad's console until it ends (EIO once it and its children are
// gone). A run past the deadline is a hang: torvad is killed and false returned.
bool drain_until_end(int terminal, pid_t torvad_pid) {
    const long long deadline = now_ns() + run_limit_s * 1000000000LL;
    char buffer[4096];
    while (now_ns() < deadline) {
        pollfd output{terminal, POLLIN, 0};
        if (poll(&output, 1, 100) == 1 && read(terminal, buffer, sizeof buffer) <= 0)
            return true;
    }
    kill(torvad_pid, SIGKILL);
    return false;
}

// torvad at a pseudo-terminal, so that it runs in the foreground.
bool run_supervised(const char* torvad, const std::string& self, const char* log_path) {
    int terminal = -1;
    pid_t pid = forkpty(&terminal, nullptr, nullptr, nullptr);
    if (pid == -1)
        return false;
    if (pid == 0) {
        execl(torvad, torvad, "--", self.c_str(), "child", log_path, nullptr);
        _exit(127);
    }
    bool ended = drain_until_end(terminal, pid);
    int status = 0;
    waitpid(pid, &status, 0);
    close(terminal);
    if (!ended)
        std::fprintf(stderr, "torvad did not end within %d s\n", run_limit_s);
    else if (!WIFEXITED(status) || WEXITSTATUS(status) != 0)
        std::fprintf(stderr, "torvad ended with status 0x%x\n", status);
    return ended && WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// The least a supervisor does: spawn, wait on a pidfd, reap, spawn again.
void run_bare(const std::string& self, const char* log_path) {
    char* argv[] = {const_cast<char*>(self.c_str()), const_cast<char*>("child"),
                    const_cast<char*>(log_path), nullptr};
    for (int started = 0; started <= restarts; ++started) {
        pid_t pid = -1;
        if (posix_spawn(&pid, self.c_str(), nullptr, nullptr, argv, environ) != 0)
            return;
        int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
        if (pidfd == -1) {
            waitpid(pid, nullptr, 0);
            return;
        }
        pollfd exited{pidfd, POLLIN, 0};
        poll(&exited, 1, -1);
        siginfo_t info{};
        waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(pidfd), &info, WEXITED);
        close(pidfd);
        if (info.si_status == 0)
            break;
    }
}

// A log file of its own for one side of the run, or an empty name.
std::string temporary_log(const char* side) {
    std::string path = std::string("/tmp/bench-restart-") + side + "-XXXXXX";
    int fd = mkstemp(path.data());
    if (fd == -1)
        return {};
    close(fd);
    return path;
}

} // namespace

int main(int argc, char** argv) {
    if (argc >= 3 && std::strcmp(argv[1], "child") == 0)
        return run_child(argv[2]);
    const char* torvad = argc > 1 ? argv[1] : "./build/torvad";
    char self[4096];
    ssize_t length = readlink("/proc/self/exe", self, sizeof self - 1);
    if (length <= 0 || access(torvad, X_OK) != 0) {
        std::fprintf(stderr, "usage: %s [path of torvad]\n", argv[0]);
        return 1;
    }
    self[length] = '\0';
    std::string supervised_log = temporary_log("torvad"), bare_log = temporary_log("bare");
    bool supervised_ok = run_supervised(torvad, self, supervised_log.c_str());
    run_bare(self, bare_log.c_str());
    auto supervised = restart_gaps_us(supervised_log.c_str());
    auto bare = restart_gaps_us(bare_log.c_str());
    unlink(supervised_log.c_str());
    unlink(bare_log.c_str());
    if (!supervised_ok || supervised.size() != restarts || bare.size() != restarts) {
        std::fprintf(stderr, "incomplete run: %zu restarts under torvad, %zu in the bare loop\n",
                     supervised.size(), bare.size());
        return 1;
    }
    std::printf("restart latency median over %d: torvad %.0f us, bare loop %.0f us, ratio %.2f\n",
                restarts, median(supervised), median(bare), median(supervised) / median(bare));
    return 0;
}
