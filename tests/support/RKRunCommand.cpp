#include "support/RKRunCommand.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <string_view>

extern char** environ;

namespace {

using Clock = std::chrono::steady_clock;

struct Pipe {
    int read = -1;
    int write = -1;
    ~Pipe() {
        if (read >= 0) ::close(read);
        if (write >= 0) ::close(write);
    }
    bool open() {
        int fds[2];
        if (pipe2(fds, O_CLOEXEC) != 0) return false;
        read = fds[0];
        write = fds[1];
        return true;
    }
    void closeWrite() {
        ::close(write);
        write = -1;
    }
};

// Appends what is readable; false at end of file.
bool drain(int fd, std::string& into) {
    char buffer[65536];
    ssize_t count = ::read(fd, buffer, sizeof buffer);
    if (count < 0) return errno == EINTR || errno == EAGAIN;
    into.append(buffer, static_cast<size_t>(count));
    return count > 0;
}

int millisecondsUntil(Clock::time_point deadline) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
    return left < 0 ? 0 : static_cast<int>(left);
}

// Reads both pipes until both are closed, sending the optional signal and killing the child at
// the timeout. Both are read together so that neither can fill up and stall the child.
void collect(pid_t child, Pipe& out, Pipe& err, const RKCommandOptions& options, RKCommandResult& result) {
    auto start = Clock::now();
    auto deadline = start + options.timeout;
    // A deadline past the timeout stands for "no signal" (an optional here trips GCC's
    // maybe-uninitialized warning in optimised builds).
    bool signalPending = options.signalAfter.has_value();
    Clock::time_point signalAt = signalPending ? start + *options.signalAfter : deadline;
    bool outOpen = true;
    bool errOpen = true;
    while (outOpen || errOpen) {
        pollfd fds[2] = {{outOpen ? out.read : -1, POLLIN, 0}, {errOpen ? err.read : -1, POLLIN, 0}};
        auto wakeAt = signalPending && signalAt < deadline ? signalAt : deadline;
        int ready = poll(fds, 2, millisecondsUntil(wakeAt));
        if (ready < 0 && errno != EINTR) break;
        if (signalPending && Clock::now() >= signalAt) {
            kill(child, options.signal);
            signalPending = false;
        }
        if (Clock::now() >= deadline) {
            kill(child, SIGKILL);
            result.timedOut = true;
            break;
        }
        if (fds[0].revents) outOpen = drain(out.read, result.standardOutput);
        if (fds[1].revents) errOpen = drain(err.read, result.standardError);
    }
}

}  // namespace

RKCommandResult RKRunCommand(const std::vector<std::string>& argv, const RKCommandOptions& options) {
    RKCommandResult result;
    Pipe out;
    Pipe err;
    if (argv.empty() || !out.open() || !err.open()) return result;

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, out.write, STDOUT_FILENO);
    posix_spawn_file_actions_adddup2(&actions, err.write, STDERR_FILENO);
    std::vector<char*> arguments;
    for (const std::string& argument : argv) arguments.push_back(const_cast<char*>(argument.c_str()));
    arguments.push_back(nullptr);
    pid_t child = -1;
    int spawned = posix_spawnp(&child, arguments[0], &actions, nullptr, arguments.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (spawned != 0) return result;
    result.started = true;
    out.closeWrite();
    err.closeWrite();

    collect(child, out, err, options, result);
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    if (WIFEXITED(status)) result.exitStatus = WEXITSTATUS(status);
    if (WIFSIGNALED(status)) result.terminatingSignal = WTERMSIG(status);
    return result;
}

std::vector<std::string> RKSplitLines(const std::string& text) {
    std::vector<std::string> lines;
    std::string_view rest = text;
    while (!rest.empty()) {
        size_t end = rest.find('\n');
        lines.emplace_back(rest.substr(0, end));
        if (end == std::string_view::npos) break;
        rest.remove_prefix(end + 1);
    }
    return lines;
}
