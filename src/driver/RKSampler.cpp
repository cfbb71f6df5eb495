#include "driver/RKSampler.h"

#include <cstdio>

#include "analysis/RKMemspread.h"
#include "platform/RKPlatform.h"
#include "process/RKUserProcess.h"

namespace {

constexpr double kNanosecondsPerSecond = 1e9;
// The analysis queue runs at utility quality of service, below the gathering.
constexpr int kAnalysisNiceIncrement = 5;

uint64_t nanosecondsOf(double seconds) { return static_cast<uint64_t>(seconds * kNanosecondsPerSecond); }

const RKUserProcess* asUserProcess(const std::shared_ptr<RKProcess>& process) {
    return dynamic_cast<const RKUserProcess*>(process.get());
}

}  // namespace

RKSampler::RKSampler(RKMemspreadArgs& args, const RKOutputFormatterList& formatters)
    : args_(args),
      formatters_(formatters),
      verbose_(args.spanlistLikeOutput()),
      summarize_(args.summarize()),
      initialInterval_(nanosecondsOf(args.sampleInterval())),
      timer_([this](uint64_t fires) { tick(fires); }) {}

RKSampler::~RKSampler() {
    timer_.cancel();
    timer_.waitUntilIdle();
    analysisQueue_.reset();  // writes what is queued
}

void RKSampler::start() {
    analysisQueue_ = std::make_unique<RKSerialQueue>("sample-analysis", kAnalysisNiceIncrement);
    uint64_t now = RKPlatform::current().uptimeNanoseconds();
    interval_.emplace(initialInterval_, now);
    timer_.setTimer(now, initialInterval_);
    timer_.resume();
}

void RKSampler::stop() {
    timer_.cancel();
    {
        std::lock_guard<std::mutex> lock(currentMutex_);
        stopping_ = true;
        if (auto memspread = current_.lock()) memspread->cancel();
    }
    std::fprintf(stderr, "\nStopping...\n");
    timer_.waitUntilIdle();
    stopped_.release();
}

bool RKSampler::stopRequested() {
    std::lock_guard<std::mutex> lock(currentMutex_);
    return stopping_;
}

void RKSampler::waitForStop() { stopped_.acquire(); }

void RKSampler::drain() {
    if (analysisQueue_) analysisQueue_->sync();
}

void RKSampler::tick(uint64_t fires) {
    uint64_t now = RKPlatform::current().uptimeNanoseconds();
    if (std::optional<uint64_t> grown = interval_->tick(fires, now)) {
        std::fprintf(stderr, "WARNING: Unable to keep up with sampling interval. Increasing interval to %.3gs.\n",
                     static_cast<double>(*grown) / kNanosecondsPerSecond);
        timer_.setTimer(now + *grown, *grown);
    }

    std::optional<RKTargetMap> targets = _resolveTargets();
    if (!targets) return;
    _carryOverUnchangedProcesses(*targets);

    RKProcessList processes;
    processes.reserve(targets->size());
    for (auto& entry : *targets) processes.push_back(std::move(entry.second));
    targets.reset();
    auto memspread = std::make_shared<RKMemspread>(std::move(processes));
    memspread->setQualityOfService(QOS_CLASS_USER_INITIATED);
    memspread->setMeasuresWholeSystem(args_.targetAll());
    {
        std::lock_guard<std::mutex> lock(currentMutex_);
        current_ = memspread;
        if (stopping_) memspread->cancel();  // stopped while this sample was being set up
    }
    if (memspread->gatherData()) return;  // cut short by SIGINT: the sample is dropped
    _queueAnalysis(std::move(memspread));
}

// Names, children and (with -a) the whole system are looked up again, so processes that
// appeared since come in and exited ones drop out with their "Unable to analyze" line.
std::optional<RKTargetMap> RKSampler::_resolveTargets() {
    RKError error;
    std::optional<RKTargetMap> targets = args_.targetProcessesAndError(&error);
    if (!targets) {
        // Only an unreadable process list gets here (snapshot-only runs are refused at start):
        // this sample is skipped, the next one tries again.
        std::fprintf(stderr, "%s; sample skipped\n",
                     error.localizedDescription ? error.localizedDescription->c_str()
                                                : "Unable to obtain system process list");
    }
    return targets;
}

// A user process whose phys_memspread did not move since the previous sample is taken over with
// what was gathered for it, instead of being gathered again. Only possible while the previous
// sample is still held (queued or in analysis); its analysis and the next one never overlap.
// The lowest pid is always gathered afresh: a gather cut short by SIGINT writes its early-exit
// error into that process, which the previous sample's analysis may be reading.
void RKSampler::_carryOverUnchangedProcesses(RKTargetMap& targets) {
    std::shared_ptr<RKMemspread> previous;
    {
        std::lock_guard<std::mutex> lock(currentMutex_);
        previous = current_.lock();
    }
    if (!previous) return;
    for (const auto& old : previous->processes()) {
        const RKUserProcess* oldUser = asUserProcess(old);
        if (!oldUser) continue;
        auto entry = targets.find(old->pid());
        if (entry == targets.end() || entry == targets.begin()) continue;
        const RKUserProcess* fresh = asUserProcess(entry->second);
        if (fresh && fresh->phys_memspread() == oldUser->phys_memspread()) entry->second = old;
    }
}

void RKSampler::_queueAnalysis(std::shared_ptr<RKMemspread> memspread) {
    analysisQueue_->waitUntilWaitingAtMost(kMaxWaitingSamples - 1);
    samplesQueued_++;
    analysisQueue_->async([this, memspread = std::move(memspread)] {
        memspread->analyzeData();
        for (const auto& formatter : formatters_) memspread->addOutputFormatter(formatter);
        memspread->printOutputVerbose(verbose_, summarize_);
    });
}
