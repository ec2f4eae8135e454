// Restart latency: from a failing child's exit to its successor's start,
// median over 1000 restarts under torvad, against a bare loop that waits on a
// pidfd and spawns the same child at once. The two take turns, one restart
// each, so that both see the same load: each child records its start, says
// it is ready and waits until the bench lets it exit (two FIFOs, the gate),
// and the bench lets the next one go only once the last one's successor has
// said it is ready.
//   bench_restart [path of torvad]
#include <algorithm>
#include <atomic>
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
#include <thread>
#include <unistd.h>
#include <vector>

extern char** environ;

namespace {

constexpr int restarts = 1000;
constexpr std::size_t record_size = 32; // "s|e <20 digits>\n", padded
constexpr int run_limit_s = 120;        // a hung torvad fails the run instead
constexpr char restart_again = 'g', end_clean = 'q';

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

// The child: records its start, says it is ready, waits to be told, records
// its exit and fails, so that it is started again, until told to end.
int run_child(const char* log_path, const char* gate_path) {
    int log = open(log_path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    record(log, 's');
    std::string gate = gate_path;
    // The bench holds both FIFOs open: neither open blocks.
    int ready = open((gate + ".ready").c_str(), O_WRONLY | O_CLOEXEC);
    int go = open((gate + ".go").c_str(), O_RDONLY | O_CLOEXEC);
    char told = end_clean;
    if (ready == -1 || go == -1 || write(ready, "r", 1) != 1 || read(go, &told, 1) != 1)
        return 71;
    record(log, 'e');
    return told == restart_again ? 1 : 0;
}

// One side's gate. Only one child of a side waits at a time, and each takes
// exactly one byte, so a byte can't reach the wrong child.
struct gate {
    std::string path;
    int ready = -1, go = -1;
    bool open_fifos() {
        std::string ready_path = path + ".ready", go_path = path + ".go";
        if (mkfifo(ready_path.c_str(), 0600) != 0 || mkfifo(go_path.c_str(), 0600) != 0)
            return false;
        // Read and write: the bench is a reader and a writer of each, always.
        ready = open(ready_path.c_str(), O_RDWR | O_CLOEXEC);
        go = open(go_path.c_str(), O_RDWR | O_CLOEXEC);
        return ready != -1 && go != -1;
    }
    bool wait_for_child() {
        char said;
        return read(ready, &said, 1) == 1;
    }
    bool release(char told) { return write(go, &told, 1) == 1; }
};

// The gaps from each exit to the next start in one log, in microseconds.
std::vector<double> restart_gaps_us(const std::string& log_path) {
    std::FILE* log = std::fopen(log_path.c_str(), "r");
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

// Reads torvad's console while it runs (EIO once it and its children are
// gone), so that its log lines never block it. Past the deadline torvad is
// killed and the bench ends: a gate would wait for its child forever.
void drain_console(int terminal, pid_t torvad_pid, std::atomic<bool>& ended) {
    const long long deadline = now_ns() + run_limit_s * 1000000000LL;
    char buffer[4096];
    while (now_ns() < deadline) {
        pollfd output{terminal, POLLIN, 0};
        if (poll(&output, 1, 100) == 1 && read(terminal, buffer, sizeof buffer) <= 0) {
            ended = true;
            return;
        }
    }
    kill(-torvad_pid, SIGKILL);
    std::fprintf(stderr, "torvad did not end within %d s and was killed\n", run_limit_s);
    _exit(1);
}

// The least a supervisor does: wait on a pidfd, reap, spawn again.
struct bare_loop {
    std::vector<char*> argv;
    pid_t pid = -1;
    int pidfd = -1;

    bool spawn() {
        if (posix_spawn(&pid, argv[0], nullptr, nullptr, argv.data(), environ) != 0)
            return false;
        pidfd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
        return pidfd != -1;
    }
    // Waits for the child's end; its status.
    int reap() {
        pollfd exited{pidfd, POLLIN, 0};
        poll(&exited, 1, -1);
        siginfo_t info{};
        waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(pidfd), &info, WEXITED);
        close(pidfd);
        return info.si_status;
    }
};

// A scratch directory with a log and a gate for each side, gone with the object.
struct scratch {
    std::string dir;
    scratch() {
        char pattern[] = "/tmp/bench-restart-XXXXXX";
        if (mkdtemp(pattern) != nullptr)
            dir = pattern;
    }
    ~scratch() {
        for (const char* name : {"torvad.log", "bare.log", "torvad.gate.ready", "torvad.gate.go",
                                 "bare.gate.ready", "bare.gate.go"})
            unlink(file(name).c_str());
        if (!dir.empty())
            rmdir(dir.c_str());
    }
    std::string file(const char* name) const { return dir + "/" + name; }
    bool made() const { return !dir.empty(); }
};

// Takes the turns; false when a child or torvad failed on the way.
bool take_turns(gate& supervised, gate& bare_gate, bare_loop& bare) {
    if (!supervised.wait_for_child() || !bare.spawn() || !bare_gate.wait_for_child())
        return false;
    for (int i = 0; i < restarts; ++i) {
        // torvad sees the exit and starts the successor, which comes to the gate.
        if (!supervised.release(restart_again) || !supervised.wait_for_child())
            return false;
        if (!bare_gate.release(restart_again) || bare.reap() != 1 || !bare.spawn() ||
            !bare_gate.wait_for_child())
            return false;
    }
    bool ended = supervised.release(end_clean) && bare_gate.release(end_clean);
    return bare.reap() == 0 && ended;
}

} // namespace

int main(int argc, char** argv) {
    if (argc >= 4 && std::strcmp(argv[1], "child") == 0)
        return run_child(argv[2], argv[3]);
    const char* torvad = argc > 1 ? argv[1] : "./build/torvad";
    char self[4096];
    ssize_t length = readlink("/proc/self/exe", self, sizeof self - 1);
    scratch files;
    if (length <= 0 || access(torvad, X_OK) != 0 || !files.made()) {
        std::fprintf(stderr, "usage: %s [path of torvad]\n", argv[0]);
        return 1;
    }
    self[length] = '\0';
    std::string torvad_log = files.file("torvad.log"), bare_log = files.file("bare.log");
    gate supervised{files.file("torvad.gate")}, bare_gate{files.file("bare.gate")};
    if (!supervised.open_fifos() || !bare_gate.open_fifos())
        return 1;
    // torvad at a pseudo-terminal, so that it runs in the foreground.
    int terminal = -1;
    pid_t pid = forkpty(&terminal, nullptr, nullptr, nullptr);
    if (pid == -1)
        return 1;
    if (pid == 0) {
        execl(torvad, torvad, "--", self, "child", torvad_log.c_str(), supervised.path.c_str(),
              nullptr);
        _exit(127);
    }
    std::atomic<bool> console_ended{false};
    std::thread console(drain_console, terminal, pid, std::ref(console_ended));
    bare_loop bare{
        {self, const_cast<char*>("child"), bare_log.data(), bare_gate.path.data(), nullptr}};
    bool turns_ok = take_turns(supervised, bare_gate, bare);
    // A child that failed on the way leaves torvad waiting for nothing.
    if (!turns_ok)
        kill(-pid, SIGKILL);
    console.join();
    int status = 0;
    waitpid(pid, &status, 0);
    close(terminal);
    auto under_torvad = restart_gaps_us(torvad_log), in_bare_loop = restart_gaps_us(bare_log);
    bool torvad_ok = console_ended && WIFEXITED(status) && WEXITSTATUS(status) == 0;
    if (!turns_ok || !torvad_ok || under_torvad.size() != restarts ||
        in_bare_loop.size() != restarts) {
        std::fprintf(stderr,
                     "incomplete run: %zu restarts under torvad (status 0x%x), %zu in the "
                     "bare loop\n",
                     under_torvad.size(), status, in_bare_loop.size());
        return 1;
    }
    double ours = median(under_torvad), baseline = median(in_bare_loop);
    std::printf("restart latency median over %d, taking turns: torvad %.0f us, bare loop %.0f us, "
                "ratio %.2f\n",
                restarts, ours, baseline, ours / baseline);
    return 0;
}
