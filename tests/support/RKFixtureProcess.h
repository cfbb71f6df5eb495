// Starts the fixture program (a process with a known memory layout), reads the areas it
// announces, and stops and reaps it. Tests measure the running fixture.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

struct RKFixtureArea {
    uint64_t address = 0;
    uint64_t size = 0;
};

class RKFixtureProcess {
public:
    RKFixtureProcess() = default;
    ~RKFixtureProcess() { stop(); }
    RKFixtureProcess(const RKFixtureProcess&) = delete;
    RKFixtureProcess& operator=(const RKFixtureProcess&) = delete;

    // Runs `binary` with `arguments` and waits until it says "ready". False, with the reason in
    // error(), when it cannot be started, exits, or is not ready within 20 seconds.
    bool start(const std::string& binary, const std::vector<std::string>& arguments = {});
    // Closes its standard input and reaps it, killing it when it does not end within 5 seconds.
    void stop();

    pid_t pid() const { return pid_; }
    pid_t childPid() const { return childPid_; }
    // The area the fixture announced under `name`, if it made one.
    std::optional<RKFixtureArea> area(const std::string& name) const;
    const std::string& error() const { return error_; }

private:
    bool readUntilReady();

    pid_t pid_ = -1;
    pid_t childPid_ = -1;
    int stdinFd_ = -1;
    int stdoutFd_ = -1;
    std::map<std::string, RKFixtureArea> areas_;
    std::string error_;
};
