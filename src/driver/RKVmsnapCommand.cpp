// The companion command: gathers processes through the same process sources as memspread, in
// parallel, and writes each as a snapshot. Files appear whole or not at all (written aside, then
// renamed), so an interrupted or failed save never leaves a file that looks like a snapshot.
#include "driver/RKVmsnapCommand.h"

#include <fcntl.h>
#include <getopt.h>
#include <sys/stat.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "platform/RKPlatform.h"
#include "platform/RKWorkerPool.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKGatherScope.h"
#include "process/RKProcess.h"
#include "process/RKUserProcess.h"
#include "process/RKVmsnapCapture.h"

namespace {

constexpr int kNiceUtility = 5;

void printVmsnapUsage(FILE* out) {
    std::fprintf(out,
                 "Save processes as vmsnap files, to be analyzed later with memspread\n"
                 "Usage: vmsnap [-o FILE] proc/pid [proc/pid [...]]\n"
                 "       vmsnap -a -o DIRECTORY\n"
                 "    -o, --output <path>   the file to write for one process; a directory for several or -a\n"
                 "                          (default: NAME-PID.vmsnap in the current directory)\n"
                 "    -a, --all             save every process (needs root)\n"
                 "    -h, --help            print this output\n");
}

// Platform, machine and kernel: memspread reads "Linux" in it to pick the platform.
std::string systemDescription() {
    struct utsname names {};
    if (uname(&names) != 0) return "Linux";
    return std::string("Linux ") + names.machine + " " + names.release + " " + names.version + " (" + names.nodename + ")";
}

// A file name made of a process name: what is not plainly printable becomes '_'.
std::string fileNameFor(const RKProcess& process) {
    std::string name;
    for (char c : process.name()) name += (std::isalnum(static_cast<unsigned char>(c)) || c == '.' || c == '-') ? c : '_';
    if (name.empty() || name[0] == '.') name.insert(name.begin(), '_');
    return name + "-" + std::to_string(process.pid()) + ".vmsnap";
}

bool writeAtomically(const std::string& path, const std::string& bytes) {
    std::string temporary = path + ".partial-" + std::to_string(getpid());
    int fd = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) return false;
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        done += static_cast<size_t>(n);
    }
    int saved = errno;
    bool ok = done == bytes.size() && ::fsync(fd) == 0;
    saved = ok ? 0 : (errno ? errno : saved);
    ok = ::close(fd) == 0 && ok;
    if (ok && ::rename(temporary.c_str(), path.c_str()) == 0) return true;
    saved = saved ? saved : errno;
    ::unlink(temporary.c_str());
    errno = saved;
    return false;
}

struct Job {
    std::shared_ptr<RKUserProcess> process;
    std::string path;
    bool saved = false;
};

struct Options {
    bool all = false;
    std::optional<std::string> output;
    std::vector<std::string> targets;
};

// 0 to go on, else the exit status (1 on a usage error, 0 for -h) after the usage was printed.
std::optional<int> parseOptions(int argc, char** argv, Options& options) {
    static const option longOptions[] = {{"output", required_argument, nullptr, 'o'},
                                         {"all", no_argument, nullptr, 'a'},
                                         {"help", no_argument, nullptr, 'h'},
                                         {nullptr, 0, nullptr, 0}};
    optind = 1;
    for (int c; (c = getopt_long(argc, argv, "o:ah", longOptions, nullptr)) != -1;) {
        switch (c) {
            case 'o': options.output = optarg; break;
            case 'a': options.all = true; break;
            case 'h': printVmsnapUsage(stdout); return 0;
            default: printVmsnapUsage(stdout); return 1;
        }
    }
    for (int i = optind; i < argc; i++) options.targets.emplace_back(argv[i]);
    if (options.all == !options.targets.empty()) {
        std::fprintf(stderr, "vmsnap: name processes or give -a, not both or neither\n");
        printVmsnapUsage(stdout);
        return 1;
    }
    if (options.all && !options.output) {
        std::fprintf(stderr, "vmsnap: -a needs a directory to write to (-o DIRECTORY)\n");
        return 1;
    }
    return std::nullopt;
}

// The user processes to save; false after a message when they cannot be had.
bool collectProcesses(const Options& options, std::vector<std::shared_ptr<RKUserProcess>>& processes, bool& missed) {
    RKPlatform& platform = RKPlatform::current();
    if (options.all) {
        if (platform.effectiveUserId() != 0) {
            std::fprintf(stderr, "vmsnap: -a needs root\n");
            return false;
        }
        auto all = RKProcess::allProcessesExcludingPids({platform.ownPid()});
        if (!all) {
            std::fprintf(stderr, "vmsnap: Unable to obtain system process list\n");
            return false;
        }
        for (auto& [key, process] : *all)
            if (auto user = std::dynamic_pointer_cast<RKUserProcess>(process)) processes.push_back(std::move(user));
        return true;
    }
    std::vector<std::string> messages;
    auto found = RKProcess::pidsForStringDescriptions(options.targets, &messages);
    for (const std::string& message : messages) std::fprintf(stderr, "vmsnap: %s\n", message.c_str());
    missed = !messages.empty();
    if (!found) return false;
    for (const auto& [pid, name] : *found) {
        auto process = RKProcess::processWithPid(pid);
        auto user = std::dynamic_pointer_cast<RKUserProcess>(process);
        if (!user) {
            std::fprintf(stderr, process ? "vmsnap: pid %ld is the kernel, which has no address space to save\n"
                                         : "vmsnap: Unable to analyze process with pid %ld (try as root?)\n",
                         static_cast<long>(pid));
            missed = true;
            continue;
        }
        processes.push_back(std::move(user));
    }
    return !processes.empty();
}

}  // namespace

int RKVmsnapMain(int argc, char** argv) {
    Options options;
    if (auto status = parseOptions(argc, argv, options)) return *status;
    if (!RKAnalysisSettings::applyEnvironment("vmsnap")) return 1;
    RKAnalysisSettings::setBreakDownPhysMemspread(true);  // memspread's default mode

    std::vector<std::shared_ptr<RKUserProcess>> processes;
    bool missed = false;
    if (!collectProcesses(options, processes, missed)) return 1;

    // One file named by -o, or one file per process in a directory (-o's, or the current one).
    const bool intoDirectory = options.all || processes.size() > 1;
    std::string directory = ".";
    if (intoDirectory && options.output) {
        directory = *options.output;
        if (::mkdir(directory.c_str(), 0755) != 0 && errno != EEXIST) {
            std::fprintf(stderr, "vmsnap: %s: %s\n", directory.c_str(), std::strerror(errno));
            return 1;
        }
    }
    std::vector<Job> jobs;
    for (auto& process : processes) {
        std::string path = !intoDirectory && options.output ? *options.output : directory + "/" + fileNameFor(*process);
        jobs.push_back({std::move(process), std::move(path), false});
    }

    const std::string description = systemDescription();
    RKWorkerPoolOptions pool;
    pool.threads = RKOnlineCpuCount();
    pool.niceIncrement = kNiceUtility;
    RKGatherScope gather;
    RKParallelApply(jobs.size(), pool, [&](size_t i) {
        Job& job = jobs[i];
        job.process->gatherData();
        // A process that failed or vanished while it was read is not saved half.
        if (!job.process->errors().empty() || !job.process->memoryRegions() || job.process->memoryRegions()->empty())
            return;
        std::string bytes = RKVmsnapSerialize(RKVmsnapGraphForProcess(*job.process, description));
        job.saved = !bytes.empty() && writeAtomically(job.path, bytes);
        if (!job.saved) job.path += std::string(": ") + std::strerror(errno ? errno : ENOMEM);
        job.process.reset();  // regions are large: let them go as soon as they are written
    });

    size_t saved = 0;
    for (const Job& job : jobs) {
        if (job.saved) {
            saved++;
            if (!options.all) std::printf("%s\n", job.path.c_str());
            continue;
        }
        // Under -a processes come and go; only the named ones are worth a line each.
        if (options.all && job.process) continue;
        missed = true;
        if (job.process) {
            for (const std::string& line : job.process->errors()) std::fprintf(stderr, "vmsnap: %s\n", line.c_str());
            for (const std::string& line : job.process->warnings()) std::fprintf(stderr, "vmsnap: %s\n", line.c_str());
            std::fprintf(stderr, "vmsnap: %s was not saved\n", job.process->displayString().c_str());
        } else {
            std::fprintf(stderr, "vmsnap: unable to write %s\n", job.path.c_str());
        }
    }
    if (options.all) std::printf("%zu processes saved in %s\n", saved, directory.c_str());
    return missed || saved == 0 ? 1 : 0;
}
