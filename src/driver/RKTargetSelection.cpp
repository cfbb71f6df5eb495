// Target selection: the target settings of the arguments record become the process objects to
// measure (live processes by pid or name, snapshot files, everything, descendants), minus the
// exclusions and memspread itself.
#include <sys/stat.h>

#include <cstdio>
#include <string_view>

#include "driver/RKMemspreadArgs.h"
#include "model/RKEscapedText.h"
#include "platform/RKPlatform.h"
#include "process/RKProcess.h"
#include "process/RKVmsnapProcess.h"

namespace {

// A snapshot's key in the target map: derived from its path (FNV-1a), kept above every pid so
// a snapshot of a process and the live process can both be targets.
int64_t vmsnapKey(std::string_view path) {
    uint64_t hash = 0xcbf29ce484222325ull;
    for (unsigned char c : path) hash = (hash ^ c) * 0x100000001b3ull;
    return static_cast<int64_t>((hash >> 2) | (1ull << 61));
}

std::string joined(const std::vector<std::string>& lines) {
    std::string text;
    for (const auto& line : lines) {
        if (!text.empty()) text += '\n';
        text += line;
    }
    return text;
}

// Takes a snapshot into `vmsnaps`, enforcing one analysis mode across snapshots and options.
bool adoptVmsnap(RKMemspreadArgs& args, const std::string& path, std::shared_ptr<RKProcess> process,
                 RKTargetMap& vmsnaps, RKError* error) {
    bool mode = process->breakDownPhysMemspread();
    vmsnaps[vmsnapKey(path)] = std::move(process);
    if (args.didSetShouldGetPhysMemspreadBreakdown() && args.shouldGetPhysMemspreadBreakdown() != mode) {
        RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorVmsnapMode,
                     "Vmsnap was gathered with an analysis mode that conflicts with other vmsnaps or "
                     "command line arguments: " + path);
        return false;
    }
    args.setShouldGetPhysMemspreadBreakdown(mode);
    args.setDidSetShouldGetPhysMemspreadBreakdown(true);
    return true;
}

// Every target string naming an existing file is a snapshot, or failing that a process
// description; either way it leaves potentialTargetProcesses. Strings naming no file stay.
bool takeVmsnapInputs(RKMemspreadArgs& args, RKTargetMap& vmsnaps, RKError* error) {
    const RKMemspreadArgs::StringSet candidates = args.potentialTargetProcesses();
    for (const std::string& path : candidates) {
        struct stat file {};
        if (::stat(path.c_str(), &file) != 0) continue;
        RKError openError;
        if (std::shared_ptr<RKProcess> process = RKVmsnapProcess::processWithVmsnap(path, &openError)) {
            if (!adoptVmsnap(args, path, std::move(process), vmsnaps, error)) return false;
        } else {
            auto found = RKProcess::pidsForStringDescriptions({path}, nullptr);
            if (!found || found->empty()) {
                RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorVmsnapOpen,
                             "Error opening vmsnap " + path + ": " + openError.localizedDescription.value_or(""));
                return false;
            }
            args.targetPids()[found->begin()->first] = found->begin()->second;
        }
        args.potentialTargetProcesses().erase(path);
    }
    return true;
}

std::set<pid_t> exclusionSet(const RKMemspreadArgs& args) {
    std::set<pid_t> excluded;
    if (args.excludeSelf()) excluded.insert(RKPlatform::current().ownPid());
    const auto& strings = args.excludedPidsOrProcesses();
    if (strings.empty()) return excluded;
    auto found = RKProcess::pidsForStringDescriptions({strings.begin(), strings.end()}, nullptr);
    if (found)
        for (const auto& entry : *found) excluded.insert(entry.first);
    return excluded;
}

// Names and numbers join targetPids; unresolved ones come back as one code-4 error.
void resolveNamedTargets(RKMemspreadArgs& args, RKError* error) {
    const auto& strings = args.potentialTargetProcesses();
    if (strings.empty()) return;
    std::vector<std::string> messages;
    auto found = RKProcess::pidsForStringDescriptions({strings.begin(), strings.end()}, &messages);
    if (found)
        for (const auto& entry : *found) args.targetPids()[entry.first] = entry.second;
    if (!messages.empty()) RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorPid, joined(messages));
}

void addDescendants(RKMemspreadArgs& args) {
    std::vector<pid_t> roots;
    for (const auto& entry : args.targetPids()) roots.push_back(entry.first);
    auto descendants = RKProcess::childPidsForPids(roots);
    if (!descendants) return;
    for (pid_t pid : *descendants) args.targetPids()[pid] = std::nullopt;
}

// Every process not otherwise measured, measured but hidden, for --unmapped.
std::optional<RKTargetMap> hiddenExtraTargets(const RKMemspreadArgs& args, std::set<pid_t> excluded) {
    for (const auto& entry : args.targetPids()) excluded.insert(entry.first);
    excluded.insert(0);
    auto result = RKProcess::allProcessesExcludingPids(excluded);
    if (result)
        for (auto& entry : *result) entry.second->setHiddenFromDisplay(true);
    return result;
}

void addNamedTargets(const RKMemspreadArgs& args, RKTargetMap& result) {
    for (const auto& [pid, name] : args.targetPids()) {
        if (auto process = RKProcess::processWithPid(pid)) {
            result[pid] = std::move(process);
        } else if (!name) {
            std::fprintf(stderr, "Unable to analyze process with pid %ld (try as root?)\n", static_cast<long>(pid));
        } else {
            std::fprintf(stderr, "Unable to analyze process %s [%ld] (try as root?)\n", RKEscapedText(*name).c_str(),
                         static_cast<long>(pid));
        }
    }
}

}  // namespace

std::optional<RKTargetMap> RKMemspreadArgs::targetProcessesAndError(RKError* error) {
    RKTargetMap vmsnaps;
    if (!takeVmsnapInputs(*this, vmsnaps, error)) return std::nullopt;
    if (targetPids_.empty() && potentialTargetProcesses_.empty() && vmsnaps.empty() && !targetAll_) {
        RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorNoTarget, "Must specify at least one process or vmsnap");
        return std::nullopt;
    }
    std::set<pid_t> excluded = exclusionSet(*this);

    std::optional<RKTargetMap> result;
    if (targetAll_) {
        // Everything; named targets and snapshots play no part.
        result = RKProcess::allProcessesExcludingPids(excluded);
        if (!result) return std::nullopt;
    } else {
        resolveNamedTargets(*this, error);
        for (pid_t pid : excluded) targetPids_.erase(pid);
        // Descendants join after the exclusions, so an excluded descendant is still measured.
        if (targetChildren_) addDescendants(*this);
        if (searchForUnmapped_) {
            result = hiddenExtraTargets(*this, excluded);
            if (!result) return std::nullopt;
        } else {
            result = std::move(vmsnaps);
        }
        addNamedTargets(*this, *result);
    }
    if (skipIdleExitClean_) result = RKProcess::removeIdleExitCleanProcessesFrom(*result);
    return result;
}
