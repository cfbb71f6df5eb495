// The process list from /proc: the numeric entries of the proc root, each described by its stat
// file, plus the synthetic pid 0 that stands for the kernel.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKLinuxTask.h"
#include "platform/RKProcFile.h"
#include "platform/RKProcStatParser.h"
#include "platform/RKUniqueFd.h"

namespace {

constexpr const char* kKernelName = "kernel";

// Opens the /proc directory of `pid`. Every file of one record is read below it, so all of them
// describe the same process even if the pid is reused meanwhile.
RKUniqueFd openPidDirectory(const std::string& root, pid_t pid) {
    std::string path = root + '/' + std::to_string(pid);
    return RKUniqueFd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

// One stat read per call, into a buffer reused by the thread.
int readStat(int directory, std::optional<RKProcStat>& stat) {
    thread_local std::string buffer;
    int error = RKReadFileAt(directory, "stat", buffer);
    if (error != 0) return error;
    stat = RKParseProcStat(buffer);
    return stat ? 0 : ESRCH;  // an empty stat file: the process went away mid-read
}

std::optional<pid_t> parsePid(const char* name) {
    pid_t pid = 0;
    const char* end = name + std::strlen(name);
    auto [next, ec] = std::from_chars(name, end, pid);
    if (ec != std::errc() || next != end || name == end || pid <= 0) return std::nullopt;
    return pid;
}

// The ELF identification of the process's executable. Unreadable (another user's process,
// or no executable at all) counts as 64-bit, the common case.
bool isElf32(int directory) {
    RKUniqueFd fd(::openat(directory, "exe", O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) return false;
    char header[16];
    ssize_t n = ::pread(fd.get(), header, sizeof header, 0);
    return n > 0 && RKIsElf32Header(std::string_view(header, static_cast<size_t>(n)));
}

template <size_t N>
void copyName(char (&field)[N], std::string_view name) {
    size_t n = std::min(name.size(), N - 1);
    std::memcpy(field, name.data(), n);
    field[n] = '\0';
}

RKBsdInfo kernelRecord() {
    RKBsdInfo info;
    info.pbi_flags = PROC_FLAG_SYSTEM | PROC_FLAG_LP64;
    info.pbi_status = RKBsdStatusForProcState('R');
    copyName(info.pbi_comm, kKernelName);
    copyName(info.pbi_name, kKernelName);
    return info;
}

std::optional<RKBsdInfo> recordAt(int directory, pid_t pid) {
    std::optional<RKProcStat> stat;
    if (readStat(directory, stat) != 0) return std::nullopt;
    if (stat->flags & RK_PF_KTHREAD) return std::nullopt;
    RKBsdInfo info;
    info.pbi_pid = pid;
    info.pbi_ppid = stat->ppid;
    info.pbi_status = RKBsdStatusForProcState(stat->state);
    info.pbi_flags = isElf32(directory) ? 0 : PROC_FLAG_LP64;
    copyName(info.pbi_comm, stat->comm);  // pbi_name stays empty: Linux keeps one name
    static const long ticksPerSecond = std::max(::sysconf(_SC_CLK_TCK), 1L);
    const auto hz = static_cast<uint64_t>(ticksPerSecond);
    info.pbi_start_tvsec = stat->startTime / hz;
    info.pbi_start_tvusec = stat->startTime % hz * 1000000 / hz;
    return info;
}

int shortStatusAt(int directory, uint32_t& status) {
    std::optional<RKProcStat> stat;
    int error = readStat(directory, stat);
    if (error == ENOENT || error == ESRCH) return ESRCH;
    if (error != 0) return error;
    status = RKBsdStatusForProcState(stat->state);
    return 0;
}

std::optional<std::string> executablePathAt(int directory) {
    char target[4096];
    ssize_t n = ::readlinkat(directory, "exe", target, sizeof target);
    if (n <= 0 || static_cast<size_t>(n) == sizeof target) return std::nullopt;
    std::string_view path(target, static_cast<size_t>(n));
    // The kernel marks an unlinked executable with " (deleted)"; a file still linked under a
    // name that happens to end so keeps its name.
    bool unlinked = false;
    if (path.ends_with(RK_DELETED_SUFFIX)) {
        struct stat file {};
        unlinked = ::fstatat(directory, "exe", &file, 0) != 0 || file.st_nlink == 0;
    }
    path = RKExecutablePathFromLink(path, unlinked);
    if (path.empty()) return std::nullopt;
    return std::string(path);
}

int taskDirectory(RKTask& task) {
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    return target ? target->directoryFd() : -1;
}

}  // namespace

std::optional<std::vector<pid_t>> RKLinuxPlatform::listAllPids() {
    std::unique_ptr<DIR, int (*)(DIR*)> directory(::opendir(procRoot_.c_str()), ::closedir);
    if (!directory) return std::nullopt;
    std::vector<pid_t> pids;
    while (const dirent* entry = ::readdir(directory.get()))
        if (auto pid = parsePid(entry->d_name)) pids.push_back(*pid);
    std::sort(pids.begin(), pids.end());
    // Kernel threads are listed here and dropped by bsdInfo, which reads their stat anyway.
    pids.insert(pids.begin(), 0);
    return pids;
}

std::optional<RKBsdInfo> RKLinuxPlatform::bsdInfo(pid_t pid) {
    if (pid == 0) return kernelRecord();
    if (pid < 0) return std::nullopt;
    RKUniqueFd directory = openPidDirectory(procRoot_, pid);
    if (!directory.valid()) return std::nullopt;
    return recordAt(directory.get(), pid);
}

std::optional<RKBsdInfo> RKLinuxPlatform::taskBsdInfo(RKTask& task) {
    if (task.pid() == 0) return kernelRecord();
    int directory = taskDirectory(task);
    if (directory < 0) return std::nullopt;
    return recordAt(directory, task.pid());
}

int RKLinuxPlatform::shortBsdInfoStatus(pid_t pid, uint32_t& status) {
    if (pid == 0) {
        status = RKBsdStatusForProcState('R');
        return 0;
    }
    RKUniqueFd directory = openPidDirectory(procRoot_, pid);
    if (!directory.valid()) return errno == ENOENT ? ESRCH : errno;
    return shortStatusAt(directory.get(), status);
}

int RKLinuxPlatform::taskShortBsdInfoStatus(RKTask& task, uint32_t& status) {
    int directory = taskDirectory(task);
    if (directory < 0) return EINVAL;
    return shortStatusAt(directory, status);
}

std::optional<std::string> RKLinuxPlatform::executablePath(pid_t pid) {
    if (pid <= 0) return std::nullopt;
    RKUniqueFd directory = openPidDirectory(procRoot_, pid);
    if (!directory.valid()) return std::nullopt;
    return executablePathAt(directory.get());
}

std::optional<std::string> RKLinuxPlatform::taskExecutablePath(RKTask& task) {
    int directory = taskDirectory(task);
    if (task.pid() <= 0 || directory < 0) return std::nullopt;
    return executablePathAt(directory);
}

uint32_t RKLinuxPlatform::dirtyFlags(pid_t) { return 0; }  // Linux has no idle-exit tracking

bool RKLinuxPlatform::hasSharedRegion() { return false; }  // no shared library cache on Linux
