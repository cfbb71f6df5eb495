// Page data costs the pages present, not the address space: a process that reserved a
// terabyte (private, shared with its forked child, and shared anonymous), with a few pages
// written, is read in little memory and time.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/RKLinuxPageReader.h"
#include "support/RKFixtureProcess.h"

extern char** environ;

namespace {

TEST(RKSparsePages, ATerabyteReservedCostsItsPagesOnly) {
    if (!RKProbePageReading("/proc").pagemapScan) GTEST_SKIP() << "without PAGEMAP_SCAN every pagemap entry is read";
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_SPARSE_FIXTURE)) << fixture.error();
    ASSERT_TRUE(fixture.area("reserved") && fixture.area("shared"));

    // Spawned here rather than through RKRunCommand, for its own resource usage.
    const std::string pid = std::to_string(fixture.pid());
    std::vector<std::string> arguments = {MEMSPREAD_BINARY, "-f", "bytes", "-t", pid};
    std::vector<char*> argv;
    for (std::string& argument : arguments) argv.push_back(argument.data());
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
    pid_t child = -1;
    ASSERT_EQ(posix_spawn(&child, argv[0], &actions, nullptr, argv.data(), environ), 0);
    posix_spawn_file_actions_destroy(&actions);
    int status = 0;
    rusage usage{};
    ASSERT_EQ(wait4(child, &status, 0, &usage), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

    // Reading every page of it took 1.3 GB and 10 s of CPU; a run without it, some megabytes.
    const double cpu = static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
                       static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
    EXPECT_LT(usage.ru_maxrss, 256 * 1024) << "peak resident kB";
    EXPECT_LT(cpu, 2.0) << "seconds of CPU";
}

}  // namespace
