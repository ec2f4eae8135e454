// Restart latency: from a failing child's exit to its successor's start,
// median over 1000 restarts under torvad, under torvad through torvad-wrap,
// under torvad through the least program in front (bench_restart_front: it
// starts the child and waits, nothing more), and in a bare loop that waits on
// a pidfd and spawns the same child at once. The four take turns, one restart each, so that all see
// the same load: each child records its start, says it is ready and waits until the bench lets it
// exit (two FIFOs, the gate), and the bench lets the next one go only once
// the last one's successor has said it is ready. Before the end it reads what
// the wrapper holds in memory, against torvad's own.
//   bench_restart [path of torvad [path of torvad-wrap]]
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
        for (const char* name :
             {"torvad.log", "wrap.log", "front.log", "bare.log", "torvad.gate.ready",
              "torvad.gate.go", "wrap.gate.ready", "wrap.gate.go", "front.gate.ready",
              "front.gate.go", "bare.gate.ready", "bare.gate.go"})
            unlink(file(name).c_str());
        if (!dir.empty())
            rmdir(dir.c_str());
    }
    std::string file(const char* name) const { return dir + "/" + name; }
    bool made() const { return !dir.empty(); }
};

// Takes the turns; false when a child or torvad failed on the way. Before
// the children are let go, measure looks at them once more.
template <class Measure>
bool take_turns(gate (&supervised)[3], gate& bare_gate, bare_loop& bare, Measure measure) {
    for (gate& side : supervised)
        if (!side.wait_for_child())
            return false;
    if (!bare.spawn() || !bare_gate.wait_for_child())
        return false;
    for (int i = 0; i < restarts; ++i) {
        // torvad sees the exit and starts the successor, which comes to the gate.
        for (gate& side : supervised)
            if (!side.release(restart_again) || !side.wait_for_child())
                return false;
        if (!bare_gate.release(restart_again) || bare.reap() != 1 || !bare.spawn() ||
            !bare_gate.wait_for_child())
            return false;
    }
    measure();
    bool ended = true;
    for (gate& side : supervised)
        ended = side.release(end_clean) && ended;
    ended = bare_gate.release(end_clean) && ended;
    return bare.reap() == 0 && ended;
}

// The kB of a process's memory that it alone holds (private pages), and its
// proportional share of the rest too (Pss), from the kernel's summary.
std::pair<long, long> own_memory_kb(pid_t pid) {
    std::FILE* rollup = std::fopen(("/proc/" + std::to_string(pid) + "/smaps_rollup").c_str(), "r");
    long alone = 0, share = 0, kb = 0;
    char line[256], name[64];
    while (rollup && std::fgets(line, sizeof line, rollup)) {
        if (std::sscanf(line, "%63s %ld kB", name, &kb) != 2)
            continue;
        std::string field = name;
        alone += field == "Private_Clean:" || field == "Private_Dirty:" ? kb : 0;
        share = field == "Pss:" ? kb : share;
    }
    if (rollup)
        std::fclose(rollup);
    return {alone, share};
}

// The first child of pid: under the wrapped torvad, the wrapper.
pid_t first_child(pid_t pid) {
    std::string path =
        "/proc/" + std::to_string(pid) + "/task/" + std::to_string(pid) + "/children";
    std::FILE* list = std::fopen(path.c_str(), "r");
    int child = -1;
    if (list && std::fscanf(list, "%d", &child) != 1)
        child = -1;
    if (list)
        std::fclose(list);
    return child;
}

// torvad at a pseudo-terminal, so that it runs in the foreground, with its
// console drained on a thread of its own.
struct console_run {
    pid_t pid = -1;
    int terminal = -1;
    std::atomic<bool> ended{false};
    std::thread drain;

    bool start(std::vector<const char*> argv) {
        pid = forkpty(&terminal, nullptr, nullptr, nullptr);
        if (pid == 0) {
            argv.push_back(nullptr);
            execv(argv[0], const_cast<char**>(argv.data()));
            _exit(127);
        }
        if (pid != -1)
            drain = std::thread(drain_console, terminal, pid, std::ref(ended));
        return pid != -1;
    }
    // True when torvad ended by itself with status 0.
    bool finish() {
        drain.join();
        int status = 0;
        waitpid(pid, &status, 0);
        close(terminal);
        return ended && WIFEXITED(status) && WEXITSTATUS(status) == 0;
    }
};

} // namespace

int main(int argc, char** argv) {
    if (argc >= 4 && std::strcmp(argv[1], "child") == 0)
        return run_child(argv[2], argv[3]);
    const char* torvad = argc > 1 ? argv[1] : "./build/torvad";
    const char* wrap = argc > 2 ? argv[2] : "./build/torvad-wrap";
    char self[4096];
    ssize_t length = readlink("/proc/self/exe", self, sizeof self - 1);
    scratch files;
    if (length <= 0 || access(torvad, X_OK) != 0 || access(wrap, X_OK) != 0 || !files.made()) {
        std::fprintf(stderr, "usage: %s [path of torvad [path of torvad-wrap]]\n", argv[0]);
        return 1;
    }
    self[length] = '\0';
    std::string front = std::string(self, std::strrchr(self, '/')) + "/bench_restart_front";
    char wrap_path[4096];
    if (realpath(wrap, wrap_path) == nullptr || access(front.c_str(), X_OK) != 0)
        return 1;
    // The supervised sides: the child alone, through torvad-wrap, through the least front.
    const char* const names[] = {"torvad", "wrap", "front"};
    std::vector<const char*> fronts[] = {{}, {wrap_path}, {front.c_str()}};
    std::string logs[4];
    gate supervised[3];
    console_run runs[3];
    for (int side = 0; side < 3; ++side) {
        logs[side] = files.file((names[side] + std::string(".log")).c_str());
        supervised[side].path = files.file((names[side] + std::string(".gate")).c_str());
        std::vector<const char*> argv{torvad, "--"};
        argv.insert(argv.end(), fronts[side].begin(), fronts[side].end());
        argv.insert(argv.end(), {self, "child", logs[side].c_str(), supervised[side].path.c_str()});
        if (!supervised[side].open_fifos() || !runs[side].start(argv))
            return 1;
    }
    logs[3] = files.file("bare.log");
    gate bare_gate{files.file("bare.gate")};
    if (!bare_gate.open_fifos())
        return 1;
    bare_loop bare{
        {self, const_cast<char*>("child"), logs[3].data(), bare_gate.path.data(), nullptr}};
    std::pair<long, long> wrapper_kb, torvad_kb;
    bool turns_ok = take_turns(supervised, bare_gate, bare, [&] {
        wrapper_kb = own_memory_kb(first_child(runs[1].pid));
        torvad_kb = own_memory_kb(runs[1].pid);
    });
    // A child that failed on the way leaves torvad waiting for nothing.
    for (console_run& run : runs)
        if (!turns_ok)
            kill(-run.pid, SIGKILL);
    bool torvads_ok = true;
    for (console_run& run : runs)
        torvads_ok = run.finish() && torvads_ok;
    double medians[4];
    for (int side = 0; side < 4; ++side) {
        std::vector<double> gaps = restart_gaps_us(logs[side]);
        if (!turns_ok || !torvads_ok || gaps.size() != restarts) {
            std::fprintf(stderr, "incomplete run: %zu restarts in %s\n", gaps.size(),
                         logs[side].c_str());
            return 1;
        }
        medians[side] = median(gaps);
    }
    double ours = medians[0], through_wrap = medians[1], through_front = medians[2];
    std::printf("restart latency median over %d, taking turns: torvad %.0f us, bare loop %.0f us, "
                "ratio %.2f\n",
                restarts, ours, medians[3], ours / medians[3]);
    std::printf("through torvad-wrap: %.0f us, ratio %.2f to the bare restart under torvad\n",
                through_wrap, through_wrap / ours);
    // Any program in front that ends with its child adds one process's start
    // and end to each restart: what is left beyond that is the wrapper's own.
    std::printf("through the least front (start, wait, end): %.0f us, ratio %.2f; torvad-wrap "
                "over it: ratio %.2f\n",
                through_front, through_front / ours, through_wrap / through_front);
    std::printf("torvad-wrap's own memory: %ld kB private, %ld kB proportional (Pss); torvad's: "
                "%ld kB, %ld kB; ratio %.2f\n",
                wrapper_kb.first, wrapper_kb.second, torvad_kb.first, torvad_kb.second,
                double(wrapper_kb.first) / double(torvad_kb.first));
    return 0;
}
