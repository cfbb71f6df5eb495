// `vmsnap`: saves live processes as vmsnap files that memspread analyses later, elsewhere.
#pragma once

// The command's entry point; returns the exit status (0 when every named process was saved).
int RKVmsnapMain(int argc, char** argv);
