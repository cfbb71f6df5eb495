// vmsnap files: bytes from anywhere, compressed or plain JSON. A file that reads must write a
// file that reads again, so that a snapshot of a snapshot never fails where the first did not.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "model/RKError.h"
#include "process/RKVmsnapGraph.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    RKError error;
    auto graph = RKVmsnapParse(std::string_view(reinterpret_cast<const char*>(data), size), &error);
    if (graph && !RKVmsnapParse(RKVmsnapSerialize(*graph), &error)) std::abort();
    return 0;
}
