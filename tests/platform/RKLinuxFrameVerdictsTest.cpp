// Frame verdicts are read once a gather: what a later process asks about comes from what was
// kept, across word and chunk boundaries, and a new gather reads afresh.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <vector>

#include "platform/RKLinuxFrameVerdicts.h"
#include "platform/RKPageDispositions.h"

namespace {

// A file standing in for /proc/kpagecount or /proc/kpageflags: 8 bytes a frame.
class FrameFile {
public:
    FrameFile() : file_(std::tmpfile()) {}
    ~FrameFile() { std::fclose(file_); }
    int fd() const { return fileno(file_); }
    void set(uint64_t frame, uint64_t value) { ASSERT_EQ(pwrite(fd(), &value, 8, frame * 8), 8); }

private:
    std::FILE* file_;
};

std::vector<uint8_t> ask(RKFrameVerdicts& verdicts, const FrameFile& counts, const FrameFile& flags,
                         const std::vector<uint64_t>& frames) {
    std::vector<uint8_t> shared(frames.size(), 9);
    verdicts.shared(counts.fd(), flags.fd(), frames, shared);
    return shared;
}

}  // namespace

TEST(RKFrameVerdicts, ReadOnceAGatherAcrossWordsAndChunks) {
    FrameFile counts, flags;
    const std::vector<uint64_t> frames = {3, 10, 63, 64, 200, 32767, 32768, 40000};
    for (uint64_t frame : frames) counts.set(frame, 2);
    counts.set(5, 2);  // not asked about, but between two frames that are
    counts.set(63, 1);                        // mapped once: private
    flags.set(200, RKKpfZeroPage);            // the zero page is no sharing
    counts.set(40001, 0), flags.set(40001, 0);  // the files end past the last frame asked

    RKFrameVerdictsOfGather gather;
    gather.begin();
    auto verdicts = gather.verdicts();
    const std::vector<uint8_t> expected = {1, 1, 0, 1, 0, 1, 1, 1};
    EXPECT_EQ(ask(*verdicts, counts, flags, frames), expected);

    // The frames change under us: within the gather the first answers stand, for every caller.
    for (uint64_t frame : frames) counts.set(frame, 1);
    EXPECT_EQ(ask(*gather.verdicts(), counts, flags, frames), expected);
    // A frame read along with its neighbours is known too, with the value it had then.
    counts.set(5, 1);
    EXPECT_EQ(ask(*gather.verdicts(), counts, flags, {5}), std::vector<uint8_t>{1});
    gather.end();

    gather.begin();
    EXPECT_EQ(ask(*gather.verdicts(), counts, flags, frames), std::vector<uint8_t>(frames.size(), 0));
    gather.end();
}
