// Parsers for the per-process /proc texts that the process list reads. They take the text as the
// kernel gave it and return plain values, so they are tested on captured files.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

// PF_KTHREAD in the flags field of /proc/PID/stat: a kernel thread, which has no address space.
inline constexpr uint64_t RK_PF_KTHREAD = 0x00200000;

// The fields of /proc/PID/stat that the process list needs.
struct RKProcStat {
    pid_t pid = 0;
    std::string comm;  // the text between the parentheses; may itself hold spaces and ')'
    char state = '?';  // R, S, D, Z, T, t, X, I, ...
    pid_t ppid = 0;
    uint64_t flags = 0;  // field 9
    // Field 22: clock ticks from boot to the process's start. With the pid it names one process
    // for the life of the system, so it tells a reused pid from the process first listed. 0 when
    // the text ends before it.
    uint64_t startTime = 0;
};

// Parses /proc/PID/stat. The name may contain anything except a newline, so the fixed fields
// are read after the LAST ')'. Nothing when the text is truncated or malformed (a process that
// vanished mid-read gives an empty file).
std::optional<RKProcStat> RKParseProcStat(std::string_view text);

// BSD process states of pbi_status / pbsi_status, from the stat state letter.
uint32_t RKBsdStatusForProcState(char state);

// True when `header` (the first bytes of an executable) is an ELF image of class 32
// (i386, arm, x32: a 32-bit address space). Anything else, also a short read, is false.
bool RKIsElf32Header(std::string_view header);

// What the kernel appends to the link of an unlinked file.
inline constexpr std::string_view RK_DELETED_SUFFIX = " (deleted)";

// `path` without the kernel's " (deleted)" marker, where it ends with one.
inline std::string_view RKWithoutDeletedSuffix(std::string_view path) {
    if (path.ends_with(RK_DELETED_SUFFIX)) path.remove_suffix(RK_DELETED_SUFFIX.size());
    return path;
}

// The executable path of a readlink of /proc/PID/exe, without the " (deleted)" that the kernel
// appends once the file was unlinked. `unlinked` says whether the file is known to be gone: a
// file may really be named "... (deleted)", so the marker is only dropped for unlinked files.
std::string_view RKExecutablePathFromLink(std::string_view link, bool unlinked);

// The last component of a path ("/usr/bin/foo" -> "foo"); trailing slashes are ignored and
// "/" stays "/".
std::string_view RKLastPathComponent(std::string_view path);
