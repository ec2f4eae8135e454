// Restart latency: from a failing child's exit to its successor's start,
// median over 1000 restarts under torvad, against a bare loop that waits on a
// pidfd and forks and executes the same child at once.
//   bench_restart [path of torvad]
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <poll.h>
#include <pty.h>
#include <string>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace {

constexpr int restarts = 1000;
constexpr std::size_t record_size = 32; // "s|e <20 digits>\n", padded

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

double median_latency_us(const char* log_path) {
    std::FILE* log = std::fopen(log_path, "r");
    std::vector<long long> gaps;
    char kind;
    long long stamp, last_exit = -1;
    while (log && std::fscanf(log, " %c %lld", &kind, &stamp) == 2) {
        if (kind == 'e')
            last_exit = stamp;
        else if (last_exit >= 0)
            gaps.push_back(stamp - last_exit);
    }
    if (log)
        std::fclose(log);
    if (gaps.empty())
        return 0;
    std::nth_element(gaps.begin(), gaps.begin() + gaps.size() / 2, gaps.end());
    return gaps[gaps.size() / 2] / 1000.0;
}

void drain(int fd) {
    char buffer[4096];
    while (read(fd, buffer, sizeof buffer) > 0) {
    }
}

// torvad at a pseudo-terminal, so that it runs in the foreground.
void run_supervised(const char* torvad, const std::string& self, const char* log_path) {
    int terminal = -1;
    pid_t pid = forkpty(&terminal, nullptr, nullptr, nullptr);
    if (pid == 0) {
        execl(torvad, torvad, "--", self.c_str(), "child", log_path, nullptr);
        _exit(127);
    }
    drain(terminal); // ends with EIO once torvad and its children are gone
    waitpid(pid, nullptr, 0);
    close(terminal);
}

// The least a supervisor does: wait on a pidfd, reap, fork and exec again.
void run_bare(const std::string& self, const char* log_path) {
    for (int started = 0; started <= restarts; ++started) {
        pid_t pid = fork();
        if (pid == 0) {
            execl(self.c_str(), self.c_str(), "child", log_path, nullptr);
            _exit(127);
        }
        int pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
        pollfd exited{pidfd, POLLIN, 0};
        poll(&exited, 1, -1);
        siginfo_t info{};
        waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(pidfd), &info, WEXITED);
        close(pidfd);
        if (info.si_status == 0)
            break;
    }
}

} // namespace

int main(int argc, char** argv) {
    if (argc >= 3 && std::strcmp(argv[1], "child") == 0)
        return run_child(argv[2]);
    const char* torvad = argc > 1 ? argv[1] : "./build/torvad";
    char self[4096];
    ssize_t length = readlink("/proc/self/exe", self, sizeof self - 1);
    if (length <= 0)
        return 1;
    self[length] = '\0';
    char supervised_log[] = "/tmp/bench-restart-torvad-XXXXXX";
    char bare_log[] = "/tmp/bench-restart-bare-XXXXXX";
    close(mkstemp(supervised_log));
    close(mkstemp(bare_log));
    run_supervised(torvad, self, supervised_log);
    run_bare(self, bare_log);
    double supervised = median_latency_us(supervised_log), bare = median_latency_us(bare_log);
    std::printf("restart latency median over %d: torvad %.0f us, bare loop %.0f us, ratio %.2f\n",
                restarts, supervised, bare, bare > 0 ? supervised / bare : 0.0);
    unlink(supervised_log);
    unlink(bare_log);
    return supervised > 0 && bare > 0 ? 0 : 1;
}
