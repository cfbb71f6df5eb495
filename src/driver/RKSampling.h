// Sampling mode (--sample): measures the targets again and again on a timer until SIGINT, every
// formatter receiving one report per sample.
#pragma once

#include "driver/RKMemspreadArgs.h"
#include "output/RKOutputFormatter.h"

// Runs until the user stops it. 0 when the samples were written and the formatters may be
// closed; anything else is a failed start (the driver removes the output files).
int RKRunSampling(RKMemspreadArgs& args, RKOutputFormatterList& formatters);
