// The streaming writer behind the JSON document. It writes one line without whitespace and
// places the commas itself: `needsComma` says whether the next member or element must be
// preceded by ",". A key must be followed by exactly one value, object or array; the writer
// trusts its caller on that.
#pragma once

#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>
#include <string_view>

// Appends `text` as a JSON string: quoted, with double quote and backslash escaped and every
// control character below 0x20 as \u00XX. Bytes that are not well-formed UTF-8 (names from
// other processes may hold any bytes) become U+FFFD, so the document always stays valid UTF-8.
void RKAppendJsonString(std::string& out, std::string_view text);

class RKJsonWriter {
public:
    struct FileCloser {
        void operator()(FILE* file) const { std::fclose(file); }
    };
    using File = std::unique_ptr<FILE, FileCloser>;

    explicit RKJsonWriter(File file);
    // Writes what is still buffered and closes the file.
    ~RKJsonWriter();
    RKJsonWriter(const RKJsonWriter&) = delete;
    RKJsonWriter& operator=(const RKJsonWriter&) = delete;

    void beginObject() { _open('{'); }
    void endObject() { _close('}'); }
    void beginArray() { _open('['); }
    void endArray() { _close(']'); }
    void key(std::string_view name);

    void stringValue(std::string_view text);
    void signedValue(int64_t value);     // "%d" and "%lld"
    void unsignedValue(uint64_t value);  // "%u", "%lu" and "%llu"
    void secondsValue(double seconds);   // "%f": six decimals, "." whatever the locale
    void boolValue(bool value);
    void nullValue();

    bool needsComma() const { return needsComma_; }
    // Writes the buffered text and closes the file. False when any write or the close failed.
    bool close();

private:
    void _open(char bracket);
    void _close(char bracket);
    void _beginValue();
    void _endValue();
    template <typename Integer>
    void _integerValue(Integer value);
    void _flushIfFull();
    void _flush();

    File file_;
    std::string buffer_;
    bool needsComma_ = false;
    bool failed_ = false;
};
