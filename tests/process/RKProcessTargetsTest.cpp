// Target selection on scripted process lists: name and pid lookup, descendants, exclusions,
// hidden extra targets and the idle-exit filter.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>

#include "driver/RKMemspreadArgs.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKProcess.h"

namespace {

using Keys = std::vector<int64_t>;

class RKProcessTargetsTest : public ::testing::Test {
protected:
    void SetUp() override {
        platform->addProcess(0, "kernel", 0, PROC_FLAG_SYSTEM);
        platform->addProcess(1, "init", 0);
        platform->selfPid = 600;
    }

    // Parses a command line (without the program name) and resolves it; standard error is kept.
    std::optional<RKTargetMap> resolve(std::vector<std::string> arguments, RKError* error = nullptr) {
        arguments.insert(arguments.begin(), "memspread");
        std::vector<char*> argv;
        for (auto& argument : arguments) argv.push_back(argument.data());
        argv.push_back(nullptr);
        auto args = RKMemspreadArgs::initWithArgc(static_cast<int>(arguments.size()), argv.data());
        EXPECT_TRUE(args);
        testing::internal::CaptureStderr();
        auto result = args ? args->targetProcessesAndError(error) : std::nullopt;
        printed = testing::internal::GetCapturedStderr();
        return result;
    }

    // The keys of the visible (or hidden) targets of a command line.
    Keys targets(std::vector<std::string> arguments, bool hidden = false) {
        Keys keys;
        if (auto map = resolve(std::move(arguments)))
            for (const auto& [key, process] : *map)
                if (process->hiddenFromDisplay() == hidden) keys.push_back(key);
        return keys;
    }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    std::string printed;
};

}  // namespace

TEST_F(RKProcessTargetsTest, NumberStopsTheWalkUnlessItsProcessBearsTheName) {
    platform->addProcess(3, "42");
    platform->addProcess(42, "other");
    platform->addProcess(50, "42");
    auto found = RKProcess::pidsForStringDescriptions({"42"}, nullptr);
    EXPECT_EQ(*found, (RKPidNameMap{{3, "42"}, {42, std::nullopt}}));
    std::strcpy(platform->find(42)->info.pbi_comm, "42");
    found = RKProcess::pidsForStringDescriptions({"42"}, nullptr);
    EXPECT_EQ(*found, (RKPidNameMap{{3, "42"}, {42, "42"}, {50, "42"}}));

    std::vector<std::string> errors;
    found = RKProcess::pidsForStringDescriptions({" +3", "50abc", "Init", "init"}, &errors);
    EXPECT_EQ(*found, (RKPidNameMap{{1, "init"}, {3, std::nullopt}, {50, std::nullopt}}));
    EXPECT_EQ(errors, std::vector<std::string>{"Unable to find pid for process matching 'Init'"});
    platform->listFails = true;
    EXPECT_FALSE(RKProcess::pidsForStringDescriptions({"init"}, &errors));
    EXPECT_EQ(errors, std::vector<std::string>{"Unable to obtain system process list"});
}

TEST_F(RKProcessTargetsTest, DescendantsGenerationByGenerationEachOnce) {
    platform->addProcess(2, "a", 1);
    platform->addProcess(3, "grandchild", 2);
    platform->addProcess(4, "b", 1);
    platform->addProcess(9, "great", 3);
    platform->addProcess(10, "orphan", 77);
    platform->addProcess(600, "memspread", 3);
    // The kernel is its own parent and init's: every reachable process once.
    EXPECT_EQ(*RKProcess::childPidsForPids({0}), (std::vector<pid_t>{0, 1, 2, 4, 3, 9, 600}));
    EXPECT_EQ(*RKProcess::childPidsForPids({3, 2}), (std::vector<pid_t>{3, 2, 9, 600}));
    // Descendants join after the exclusions, so an excluded one is measured, memspread included.
    EXPECT_EQ(targets({"-t", "0", "-x", "great"}), (Keys{0, 1, 2, 3, 4, 9, 600}));
    EXPECT_EQ(targets({"-t", "a", "-x", "a"}), Keys{}) << "the roots themselves stay excluded";
}

TEST_F(RKProcessTargetsTest, UnmappedHiddenTargetsAndIdleExitFilter) {
    platform->addProcess(5, "named");
    platform->addProcess(6, "other");
    platform->addProcess(7, "clean").dirtyFlags = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    platform->addProcess(8, "excluded");
    platform->addProcess(600, "memspread");

    EXPECT_EQ(targets({"--unmapped", "named", "-x", "excluded"}), Keys{5});
    EXPECT_EQ(targets({"--unmapped", "named", "-x", "excluded"}, true), (Keys{1, 6, 7}))
        << "hidden: not the kernel, the exclusions or memspread";
    EXPECT_EQ(targets({"--unmapped", "-s", "named"}, true), (Keys{1, 6, 8}));
    EXPECT_EQ(targets({"-a", "-s"}), (Keys{0, 1, 5, 6, 8}));
    EXPECT_EQ(targets({"-s", "clean", "named"}), Keys{5});

    platform->listFails = true;
    RKError error;
    EXPECT_FALSE(resolve({"-a"}, &error));
    EXPECT_EQ(error.code, 0) << "an unreadable list under -a carries no error";
}

TEST_F(RKProcessTargetsTest, ErrorsAndUnanalyzableTargets) {
    platform->addProcess(5, "worker").taskResult = KERN_PROTECTION_FAILURE;
    platform->addProcess(6, "fine");
    RKError error;
    EXPECT_FALSE(resolve({}, &error));
    EXPECT_EQ(error.code, RKMemspreadErrorNoTarget);
    EXPECT_EQ(error.localizedDescription, "Must specify at least one process or vmsnap");

    auto map = resolve({"nothing", "fine", "worker", "--pid", "77", "Fine"}, &error);
    ASSERT_TRUE(map) << "unresolved names still give a map";
    EXPECT_EQ(map->size(), 1u);
    EXPECT_EQ(error.code, RKMemspreadErrorPid);
    EXPECT_EQ(error.localizedDescription, "Unable to find pid for process matching 'Fine'\n"
                                          "Unable to find pid for process matching 'nothing'");
    EXPECT_EQ(printed, "task_for_pid: permission denied\n"
                       "Unable to analyze process worker [5] (try as root?)\n"
                       "Unable to analyze process with pid 77 (try as root?)\n");
}

TEST_F(RKProcessTargetsTest, ExistingPathsAreSnapshotsOrProcessNames) {
    char path[] = "/tmp/rkXXXXXX";
    ::close(::mkstemp(path));
    RKError error;
    EXPECT_FALSE(resolve({path, "init"}, &error));
    EXPECT_EQ(error.code, RKMemspreadErrorVmsnapOpen);
    EXPECT_EQ(error.localizedDescription->rfind(std::string("Error opening vmsnap ") + path + ": ", 0), 0u);

    // A file that is not a snapshot but bears a process's name targets that process.
    platform->addProcess(9, path);
    EXPECT_EQ(targets({path}), Keys{9});
    ::unlink(path);
}
