#include "support/RKFixtureProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <thread>

namespace {

using Clock = std::chrono::steady_clock;

void closeFd(int& fd) {
    if (fd >= 0) ::close(fd);
    fd = -1;
}

bool parseNumber(const std::string& text, uint64_t& value) {
    const char* begin = text.data();
    int base = 10;
    if (text.rfind("0x", 0) == 0) {
        begin += 2;
        base = 16;
    }
    auto [end, ec] = std::from_chars(begin, text.data() + text.size(), value, base);
    return ec == std::errc() && end == text.data() + text.size();
}

std::vector<std::string> words(const std::string& line) {
    std::vector<std::string> result;
    size_t i = 0;
    while (i < line.size()) {
        size_t space = line.find(' ', i);
        if (space == std::string::npos) space = line.size();
        if (space > i) result.push_back(line.substr(i, space - i));
        i = space + 1;
    }
    return result;
}

}  // namespace

bool RKFixtureProcess::start(const std::string& binary, const std::vector<std::string>& arguments,
                             std::chrono::milliseconds timeout) {
    stop();
    int in[2], out[2];
    if (::pipe2(in, O_CLOEXEC) != 0) return error_ = std::strerror(errno), false;
    if (::pipe2(out, O_CLOEXEC) != 0) {
        ::close(in[0]);
        ::close(in[1]);
        return error_ = std::strerror(errno), false;
    }
    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(binary.c_str()));
    for (const auto& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);
    pid_t pid = ::fork();
    if (pid == 0) {
        ::dup2(in[0], STDIN_FILENO);
        ::dup2(out[1], STDOUT_FILENO);
        ::execv(binary.c_str(), argv.data());
        ::_exit(127);
    }
    ::close(in[0]);
    ::close(out[1]);
    stdinFd_ = in[1];
    stdoutFd_ = out[0];
    if (pid < 0) {
        error_ = std::strerror(errno);
        closeFd(stdinFd_);
        closeFd(stdoutFd_);
        return false;
    }
    pid_ = pid;
    if (readUntilReady(timeout)) return true;
    stop();
    return false;
}

bool RKFixtureProcess::readUntilReady(std::chrono::milliseconds timeout) {
    auto deadline = Clock::now() + timeout;
    std::string pending;
    for (;;) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
        if (left <= 0) return error_ = "not ready in time", false;
        pollfd fd{stdoutFd_, POLLIN, 0};
        int polled = ::poll(&fd, 1, static_cast<int>(left));
        if (polled < 0 && errno != EINTR) return error_ = std::strerror(errno), false;
        if (polled <= 0) continue;
        char buffer[1024];
        ssize_t n = ::read(stdoutFd_, buffer, sizeof(buffer));
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return error_ = "exited before it was ready", false;
        pending.append(buffer, static_cast<size_t>(n));
        size_t newline;
        while ((newline = pending.find('\n')) != std::string::npos) {
            std::string line = pending.substr(0, newline);
            pending.erase(0, newline + 1);
            if (line == "ready") return true;
            if (!parseLine(line)) return error_ = "unexpected line: " + line, false;
        }
    }
}

bool RKFixtureProcess::parseLine(const std::string& line) {
    auto parts = words(line);
    uint64_t number = 0;
    if (parts.size() == 2 && parts[0] == "child" && parseNumber(parts[1], number)) {
        childPid_ = static_cast<pid_t>(number);
        return true;
    }
    RKFixtureArea area;
    if (parts.size() != 3 || !parseNumber(parts[1], area.address) || !parseNumber(parts[2], area.size)) return false;
    areas_[parts[0]] = area;
    return true;
}

std::optional<int> RKFixtureProcess::stop(std::chrono::milliseconds timeout) {
    closeFd(stdinFd_);
    closeFd(stdoutFd_);
    if (pid_ <= 0) return std::nullopt;
    int status = 0;
    auto deadline = Clock::now() + timeout;
    pid_t reaped = 0;
    while ((reaped = ::waitpid(pid_, &status, WNOHANG)) == 0 && Clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    if (reaped == 0) {
        ::kill(pid_, SIGKILL);
        reaped = ::waitpid(pid_, &status, 0);
    }
    pid_ = -1;
    childPid_ = -1;
    areas_.clear();
    if (reaped <= 0) return std::nullopt;
    return status;
}

std::optional<RKFixtureArea> RKFixtureProcess::area(const std::string& name) const {
    auto it = areas_.find(name);
    if (it == areas_.end()) return std::nullopt;
    return it->second;
}
