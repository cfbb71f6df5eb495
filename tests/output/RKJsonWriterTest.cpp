// The JSON writer's string escaping and buffering; its commas and number forms are checked by
// the whole documents of RKOutputFormatterJSONTest.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "output/RKJsonWriter.h"

namespace {

std::string escaped(std::string_view text) {
    std::string out;
    RKAppendJsonString(out, text);
    return out;
}

}  // namespace

TEST(RKJsonWriter, EscapesQuotesBackslashesAndEveryControlCharacter) {
    EXPECT_EQ(escaped("a\"b\\c/d\x7f~"), "\"a\\\"b\\\\c/d\x7f~\"");  // DEL and "/" pass as they are
    std::string controls, expected = "\"";
    for (int c = 0; c < 0x20; c++) {
        controls.push_back(static_cast<char>(c));
        expected += std::string("\\u00") + "0123456789abcdef"[c >> 4] + "0123456789abcdef"[c & 0xF];
    }
    EXPECT_EQ(escaped(controls), expected + "\"");
}

// Names from other processes may hold any bytes; the document must stay valid UTF-8.
TEST(RKJsonWriter, KeepsWellFormedUtf8AndReplacesEverythingElse) {
    const std::string wellFormed = "\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80 \xF4\x8F\xBF\xBF";  // é € 😀 U+10FFFF
    EXPECT_EQ(escaped(wellFormed), "\"" + wellFormed + "\"");
    const std::string replacement = "\xEF\xBF\xBD";
    // Stray byte, overlong, surrogate, above U+10FFFF, truncated, lone continuation.
    for (const auto& [bytes, count] : {std::pair{"\xFF", 1}, {"\xC0\xAF", 2}, {"\xE0\x80\x80", 3},
                                       {"\xED\xA0\x80", 3}, {"\xF4\x90\x80\x80", 4}, {"\xE2\x82", 2}, {"\x80", 1}}) {
        std::string want = "\"x";
        for (int i = 0; i < count; i++) want += replacement;
        EXPECT_EQ(escaped(std::string("x") + bytes + "\""), want + "\\\"\"") << count;
    }
}

TEST(RKJsonWriter, LosesNothingAcrossBufferFlushes) {
    char* data = nullptr;
    size_t size = 0;
    std::string expected = "[";
    {
        RKJsonWriter json(RKJsonWriter::File(open_memstream(&data, &size)));
        json.beginArray();
        for (uint64_t i = 0; i < 100000; i++) {
            json.unsignedValue(i * 1000003);
            expected += (i ? "," : "") + std::to_string(i * 1000003);
        }
        json.endArray();
        EXPECT_TRUE(json.close());
    }
    EXPECT_EQ(std::string(data, size), expected + "]");
    std::free(data);
}
