// The class operations that read the system's process list for target selection: the list
// itself, name and pid lookup, descendants, and the idle-exit filter.
#include <algorithm>
#include <cstdlib>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "platform/RKErrorCapture.h"
#include "platform/RKPlatform.h"
#include "platform/RKWorkerPool.h"
#include "process/RKProcess.h"
#include "process/RKUnreadProcess.h"

namespace {

// A signed decimal integer at the start of the text: leading white space and a sign allowed,
// trailing text ignored ("12abc" is 12).
std::optional<long long> leadingInteger(const std::string& text) {
    const char* start = text.c_str();
    char* end = nullptr;
    long long value = std::strtoll(start, &end, 10);
    if (end == start) return std::nullopt;
    return value;
}

// The list's names, each read once (a name may take a readlink), and where each name and pid is.
struct ListIndex {
    explicit ListIndex(const std::vector<RKBsdInfo>& list) {
        names.reserve(list.size());
        for (size_t i = 0; i < list.size(); i++) {
            names.push_back(RKProcess::_nameForBsdInfo(list[i]));
            byName[names.back()].push_back(i);
            byPid.try_emplace(list[i].pbi_pid, i);
        }
    }
    std::vector<std::string> names;
    std::unordered_map<std::string, std::vector<size_t>> byName;  // ascending
    std::unordered_map<long long, size_t> byPid;
};

// Resolves one description against the list, as a walk of it would: every process whose name
// equals it is taken by name; the walk stops at a process whose pid equals its number, which is
// taken by number. Through the index, so that many descriptions cost no more than one walk each.
bool resolveDescription(const std::string& description, const std::vector<RKBsdInfo>& list, const ListIndex& index,
                        RKPidNameMap& result) {
    std::optional<long long> number = leadingInteger(description);
    size_t stop = list.size();
    if (number) {
        auto numbered = index.byPid.find(*number);
        if (numbered != index.byPid.end() && index.names[numbered->second] != description) stop = numbered->second;
    }
    bool found = false;
    if (auto named = index.byName.find(description); named != index.byName.end()) {
        for (size_t i : named->second) {
            if (i >= stop) break;
            result[list[i].pbi_pid] = description;
            found = true;
        }
    }
    if (stop == list.size()) return found;
    result[list[stop].pbi_pid] = std::nullopt;
    return true;
}

}  // namespace

// Each record is read on its own, side by side; the list keeps the kernel's order.
std::optional<std::vector<RKBsdInfo>> RKCopyAllBsdInfo() {
    RKPlatform& platform = RKPlatform::current();
    auto pids = platform.listAllPids();
    if (!pids) return std::nullopt;
    std::vector<std::optional<RKBsdInfo>> read(pids->size());
    RKParallelApplyOnEveryCpu(pids->size(), [&](size_t i) { read[i] = platform.bsdInfo((*pids)[i]); });
    std::vector<RKBsdInfo> records;
    records.reserve(read.size());
    for (const auto& info : read)
        if (info) records.push_back(*info);  // gone or hidden: dropped
    if (records.empty()) return std::nullopt;
    return records;
}

// Each process is opened on its own, so the processes are read side by side; what each writes to
// standard error is kept and written in list order, as one pass in order would.
std::optional<RKTargetMap> RKProcess::allProcessesExcludingPids(const std::set<pid_t>& excluded) {
    auto list = RKCopyAllBsdInfo();
    if (!list) return std::nullopt;
    struct Opened {
        std::shared_ptr<RKProcess> process;
        std::string messages;
    };
    std::vector<Opened> opened(list->size());
    RKParallelApplyOnEveryCpu(list->size(), [&](size_t i) {
        const RKBsdInfo& info = (*list)[i];
        if (excluded.count(info.pbi_pid)) return;
        RKErrorCapture capture;
        kern_return_t taskResult = KERN_FAILURE;
        opened[i].process = processWithBsdInfo(info, &taskResult);
        if (!opened[i].process) opened[i].process = RKUnreadProcess::processForFailure(info, taskResult);
        opened[i].messages = capture.take();
    });
    RKTargetMap result;
    for (size_t i = 0; i < opened.size(); i++) {
        if (!opened[i].messages.empty()) RKWriteError(opened[i].messages);
        if (opened[i].process) result[(*list)[i].pbi_pid] = std::move(opened[i].process);
    }
    return result;
}

std::optional<RKPidNameMap> RKProcess::pidsForStringDescriptions(const std::vector<std::string>& descriptions,
                                                                 std::vector<std::string>* errors) {
    auto list = RKCopyAllBsdInfo();
    if (!list) {
        if (errors) *errors = {"Unable to obtain system process list"};
        return std::nullopt;
    }
    const ListIndex index(*list);
    RKPidNameMap result;
    std::vector<std::string> messages;
    for (const std::string& description : descriptions)
        if (!resolveDescription(description, *list, index, result))
            messages.push_back("Unable to find pid for process matching '" + description + "'");
    if (errors && !messages.empty()) *errors = std::move(messages);
    return result;
}

// Breadth-first over a parent -> children index built once, so the cost is linear in the
// number of processes; each generation keeps the process list's order.
std::optional<std::vector<pid_t>> RKProcess::childPidsForPids(const std::vector<pid_t>& pids) {
    auto list = RKCopyAllBsdInfo();
    if (!list) return std::nullopt;
    std::unordered_map<pid_t, std::vector<size_t>> children;
    for (size_t i = 0; i < list->size(); i++) children[(*list)[i].pbi_ppid].push_back(i);

    std::unordered_set<pid_t> visited;
    std::vector<pid_t> frontier;
    for (pid_t pid : pids)
        if (visited.insert(pid).second) frontier.push_back(pid);
    std::vector<pid_t> result;
    while (!frontier.empty()) {
        result.insert(result.end(), frontier.begin(), frontier.end());
        std::vector<size_t> next;
        for (pid_t parent : frontier) {
            auto it = children.find(parent);
            if (it == children.end()) continue;
            for (size_t index : it->second)
                if (visited.insert((*list)[index].pbi_pid).second) next.push_back(index);
        }
        std::sort(next.begin(), next.end());
        frontier.clear();
        for (size_t index : next) frontier.push_back((*list)[index].pbi_pid);
    }
    return result;
}

RKTargetMap RKProcess::removeIdleExitCleanProcessesFrom(const RKTargetMap& targets) {
    RKTargetMap result = targets;
    std::erase_if(result, [](const auto& entry) { return entry.second->idleExitStatus() == 2; });
    return result;
}
