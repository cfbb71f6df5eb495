// The error convention: an operation that can fail returns an empty value (nullptr,
// std::nullopt or false) and, when the caller passed a non-null RKError*, fills it in.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

struct RKError {
    std::string domain;
    int64_t code = 0;
    std::optional<std::string> localizedDescription;

    static void set(RKError* out, std::string domain, int64_t code,
                    std::optional<std::string> description = std::nullopt) {
        if (out) *out = RKError{std::move(domain), code, std::move(description)};
    }
};

inline constexpr const char* RKMemspreadErrorDomain = "RKMemspreadError";
