#include "process/RKVmsnapCompression.h"

#include <zstd.h>

#include <algorithm>
#include <memory>

namespace {

constexpr unsigned char kZstdMagic[] = {0x28, 0xB5, 0x2F, 0xFD};
// Level 6: most of what higher levels gain on region records, at a fraction of their time.
constexpr int kLevel = 6;

}  // namespace

bool RKVmsnapIsCompressed(std::string_view bytes) {
    return bytes.size() >= sizeof kZstdMagic &&
           std::string_view(reinterpret_cast<const char*>(kZstdMagic), sizeof kZstdMagic) == bytes.substr(0, 4);
}

std::string RKVmsnapCompress(std::string_view text) {
    std::string out(ZSTD_compressBound(text.size()), '\0');
    size_t written = ZSTD_compress(out.data(), out.size(), text.data(), text.size(), kLevel);
    if (ZSTD_isError(written)) return {};  // only when out of memory; the caller refuses an empty result
    out.resize(written);
    return out;
}

std::optional<std::string> RKVmsnapDecompress(std::string_view bytes, size_t limit, std::string& reason) {
    std::unique_ptr<ZSTD_DStream, decltype(&ZSTD_freeDStream)> stream(ZSTD_createDStream(), ZSTD_freeDStream);
    if (!stream) {
        reason = "out of memory";
        return std::nullopt;
    }
    // Streamed, with a limit: a damaged header cannot ask for an absurd allocation.
    std::string text;
    ZSTD_inBuffer in{bytes.data(), bytes.size(), 0};
    size_t remaining = 1;
    while (in.pos < in.size || remaining != 0) {
        size_t used = text.size();
        if (used >= limit) {
            reason = "decompressed text exceeds " + std::to_string(limit) + " bytes";
            return std::nullopt;
        }
        text.resize(std::min(limit, std::max<size_t>(used * 2, 1 << 16)));
        ZSTD_outBuffer out{text.data() + used, text.size() - used, 0};
        remaining = ZSTD_decompressStream(stream.get(), &out, &in);
        text.resize(used + out.pos);
        if (ZSTD_isError(remaining)) {
            reason = std::string("damaged compressed data (") + ZSTD_getErrorName(remaining) + ")";
            return std::nullopt;
        }
        // The decoder wants more input although it had room to write: the frame is cut short.
        if (remaining != 0 && in.pos == in.size && out.pos < out.size) {
            reason = "truncated compressed data";
            return std::nullopt;
        }
        if (remaining == 0 && in.pos < in.size) {
            reason = "data after the end of the compressed text";
            return std::nullopt;
        }
    }
    return text;
}
