// Churns processes for the churn test: forks, execs and reaps a few hundred short-lived processes
// a second, so that a measurement of all processes meets processes that appear, map memory,
// start threads, exec, exit and linger as zombies while it reads them.
//
// Prints "ready" once churning, then churns until its standard input closes or SIGTERM comes,
// and kills and reaps what is left.
//
// Usage: memspread_churn            (the churning parent)
//        memspread_churn --child    (what its exec'ing children run: map, touch, thread, exit)
#include <poll.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <deque>
#include <thread>

namespace {

using Clock = std::chrono::steady_clock;

constexpr size_t kMapSize = 1 << 20;
constexpr size_t kMaxLiving = 96;
constexpr auto kZombieTime = std::chrono::milliseconds(20);  // how long an exited child stays unreaped
constexpr auto kBatchInterval = std::chrono::milliseconds(10);
constexpr int kBatchSize = 3;  // three children per 10 ms: 300 a second

volatile std::sig_atomic_t gStop = 0;

void sleepFor(std::chrono::microseconds time) {
    timespec ts{static_cast<time_t>(time.count() / 1000000), static_cast<long>(time.count() % 1000000 * 1000)};
    nanosleep(&ts, nullptr);
}

// Maps and dirties memory, touches it from a second thread, lingers a moment, and exits.
[[noreturn]] void shortLife(std::chrono::microseconds linger) {
    void* memory = mmap(nullptr, kMapSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (memory != MAP_FAILED) {
        std::memset(memory, 1, kMapSize / 2);
        std::thread toucher([memory] { std::memset(static_cast<char*>(memory) + kMapSize / 2, 2, kMapSize / 2); });
        toucher.join();
    }
    sleepFor(linger);
    _exit(0);
}

struct Child {
    pid_t pid;
    Clock::time_point born;
};

bool stdinClosed() {
    pollfd input{STDIN_FILENO, POLLIN, 0};
    if (poll(&input, 1, 0) <= 0) return false;
    char byte;
    return read(STDIN_FILENO, &byte, 1) <= 0;
}

void spawn(const char* self, unsigned serial, std::deque<Child>& children) {
    pid_t pid = fork();
    if (pid < 0) return;  // the system is short of processes: try again next batch
    if (pid == 0) {
        switch (serial % 3) {
            case 0: shortLife(std::chrono::milliseconds(3));
            case 1: execl(self, self, "--child", static_cast<char*>(nullptr)); _exit(127);
            default: _exit(0);  // exits at once: a zombie until reaped
        }
    }
    children.push_back({pid, Clock::now()});
}

// Reaps the children old enough, and the oldest ones when too many live.
void reap(std::deque<Child>& children) {
    const auto now = Clock::now();
    while (!children.empty() && (now - children.front().born > kZombieTime || children.size() > kMaxLiving)) {
        int status = 0;
        bool tooMany = children.size() > kMaxLiving;
        pid_t done = waitpid(children.front().pid, &status, tooMany ? 0 : WNOHANG);
        if (done == 0) break;  // still running: reaped on a later pass
        children.pop_front();
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1 && std::strcmp(argv[1], "--child") == 0) shortLife(std::chrono::milliseconds(2));
    std::signal(SIGTERM, [](int) { gStop = 1; });
    std::signal(SIGPIPE, SIG_IGN);
    std::deque<Child> children;
    std::printf("ready\n");
    std::fflush(stdout);
    unsigned serial = 0;
    auto next = Clock::now();
    while (!gStop && !stdinClosed()) {
        for (int i = 0; i < kBatchSize; i++) spawn(argv[0], serial++, children);
        reap(children);
        next += kBatchInterval;
        auto now = Clock::now();
        if (next > now)
            sleepFor(std::chrono::duration_cast<std::chrono::microseconds>(next - now));
        else
            next = now;  // behind: do not try to catch up in a burst
    }
    for (const Child& child : children) kill(child.pid, SIGKILL);
    for (const Child& child : children) waitpid(child.pid, nullptr, 0);
    std::fprintf(stderr, "memspread_churn: %u processes started\n", serial);
    return 0;
}
