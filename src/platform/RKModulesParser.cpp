#include "platform/RKModulesParser.h"

#include "platform/RKTextFields.h"

size_t RKParseModules(std::string_view text, std::vector<RKKernelModule>& modules) {
    size_t malformed = 0;
    while (!text.empty()) {
        std::string_view line = RKNextLine(text);
        if (line.empty()) continue;
        RKKernelModule module;
        module.name = RKNextWord(line);
        if (module.name.empty() || !RKParseDecimal(RKNextWord(line), module.size)) {
            ++malformed;
            continue;
        }
        modules.push_back(module);
    }
    return malformed;
}
