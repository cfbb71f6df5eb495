// Runs a program as a child process and captures what it wrote and how it ended, for tests that
// exercise the real binary.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <vector>

struct RKCommandResult {
    std::string standardOutput;
    std::string standardError;
    std::optional<int> exitStatus;  // set when the program exited (not when a signal ended it)
    bool started = false;           // false when the program could not be spawned

    bool exitedWith(int status) const { return exitStatus == status; }
};

// Runs argv[0] (searched in PATH when it has no '/') with argv, standard input /dev/null,
// standard output and standard error captured separately. Never hangs: a program still running
// at the timeout is killed. `whileRunning`, when given, is called with the child's pid once it
// has started, before it is waited for (to signal it, or change the world around it).
RKCommandResult RKRunCommand(const std::vector<std::string>& argv,
                             std::chrono::milliseconds timeout = std::chrono::seconds(120),
                             const std::function<void(pid_t)>& whileRunning = nullptr);

// The whole text of the file at `path`; empty when it cannot be read.
std::string RKFileText(const std::string& path);

// The lines of `text`, each without its "\n"; a final line without "\n" counts too.
std::vector<std::string> RKSplitLines(const std::string& text);
