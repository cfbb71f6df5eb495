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
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
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
volatile std::sig_atomic_t gStop = 0;

// Maps and dirties memory, touches it from a second thread, lingers a moment, and exits.
[[noreturn]] void shortLife(std::chrono::milliseconds linger) {
    void* memory = mmap(nullptr, kMapSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (memory != MAP_FAILED) {
        std::memset(memory, 1, kMapSize / 2);
        std::thread([memory] { std::memset(static_cast<char*>(memory) + kMapSize / 2, 2, kMapSize / 2); }).join();
    }
    std::this_thread::sleep_for(linger);
    _exit(0);
}

bool stdinClosed() {
    pollfd input{STDIN_FILENO, POLLIN, 0};
    char byte;
    return poll(&input, 1, 0) > 0 && read(STDIN_FILENO, &byte, 1) <= 0;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1 && std::strcmp(argv[1], "--child") == 0) shortLife(std::chrono::milliseconds(2));
    std::signal(SIGTERM, [](int) { gStop = 1; });
    std::signal(SIGPIPE, SIG_IGN);
    std::deque<std::pair<pid_t, Clock::time_point>> children;
    std::printf("ready\n");
    std::fflush(stdout);
    unsigned serial = 0;
    // Three children every 10 ms: one maps and threads, one execs, one exits at once and stays a
    // zombie until reaped 20 ms later (or sooner, when too many live).
    for (auto next = Clock::now(); !gStop && !stdinClosed();) {
        for (int i = 0; i < 3; i++, serial++) {
            pid_t pid = fork();
            if (pid == 0 && serial % 3 == 0) shortLife(std::chrono::milliseconds(3));
            if (pid == 0 && serial % 3 == 1) execl(argv[0], argv[0], "--child", static_cast<char*>(nullptr));
            if (pid == 0) _exit(0);
            if (pid > 0) children.emplace_back(pid, Clock::now());  // else short of processes: next time
        }
        while (!children.empty() && (Clock::now() - children.front().second > std::chrono::milliseconds(20) ||
                                     children.size() > kMaxLiving)) {
            if (waitpid(children.front().first, nullptr, children.size() > kMaxLiving ? 0 : WNOHANG) == 0) break;
            children.pop_front();
        }
        // Behind: do not try to catch up in a burst.
        next = std::max(next + std::chrono::milliseconds(10), Clock::now());
        std::this_thread::sleep_until(next);
    }
    for (const auto& child : children) kill(child.first, SIGKILL);
    for (const auto& child : children) waitpid(child.first, nullptr, 0);
    std::fprintf(stderr, "memspread_churn: %u processes started\n", serial);
    return 0;
}
