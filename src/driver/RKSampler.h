// The sampling loop: a timer whose every tick resolves the targets anew, reuses the processes
// that did not change since the previous sample, gathers the rest and hands the sample to a
// serial analysis queue, which writes one report per sample to every formatter. The caller
// wires SIGINT to stop() (RKRunSampling); tests call it directly.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <semaphore>

#include "driver/RKMemspreadArgs.h"
#include "driver/RKSampleInterval.h"
#include "driver/RKSampleTimer.h"
#include "driver/RKSerialQueue.h"
#include "output/RKOutputFormatter.h"
#include "process/RKTargetMap.h"

class RKMemspread;

class RKSampler {
public:
    // `args` is read and extended (target selection) at every tick; both must outlive the sampler.
    RKSampler(RKMemspreadArgs& args, const RKOutputFormatterList& formatters);
    ~RKSampler();

    // Starts the timer and the analysis queue; the first sample starts at once. Once only.
    void start();
    // What SIGINT does: no further sample starts, the one being gathered is cut short and
    // dropped, and this returns once the tick in progress has ended. From any thread but the
    // timer's; harmless twice.
    void stop();
    // Blocks until stop() has run.
    void waitForStop();
    // Blocks until every sample handed to the analysis queue has been written.
    void drain();

    // Whether stop() has begun: from then on no sample starts gathering.
    bool stopRequested();
    // Samples handed to the analysis queue so far.
    uint64_t samplesQueued() const { return samplesQueued_.load(); }

    // Samples kept waiting for the analysis queue at most: a machine that gathers faster than
    // it analyses slows its ticks down (and so the interval grows) instead of holding ever
    // more samples in memory.
    static constexpr size_t kMaxWaitingSamples = 2;

private:
    void tick(uint64_t fires);
    std::optional<RKTargetMap> _resolveTargets();
    void _carryOverUnchangedProcesses(RKTargetMap& targets);
    void _queueAnalysis(std::shared_ptr<RKMemspread> memspread);

    RKMemspreadArgs& args_;
    const RKOutputFormatterList& formatters_;
    const bool verbose_;
    const bool summarize_;
    const uint64_t initialInterval_;
    std::optional<RKSampleInterval> interval_;  // used by ticks only (they never overlap)
    std::atomic<uint64_t> samplesQueued_{0};

    // Shared with stop(): the sample being gathered or analysed last, held by its analysis task.
    std::mutex currentMutex_;
    std::weak_ptr<RKMemspread> current_;
    bool stopping_ = false;

    std::counting_semaphore<> stopped_{0};
    std::unique_ptr<RKSerialQueue> analysisQueue_;  // made by start(), after SIGINT is routed
    RKSampleTimer timer_;
};
