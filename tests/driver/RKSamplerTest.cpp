// Sampling on the scripted platform, whose clock moves only when a gather takes time or the timer
// waits: the overrun rule, the warning it prints, and processes carried over between samples.
#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <regex>
#include <thread>

#include "driver/RKSampleInterval.h"
#include "driver/RKSampler.h"
#include "platform/RKScriptedPlatform.h"
#include "support/RKKeptArgv.h"
#include "support/RKRecordingFormatter.h"

namespace {

constexpr uint64_t kSecond = 1000000000;

// Counts the reports it is given. Closed, it holds the first report back until opened, so that the
// sample stays in analysis while the next ones are gathered.
class GatedFormatter : public RKRecordingFormatter {
public:
    explicit GatedFormatter(bool open) : open_(open) {}
    void open() {
        std::lock_guard<std::mutex> lock(mutex_);
        open_ = true;
        changed_.notify_all();
    }
    size_t reports() {
        std::lock_guard<std::mutex> lock(mutex_);
        return reports_;
    }
    bool implementsPrintSpanlistLikeOutput() const override { return false; }
    void startAtTime(const RKTime&) override {
        std::unique_lock<std::mutex> lock(mutex_);
        changed_.wait(lock, [this] { return open_; });
    }
    void endAtTime(const RKTime&) override {
        std::lock_guard<std::mutex> lock(mutex_);
        reports_++;
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    bool open_;
    size_t reports_ = 0;
};

// Samples `args` on `platform` into a GatedFormatter, open or closed.
struct Sampling {
    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    std::shared_ptr<GatedFormatter> formatter;
    RKOutputFormatterList formatters;
    explicit Sampling(bool open) : formatter(std::make_shared<GatedFormatter>(open)), formatters{formatter} {}
};

void waitForSamples(const RKSampler& sampler, uint64_t count) {
    while (sampler.samplesQueued() < count) std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

}  // namespace

TEST(RKSampleInterval, ForgivesTheFirstOverrunThenGrowsByTheOvershootAndNeverShrinks) {
    RKSampleInterval interval(kSecond, 0);
    EXPECT_FALSE(interval.tick(1, 0));                 // the first sample, at once
    EXPECT_FALSE(interval.tick(2, 5 * kSecond / 2));   // took 2.5 s: forgiven
    EXPECT_EQ(interval.tick(2, 5 * kSecond), 2650000000u);  // 1 s + 1.5 s × 1.1
    EXPECT_FALSE(interval.tick(1, 7650000000));
    // Missed deadlines with no overshoot (a timer re-armed late) change nothing.
    EXPECT_FALSE(interval.tick(3, 7650000000 + 2 * kSecond));
    EXPECT_EQ(interval.interval(), 2650000000u);
}

TEST(RKSampler, SlowSamplesStretchTheIntervalOnceWithAWarning) {
    Sampling s(true);
    RKScriptedProcess& slow = s.platform->addProcess(100, "slow");
    slow.walkNanoseconds = 5 * kSecond / 2;
    slow.physMemspreadGrowth = 4096;  // never carried over: every sample gathers it
    RKMemspreadArgs args = *RKParsedArgs({"--sample", "1", "100"});

    testing::internal::CaptureStderr();
    {
        RKSampler sampler(args, s.formatters);
        sampler.start();
        waitForSamples(sampler, 5);
        sampler.stop();
        sampler.drain();
    }
    const std::string messages = testing::internal::GetCapturedStderr();
    EXPECT_EQ(std::regex_replace(messages, std::regex("(Unable to analyze|mach_).*\n"), ""),
              "WARNING: Unable to keep up with sampling interval. Increasing interval to 2.65s.\n\nStopping...\n");
    EXPECT_GE(s.formatter->reports(), 5u);
    EXPECT_GE(s.platform->callCount("regionRecurse 100"), 5u);
}

TEST(RKSampler, AnUnchangedProcessIsCarriedOverWhileItsSampleIsStillInAnalysis) {
    Sampling s(false);
    s.platform->addProcess(100, "lowest");  // never carried over: a cancelled gather writes into it
    s.platform->addProcess(200, "steady");
    s.platform->addProcess(300, "growing").physMemspreadGrowth = 4096;
    RKMemspreadArgs args = *RKParsedArgs({"--sample", "0.5", "100", "200", "300"});

    testing::internal::CaptureStderr();  // "Stopping..."
    RKSampler sampler(args, s.formatters);
    sampler.start();
    waitForSamples(sampler, 3);  // the first is held in analysis; two more wait behind it
    // Stopping waits for the tick in progress, which may be waiting for room in the queue. The
    // held sample is let go only once no further tick can start, or one might gather afresh.
    std::thread stopper([&] { sampler.stop(); });
    while (!sampler.stopRequested()) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    s.formatter->open();
    stopper.join();
    sampler.drain();
    testing::internal::GetCapturedStderr();
    EXPECT_GE(s.formatter->reports(), 3u);
    EXPECT_EQ(s.platform->callCount("regionRecurse 200"), 1u);
    EXPECT_GE(s.platform->callCount("regionRecurse 100"), 3u);
    EXPECT_GE(s.platform->callCount("regionRecurse 300"), 3u);
}
