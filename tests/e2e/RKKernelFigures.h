// What the kernel itself says a process costs, and memspread's figure read back from a report in
// bytes: the two sides of the end-to-end comparisons.
#pragma once
#include <sys/types.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <regex>
#include <string>

// A "Name: N kB" field of /proc/PID/`file`, in bytes; with `address`, of the smaps entry that
// starts there. 0 when there is none.
inline uint64_t RKKernelField(pid_t pid, const std::string& file, const std::string& field, uint64_t address = 0) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/" + file);
    bool inside = address == 0;
    for (std::string line; std::getline(in, line);) {
        unsigned long long start = 0, end = 0;
        if (std::sscanf(line.c_str(), "%llx-%llx ", &start, &end) == 2) inside = address == 0 || start == address;
        if (inside && line.rfind(field + ":", 0) == 0) return std::stoull(line.substr(field.size() + 1)) * 1024;
    }
    return 0;
}

// The kernel's charge for a process: RssAnon + RssShmem + VmSwap + VmPTE − LazyFree.
inline uint64_t RKKernelMemspread(pid_t pid) {
    return RKKernelField(pid, "status", "RssAnon") + RKKernelField(pid, "status", "RssShmem") +
           RKKernelField(pid, "status", "VmSwap") + RKKernelField(pid, "status", "VmPTE") -
           RKKernelField(pid, "smaps_rollup", "LazyFree");
}

// Anonymous pages (private copies in file mappings too) `pid` shares with one other process, as
// after a fork: each is whole in Anonymous and half in Pss_Anon.
inline uint64_t RKKernelSharedAnonymous(pid_t pid) {
    const uint64_t anonymous = RKKernelField(pid, "smaps_rollup", "Anonymous");
    return 2 * (anonymous - std::min(anonymous, RKKernelField(pid, "smaps_rollup", "Pss_Anon")));
}

// The figure in the header of process `pid` of a report; 0 when the report has no such header.
inline uint64_t RKReportedMemspread(const std::string& report, pid_t pid) {
    std::smatch match;
    std::regex header("\\[" + std::to_string(pid) + "\\]: 64-bit\tMemspread: (\\d+) B");
    return std::regex_search(report, match, header) ? std::stoull(match[1]) : 0;
}
