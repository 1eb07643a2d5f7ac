// The form in which values cross the platform boundary: a stream of events, so that neither side knows the
// other's tree. A value that is stored or sent is written into a sink; to read one, a sink is handed in.
#pragma once

#include <cstdint>
#include <functional>
#include <span>
#include <string_view>

#include "Platform/runtime/SecureMemory.h"

namespace platform {

/// Receives one value as events. Between beginDictionary and endDictionary every value is preceded by its
/// key. Callers balance begin and end; spans and views live only for the call.
class ValueSink {
  public:
    virtual ~ValueSink() = default;

    virtual void null() = 0;
    virtual void boolean(bool value) = 0;
    virtual void integer(int64_t value) = 0;
    virtual void unsignedInteger(uint64_t value) = 0;
    virtual void real(double value) = 0;
    virtual void singleReal(float value) { real(static_cast<double>(value)); }
    virtual void string(std::string_view utf8) = 0;
    virtual void data(Bytes bytes) = 0;
    /// Seconds since 1970-01-01 00:00:00 UTC.
    virtual void date(double seconds) = 0;
    virtual void uuid(std::span<const uint8_t, 16> bytes) = 0;
    /// The descriptor stays the sender's: a receiver that keeps it duplicates it.
    virtual void fileDescriptor(int descriptor) = 0;
    virtual void beginArray() = 0;
    virtual void endArray() = 0;
    virtual void beginDictionary() = 0;
    virtual void key(std::string_view utf8) = 0;
    virtual void endDictionary() = 0;
};

/// Writes exactly one value into the sink that it is given.
using ValueWriter = std::function<void(ValueSink&)>;

}  // namespace platform
