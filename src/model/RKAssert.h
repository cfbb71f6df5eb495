// Stops for broken internal invariants (adding to a finalized object, an end before a start,
// adding to an immutable group). Unlike assert(), these stay on in release builds: a violated
// invariant means a wrong number in every report, so the program must not go on.
#pragma once

[[noreturn]] void RKAssertionFailure(const char* source, const char* text);

inline void RKAssert(bool condition, const char* source, const char* text) {
    if (!condition) [[unlikely]]
        RKAssertionFailure(source, text);
}
