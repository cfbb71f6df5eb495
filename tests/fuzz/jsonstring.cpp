// Strings as the JSON document and the metrics log write them: names and paths of other
// processes, which may hold any bytes. Whatever the bytes, the output must parse as one JSON
// string, and well-formed UTF-8 must come back unchanged. An independent parser judges.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include <nlohmann/json.hpp>

#include "output/RKJsonWriter.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string input(reinterpret_cast<const char*>(data), size);
    std::string written;
    RKAppendJsonString(written, input);
    const nlohmann::json parsed = nlohmann::json::parse(written, nullptr, false);
    if (!parsed.is_string()) std::abort();
    bool wellFormed = true;
    try {
        (void)nlohmann::json(input).dump();  // throws on malformed UTF-8
    } catch (const nlohmann::json::type_error&) {
        wellFormed = false;
    }
    if (wellFormed && parsed.get<std::string>() != input) std::abort();
    return 0;
}
