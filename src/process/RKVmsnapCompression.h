// The compression of vmsnap files: a zstd frame around the JSON text (docs/vmsnap.md).
#pragma once

#include <optional>
#include <string>
#include <string_view>

// Whether `bytes` start with a zstd frame.
bool RKVmsnapIsCompressed(std::string_view bytes);
std::string RKVmsnapCompress(std::string_view text);
// The text of a zstd frame; nothing (and the reason) when it is damaged, truncated or would
// grow past `limit` bytes.
std::optional<std::string> RKVmsnapDecompress(std::string_view bytes, size_t limit, std::string& reason);
