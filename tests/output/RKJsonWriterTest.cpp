// The JSON writer (commas, escaping, number forms, buffering) and the document's date format.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <limits>
#include <string>

#include "output/RKJsonDateFormatter.h"
#include "output/RKJsonWriter.h"
#include "output/RKJsonTestSupport.h"

namespace {

// A writer into memory; text() closes it and returns everything it wrote.
class MemoryWriter {
public:
    MemoryWriter() : writer_(RKJsonWriter::File(open_memstream(&data_, &size_))) {}
    ~MemoryWriter() { std::free(data_); }
    RKJsonWriter& operator*() { return writer_; }
    RKJsonWriter* operator->() { return &writer_; }
    std::string text() {
        EXPECT_TRUE(writer_.close());
        return std::string(data_, size_);
    }

private:
    char* data_ = nullptr;
    size_t size_ = 0;
    RKJsonWriter writer_;
};

std::string escaped(std::string_view text) {
    std::string out;
    RKAppendJsonString(out, text);
    return out;
}

}  // namespace

TEST(RKJsonWriter, PlacesCommasBetweenMembersAndElementsOnly) {
    MemoryWriter json;
    json->beginObject();
    json->key("a");
    json->beginArray();
    json->signedValue(1);
    json->beginObject();
    json->key("b");
    json->boolValue(true);
    json->key("c");
    json->boolValue(false);
    json->endObject();
    json->beginArray();
    json->endArray();
    json->nullValue();
    json->endArray();
    json->key("d");
    json->beginObject();
    json->endObject();
    json->key("e");
    json->stringValue("x");
    json->endObject();
    EXPECT_EQ(json.text(), R"({"a":[1,{"b":true,"c":false},[],null],"d":{},"e":"x"})");
}

TEST(RKJsonWriter, WritesNumbersInDecimalWithSixDecimalSeconds) {
    MemoryWriter json;
    json->beginArray();
    json->signedValue(std::numeric_limits<int64_t>::min());
    json->signedValue(-1);
    json->unsignedValue(std::numeric_limits<uint64_t>::max());
    json->unsignedValue(0xFFFFFFFFFFFFFFFFull);
    json->secondsValue(1.5);
    json->secondsValue(-0.25);
    json->secondsValue(0.0000004);
    json->secondsValue(816181707.1234567);
    json->endArray();
    EXPECT_EQ(json.text(),
              "[-9223372036854775808,-1,18446744073709551615,18446744073709551615,"
              "1.500000,-0.250000,0.000000,816181707.123457]");
}

TEST(RKJsonWriter, EscapesQuotesBackslashesAndEveryControlCharacter) {
    EXPECT_EQ(escaped("a\"b\\c/d"), R"("a\"b\\c/d")");
    std::string controls;
    for (char c = 0; c < 0x20; c++) controls.push_back(c);
    std::string expected = "\"";
    const char* hex = "0123456789abcdef";
    for (int c = 0; c < 0x20; c++) expected += std::string("\\u00") + hex[c >> 4] + hex[c & 0xF];
    EXPECT_EQ(escaped(controls), expected + "\"");
    EXPECT_EQ(escaped("\x7f~ "), "\"\x7f~ \"");  // DEL and printable ASCII pass as they are

    MemoryWriter json;
    json->beginObject();
    json->key("k\"\n");
    json->stringValue("\x1b[0m");
    json->endObject();
    EXPECT_EQ(json.text(), R"({"k\"\u000a":"\u001b[0m"})");
}

TEST(RKJsonWriter, KeepsWellFormedUtf8AndReplacesEverythingElse) {
    const std::string wellFormed = "\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80 \xF4\x8F\xBF\xBF";  // é € 😀 U+10FFFF
    EXPECT_EQ(escaped(wellFormed), "\"" + wellFormed + "\"");
    const std::string replacement = "\xEF\xBF\xBD";
    struct Case {
        const char* bytes;
        int replacements;
    };
    for (const Case& bad : {Case{"\xFF", 1}, Case{"\xC0\xAF", 2}, Case{"\xE0\x80\x80", 3},
                            Case{"\xED\xA0\x80", 3}, Case{"\xF4\x90\x80\x80", 4}, Case{"\xE2\x82", 2},
                            Case{"\x80", 1}}) {
        std::string expected = "\"x";
        for (int i = 0; i < bad.replacements; i++) expected += replacement;
        EXPECT_EQ(escaped(std::string("x") + bad.bytes + "\""), expected + "\\\"\"") << bad.bytes;
    }
}

TEST(RKJsonWriter, LosesNothingAcrossBufferFlushes) {
    MemoryWriter json;
    std::string expected = "[";
    json->beginArray();
    for (uint64_t i = 0; i < 100000; i++) {
        json->unsignedValue(i * 1000003);
        expected += (i ? "," : "") + std::to_string(i * 1000003);
    }
    json->endArray();
    EXPECT_EQ(json.text(), expected + "]");
}

TEST(RKJsonDateFormatter, WritesLocalTimeWithMillisecondsAndZone) {
    using namespace std::chrono;
    // 2026-11-16 12:08:27.123999 UTC; milliseconds are truncated.
    const system_clock::time_point instant = system_clock::time_point(seconds(1794830907)) + microseconds(123999);
    struct Case {
        const char* zone;
        const char* expected;
    };
    for (const Case& c : {Case{"UTC0", "2026-11-16T12:08:27.123Z"}, Case{"<+01>-1", "2026-11-16T13:08:27.123+01:00"},
                          Case{"<+0530>-5:30", "2026-11-16T17:38:27.123+05:30"},
                          Case{"<-0330>3:30", "2026-11-16T08:38:27.123-03:30"}}) {
        ScopedTimeZone zone(c.zone);
        EXPECT_EQ(RKJsonDateFormatter().stringFromDate(instant), c.expected) << c.zone;
    }
    ScopedTimeZone utc("UTC0");
    // Before 1970 the milliseconds still count forward from the second.
    EXPECT_EQ(RKJsonDateFormatter().stringFromDate(system_clock::time_point(milliseconds(-500))),
              "1969-12-31T23:59:59.500Z");
}
