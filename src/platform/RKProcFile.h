// Whole-file reads of /proc files. The kernel hands files such as smaps out a page or so per
// read(2) and none of them is an atomic snapshot, so reads loop to end of file.
#pragma once

#include <string>

// Reads the file `name` below the directory descriptor `dirfd` (AT_FDCWD for a plain path)
// into `buffer`, replacing its contents and reusing its capacity. Returns 0 or the errno.
int RKReadFileAt(int dirfd, const char* name, std::string& buffer);
