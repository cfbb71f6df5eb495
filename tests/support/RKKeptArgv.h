// An argv for in-process parsing of `memspread <arguments>`. Every command line stays alive to
// the end of the test program: getopt keeps pointers into the last one it parsed.
#pragma once

#include <deque>
#include <optional>
#include <string>
#include <vector>

#include "driver/RKMemspreadArgs.h"

inline std::vector<char*> RKKeptArgv(std::vector<std::string> arguments) {
    static std::deque<std::vector<std::string>> commandLines;
    arguments.insert(arguments.begin(), "memspread");
    std::vector<std::string>& kept = commandLines.emplace_back(std::move(arguments));
    std::vector<char*> argv;
    for (std::string& argument : kept) argv.push_back(argument.data());
    argv.push_back(nullptr);
    return argv;
}

// `memspread <arguments>` parsed in-process.
inline std::optional<RKMemspreadArgs> RKParsedArgs(std::vector<std::string> arguments, RKError* error = nullptr) {
    std::vector<char*> argv = RKKeptArgv(std::move(arguments));
    return RKMemspreadArgs::initWithArgc(static_cast<int>(argv.size() - 1), argv.data(), error);
}
