#include "support/RKRunCommand.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <iterator>
#include <sstream>
#include <thread>

namespace {

// An anonymous file that one output stream of the child goes to. Files rather than pipes: the
// child can never stall on a full pipe while the parent only waits for it to end.
struct CaptureFile {
    int fd = memfd_create("memspread-test-output", MFD_CLOEXEC);

    ~CaptureFile() { close(fd); }
    std::string contents() const {
        std::string text(static_cast<size_t>(lseek(fd, 0, SEEK_END)), '\0');  // fd checked at start
        ssize_t count = pread(fd, text.data(), text.size(), 0);  // a tmpfs file reads whole
        text.resize(count > 0 ? static_cast<size_t>(count) : 0);
        return text;
    }
};

// Reaps `child` and returns its wait status, killing it once it outlives `timeout`.
int reap(pid_t child, std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    int status = 0;
    while (waitpid(child, &status, WNOHANG) == 0) {
        if (std::chrono::steady_clock::now() >= deadline) kill(child, SIGKILL);
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return status;
}

}  // namespace

RKCommandResult RKRunCommand(const std::vector<std::string>& argv, std::chrono::milliseconds timeout,
                             const std::function<void(pid_t)>& whileRunning) {
    RKCommandResult result;
    CaptureFile out;
    CaptureFile err;
    if (argv.empty() || out.fd < 0 || err.fd < 0) return result;

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, out.fd, STDOUT_FILENO);
    posix_spawn_file_actions_adddup2(&actions, err.fd, STDERR_FILENO);
    std::vector<char*> arguments;
    for (const std::string& argument : argv) arguments.push_back(const_cast<char*>(argument.c_str()));
    arguments.push_back(nullptr);
    pid_t child = -1;
    result.started = posix_spawnp(&child, arguments[0], &actions, nullptr, arguments.data(), environ) == 0;
    posix_spawn_file_actions_destroy(&actions);
    if (!result.started) return result;

    if (whileRunning) whileRunning(child);
    int status = reap(child, timeout);
    if (WIFEXITED(status)) result.exitStatus = WEXITSTATUS(status);
    result.standardOutput = out.contents();
    result.standardError = err.contents();
    return result;
}

std::string RKFileText(const std::string& path) {
    std::ifstream file(path);
    return {std::istreambuf_iterator<char>(file), {}};
}

std::vector<std::string> RKSplitLines(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);) lines.push_back(line);
    return lines;
}
