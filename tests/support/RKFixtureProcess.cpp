#include "support/RKFixtureProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <thread>

using Clock = std::chrono::steady_clock;

bool RKFixtureProcess::start(const std::string& binary, const std::vector<std::string>& arguments) {
    stop();
    int in[2], out[2];
    if (::pipe2(in, O_CLOEXEC) != 0 || ::pipe2(out, O_CLOEXEC) != 0) return error_ = std::strerror(errno), false;
    std::vector<char*> argv{const_cast<char*>(binary.c_str())};
    for (const auto& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);
    pid_ = ::fork();
    if (pid_ == 0) {
        ::dup2(in[0], STDIN_FILENO);
        ::dup2(out[1], STDOUT_FILENO);
        ::execv(binary.c_str(), argv.data());
        ::_exit(127);
    }
    if (pid_ < 0) error_ = std::strerror(errno);
    ::close(in[0]);
    ::close(out[1]);
    stdinFd_ = in[1];
    stdoutFd_ = out[0];
    if (pid_ > 0 && readUntilReady()) return true;
    stop();
    return false;
}

// The announced lines, up to "ready".
bool RKFixtureProcess::readUntilReady() {
    auto deadline = Clock::now() + std::chrono::seconds(20);
    std::string pending;
    for (;;) {
        for (size_t newline; (newline = pending.find('\n')) != std::string::npos; pending.erase(0, newline + 1)) {
            std::string line = pending.substr(0, newline);
            if (line == "ready") return true;
            // "NAME 0xADDRESS SIZE" or "child PID" (%i reads a 0x prefix as hexadecimal).
            char name[64];
            long long first = 0;
            unsigned long long second = 0;
            int fields = std::sscanf(line.c_str(), "%63s %lli %llu", name, &first, &second);
            if (fields == 2 && std::string(name) == "child")
                childPid_ = static_cast<pid_t>(first);
            else if (fields == 3)
                areas_[name] = RKFixtureArea{static_cast<uint64_t>(first), second};
            else
                return error_ = "unexpected line: " + line, false;
        }
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
        pollfd fd{stdoutFd_, POLLIN, 0};
        if (left <= 0 || ::poll(&fd, 1, static_cast<int>(left)) <= 0) return error_ = "not ready in time", false;
        char buffer[1024];
        ssize_t n = ::read(stdoutFd_, buffer, sizeof(buffer));
        if (n <= 0) return error_ = "exited before it was ready", false;
        pending.append(buffer, static_cast<size_t>(n));
    }
}

void RKFixtureProcess::stop() {
    ::close(stdinFd_);  // EBADF when not open: harmless
    ::close(stdoutFd_);
    stdinFd_ = stdoutFd_ = -1;
    auto deadline = Clock::now() + std::chrono::seconds(5);
    while (pid_ > 0 && ::waitpid(pid_, nullptr, WNOHANG) == 0) {
        if (Clock::now() > deadline) ::kill(pid_, SIGKILL);
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    pid_ = childPid_ = -1;
    areas_.clear();
}

std::optional<RKFixtureArea> RKFixtureProcess::area(const std::string& name) const {
    auto it = areas_.find(name);
    return it == areas_.end() ? std::nullopt : std::optional(it->second);
}
