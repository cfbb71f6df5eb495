// A file read whole into the mapped buffer, across several growths, and read again into the
// same buffer: exactly its bytes each time; a missing file is its errno.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/RKReadBuffer.h"

TEST(RKReadBuffer, ReadsWholeAcrossGrowthAndAgain) {
    const std::filesystem::path dir = std::filesystem::temp_directory_path();
    const std::string name = "rkreadbuffer-" + std::to_string(getpid());
    std::string content;
    for (int i = 0; content.size() < (3u << 20); i++) content += "line " + std::to_string(i) + "\n";
    std::ofstream(dir / name) << content;
    const int dirfd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(dirfd, 0);

    RKReadBuffer buffer;
    ASSERT_EQ(buffer.readAt(dirfd, name.c_str()), 0);
    EXPECT_TRUE(buffer.view() == content);
    std::ofstream(dir / name) << "short";
    ASSERT_EQ(buffer.readAt(dirfd, name.c_str()), 0);
    EXPECT_EQ(buffer.view(), "short");
    EXPECT_EQ(buffer.readAt(dirfd, "rkreadbuffer-absent"), ENOENT);

    std::filesystem::remove(dir / name);
    ::close(dirfd);
}
