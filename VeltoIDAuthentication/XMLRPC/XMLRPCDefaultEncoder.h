// Writes XML-RPC method calls (xmlrpc.com): one line, no white space between tags.
#pragma once

#include <optional>

#include "Platform/runtime/SecureMemory.h"
#include "Values/Value.h"

namespace veltoid {

/// A method call and its document text. Encoding cannot fail. The texts are of the wiping kind because
/// parameters carry password hashes. One object belongs to one thread at a time.
class XMLRPCDefaultEncoder {
  public:
    /// Replaces both; none means no parameters.
    void setMethod(const String& method, std::optional<Array> parameters);

    const String& method() const { return myMethod; }
    const std::optional<Array>& parameters() const { return myParameters; }

    /// The whole document, written in one pass.
    platform::SecretText encode() const;

    // The `value` element of one value; nothing for the absent one. Null, and what XML-RPC has no form for
    // (URL, UUID, Error, objects), is the nil element of the common extension.
    static platform::SecretText encodeObject(const Value& value);
    static platform::SecretText encodeArray(const Array& array);
    static platform::SecretText encodeDictionary(const Dictionary& dictionary);
    static platform::SecretText encodeBoolean(bool value);
    /// Double-precision numbers as "double" in the shortest form that reads back; every other kind as "i4",
    /// without regard to 32 bits.
    static platform::SecretText encodeNumber(const Value& number);
    /// With `omitTag` just the escaped text.
    static platform::SecretText encodeString(std::string_view text, bool omitTag);
    /// `seconds` since 1970-01-01 00:00:00 UTC; written at UTC, fractions dropped.
    static platform::SecretText encodeDate(double seconds);
    static platform::SecretText encodeData(platform::Bytes bytes);
    /// `text` as it is, inside the tag, inside a `value` element.
    static platform::SecretText valueTag(std::string_view tag, std::string_view text);

  private:
    String myMethod = "";
    std::optional<Array> myParameters = Array();
};

}  // namespace veltoid
