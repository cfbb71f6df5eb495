// One measurement of the resolved targets, written to every formatter.
#pragma once

#include "driver/RKMemspreadArgs.h"
#include "output/RKOutputFormatter.h"
#include "process/RKTargetMap.h"

// Gathers, analyses and reports the targets once. When standard output is not a terminal, SIGINT
// during gathering skips the remaining processes and the report is still written.
void RKSingleRun(const RKMemspreadArgs& args, const RKTargetMap& targets,
                 const RKOutputFormatterList& formatters);
