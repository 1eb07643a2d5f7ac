// Writes the events that it receives down as one line of text, for tests to compare.
#pragma once

#include <bit>
#include <cstdio>
#include <string>

#include "Platform/encoding/ValueSink.h"

namespace platform {

/// Numbers and text are tagged with their kind (i1, u1, "text", k"key"); what has no exact short form is in
/// hexadecimal.
class RecordingSink : public ValueSink {
  public:
    void null() override { add("null"); }
    void boolean(bool value) override { add(value ? "true" : "false"); }
    void integer(int64_t value) override { add("i" + std::to_string(value)); }
    void unsignedInteger(uint64_t value) override { add("u" + std::to_string(value)); }
    void real(double value) override { add("r" + bits(value)); }
    void singleReal(float value) override { add("f" + bits(static_cast<double>(value))); }
    void string(std::string_view utf8) override { add('"' + std::string(utf8) + '"'); }
    void data(Bytes bytes) override { add("x" + hex(bytes)); }
    void date(double seconds) override { add("d" + bits(seconds)); }
    void uuid(std::span<const uint8_t, 16> bytes) override { add("U" + hex(bytes)); }
    void fileDescriptor(int) override { add("descriptor"); }
    void beginArray() override { add("["); }
    void endArray() override { add("]"); }
    void beginDictionary() override { add("{"); }
    void key(std::string_view utf8) override { add("k\"" + std::string(utf8) + '"'); }
    void endDictionary() override { add("}"); }

    /// Empty when nothing was received.
    const std::string& text() const { return text_; }

  private:
    void add(const std::string& event) { text_.append(text_.empty() ? "" : " ").append(event); }

    static std::string bits(double value) {
        char text[17];
        (void)std::snprintf(text, sizeof text, "%016llx", std::bit_cast<unsigned long long>(value));
        return text;
    }

    static std::string hex(Bytes bytes) {
        std::string text;
        for (const uint8_t byte : bytes) {
            char digits[3];
            (void)std::snprintf(digits, sizeof digits, "%02x", byte);
            text += digits;
        }
        return text;
    }

    std::string text_;
};

}  // namespace platform
