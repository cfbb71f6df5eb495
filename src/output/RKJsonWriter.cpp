#include "output/RKJsonWriter.h"

#include <charconv>
#include <utility>

namespace {

// Text is written to the file in pieces of about this size.
constexpr size_t kFlushThreshold = 64 * 1024;

constexpr std::string_view kReplacementCharacter = "\xEF\xBF\xBD";

bool isContinuation(unsigned char byte) { return (byte & 0xC0) == 0x80; }

// The length of the well-formed UTF-8 sequence (RFC 3629: no overlong forms, no surrogates,
// nothing above U+10FFFF) that starts a multi-byte character at `p`; 0 when it is not one.
size_t sequenceLength(const unsigned char* p, size_t available) {
    const unsigned char lead = p[0];
    size_t length = 0;
    unsigned char secondLow = 0x80;
    unsigned char secondHigh = 0xBF;
    if (lead >= 0xC2 && lead <= 0xDF) {
        length = 2;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
        length = 3;
        if (lead == 0xE0) secondLow = 0xA0;   // overlong
        if (lead == 0xED) secondHigh = 0x9F;  // surrogates
    } else if (lead >= 0xF0 && lead <= 0xF4) {
        length = 4;
        if (lead == 0xF0) secondLow = 0x90;   // overlong
        if (lead == 0xF4) secondHigh = 0x8F;  // above U+10FFFF
    } else {
        return 0;
    }
    if (available < length || p[1] < secondLow || p[1] > secondHigh) return 0;
    for (size_t i = 2; i < length; i++) {
        if (!isContinuation(p[i])) return 0;
    }
    return length;
}

void appendAsciiEscaped(std::string& out, unsigned char byte) {
    static constexpr char kHex[] = "0123456789abcdef";
    if (byte == '"' || byte == '\\') {
        out.push_back('\\');
        out.push_back(static_cast<char>(byte));
    } else if (byte < 0x20) {
        const char escape[] = {'\\', 'u', '0', '0', kHex[byte >> 4], kHex[byte & 0xF]};
        out.append(escape, sizeof escape);
    } else {
        out.push_back(static_cast<char>(byte));
    }
}

}  // namespace

void RKAppendJsonString(std::string& out, std::string_view text) {
    out.push_back('"');
    const auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
    size_t i = 0;
    while (i < text.size()) {
        if (bytes[i] < 0x80) {
            appendAsciiEscaped(out, bytes[i++]);
            continue;
        }
        size_t length = sequenceLength(bytes + i, text.size() - i);
        if (length == 0) {
            out.append(kReplacementCharacter);
            i++;
        } else {
            out.append(text.substr(i, length));
            i += length;
        }
    }
    out.push_back('"');
}

RKJsonWriter::RKJsonWriter(File file) : file_(std::move(file)) { buffer_.reserve(kFlushThreshold * 2); }

RKJsonWriter::~RKJsonWriter() { close(); }

void RKJsonWriter::_open(char bracket) {
    if (needsComma_) buffer_.push_back(',');
    buffer_.push_back(bracket);
    needsComma_ = false;
}

void RKJsonWriter::_close(char bracket) {
    buffer_.push_back(bracket);
    needsComma_ = true;
    _flushIfFull();
}

void RKJsonWriter::key(std::string_view name) {
    if (needsComma_) buffer_.push_back(',');
    RKAppendJsonString(buffer_, name);
    buffer_.push_back(':');
    needsComma_ = false;
}

void RKJsonWriter::_beginValue() {
    if (needsComma_) buffer_.push_back(',');
}

void RKJsonWriter::_endValue() {
    needsComma_ = true;
    _flushIfFull();
}

void RKJsonWriter::stringValue(std::string_view text) {
    _beginValue();
    RKAppendJsonString(buffer_, text);
    _endValue();
}

template <typename Integer>
void RKJsonWriter::_integerValue(Integer value) {
    _beginValue();
    char digits[24];
    auto result = std::to_chars(digits, digits + sizeof digits, value);
    buffer_.append(digits, result.ptr);
    _endValue();
}

void RKJsonWriter::signedValue(int64_t value) { _integerValue(value); }

void RKJsonWriter::unsignedValue(uint64_t value) { _integerValue(value); }

void RKJsonWriter::secondsValue(double seconds) {
    _beginValue();
    // to_chars is the "%f" form in the C locale whatever locale the program runs in.
    char digits[400];
    auto result = std::to_chars(digits, digits + sizeof digits, seconds, std::chars_format::fixed, 6);
    buffer_.append(digits, result.ptr);
    _endValue();
}

void RKJsonWriter::boolValue(bool value) {
    _beginValue();
    buffer_.append(value ? "true" : "false");
    _endValue();
}

void RKJsonWriter::nullValue() {
    _beginValue();
    buffer_.append("null");
    _endValue();
}

void RKJsonWriter::_flushIfFull() {
    if (buffer_.size() >= kFlushThreshold) _flush();
}

void RKJsonWriter::_flush() {
    if (!file_ || buffer_.empty()) return;
    if (std::fwrite(buffer_.data(), 1, buffer_.size(), file_.get()) != buffer_.size()) failed_ = true;
    buffer_.clear();
}

bool RKJsonWriter::close() {
    if (!file_) return !failed_;
    _flush();
    if (std::fclose(file_.release()) != 0) failed_ = true;
    return !failed_;
}
