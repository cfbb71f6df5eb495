// Images: the forward-only enumerator the walk names regions with, and the intern tables shared
// by gathering threads. (How images name a process's regions is in RKProcessTest.)
#include <gtest/gtest.h>

#include <thread>

#include "process/RKImage.h"

namespace {

std::shared_ptr<RKImage> image(uint64_t start, uint64_t size) {
    auto result = std::make_shared<RKImage>();
    result->start = start;
    result->size = size;
    return result;
}

}  // namespace

TEST(RKImage, EnumeratorOnlyMovesForwardAndSeesAppendedImages) {
    RKImageList images{image(0x1000, 0x1000), image(0x3000, 0x2000)};
    RKImageEnumerator enumerator(images);
    EXPECT_EQ(enumerator.nextImageForStart(0x0, 0x800), nullptr);         // before the first
    EXPECT_EQ(enumerator.nextImageForStart(0x1800, 0x2000), images[0]);   // start inside
    EXPECT_EQ(enumerator.nextImageForStart(0x2000, 0x3000), nullptr);     // the gap: first passed
    EXPECT_EQ(enumerator.nextImageForStart(0x2800, 0x3800), images[1]);   // end inside
    EXPECT_EQ(enumerator.nextImageForStart(0x2000, 0x6000), images[1]);   // image inside the range
    EXPECT_EQ(enumerator.nextImageForStart(0x5000, 0x6000), nullptr);     // never one that ended
    images.push_back(image(0x7000, 0x1000));
    EXPECT_EQ(enumerator.nextImageForStart(0x7000, 0x8000), images[2]);
    EXPECT_EQ(enumerator.nextImageForStart(0x1000, 0x2000), nullptr) << "an image passed is not found again";
}

TEST(RKImage, InternTablesShareOneStringAcrossThreadsAndOverflowToOwnCopies) {
    RKStringInternTable<4> table;
    std::vector<RKSharedString> seen(8);
    std::vector<std::thread> threads;
    for (size_t i = 0; i < seen.size(); i++)
        threads.emplace_back([&, i] { seen[i] = table.intern("/usr/lib/libsystem.dylib", 2, 4, 1024); });
    for (auto& thread : threads) thread.join();
    for (const auto& string : seen) EXPECT_EQ(string.get(), seen[0].get()) << "one object for equal strings";
    EXPECT_EQ(table.filledCount(), 1u);
    for (const char* name : {"b", "c", "d"}) table.intern(name, 0, 4, 1024);
    EXPECT_EQ(table.filledCount(), 4u);
    auto overflow = table.intern("e", 0, 4, 1024);
    EXPECT_EQ(*overflow, "e");
    EXPECT_NE(overflow.get(), table.intern("e", 0, 4, 1024).get()) << "a full table hands out copies";
    EXPECT_EQ(*table.intern("bx", 0, 4, 1), "b") << "compared on the first `limit` bytes only";
}
