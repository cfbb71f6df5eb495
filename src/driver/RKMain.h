// Program entry: parses the command line, runs one measurement and returns the exit status.
#pragma once

int RKMain(int argc, char** argv);
