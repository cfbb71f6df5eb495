// The verbose region listing of the text report: every region of one process with its address
// range, object id and sizes in pages of the process, whatever the report's size format.
#pragma once

#include <cstdint>
#include <cstdio>

#include "process/RKProcess.h"

// Writes the listing for `process` with the Swapped and Wired columns and the name truncation
// that the RKTextOption bits of `options` ask for.
void RKTextPrintRegionListing(FILE* output, const RKProcess& process, const RKRegionList& regions, int64_t options);
