// Parsers for the two texts that describe memory a process holds without mapping it: the
// system's SysV segment table (/proc/sysvipc/shm) and the fdinfo of a dma-buf descriptor.
// Pure: they take the text and return plain records, so they are tested on captured files.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/RKKernelTypes.h"

// Columns are found by the header's names, so kernels that add or move columns still parse.
// Lines that cannot be read are skipped; a table without rss and swap columns (kernels before
// 2.6.34) gives no segment at all, since their sizes would be guesses.
std::vector<RKSysVSegment> RKParseSysVShm(std::string_view text);

// What /proc/PID/fdinfo/N says of a dma-buf descriptor.
struct RKDmaBufInfo {
    uint64_t size = 0;
    uint64_t inode = 0;    // of the buffer: every descriptor of one buffer shows the same
    std::string exporter;  // exp_name: the driver or heap that allocated it
};

// Nothing when the text lacks size or inode (not a dma-buf, or a kernel that does not say).
std::optional<RKDmaBufInfo> RKParseDmaBufFdinfo(std::string_view text);
