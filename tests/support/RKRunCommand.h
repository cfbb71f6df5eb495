// Runs a program as a child process and captures what it wrote and how it ended, for tests that
// exercise the real binary.
#pragma once

#include <chrono>
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
// at the timeout is killed.
RKCommandResult RKRunCommand(const std::vector<std::string>& argv,
                             std::chrono::milliseconds timeout = std::chrono::seconds(120));

// The lines of `text`, each without its "\n"; a final line without "\n" counts too.
std::vector<std::string> RKSplitLines(const std::string& text);
