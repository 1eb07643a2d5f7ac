#include "XMLRPC/XMLRPCDefaultEncoder.h"

#include <algorithm>
#include <charconv>
#include <cstdlib>

#include "Platform/encoding/CalendarText.h"
#include "Values/Base64.h"
#include "XMLRPC/XMLRPCHelpers.h"

namespace veltoid {
namespace {

using platform::SecretText;

/// Where a text starts: more than what a string keeps inside itself, where it would not be wiped.
constexpr size_t kInitialCapacity = 256;

/// Appends elements to one text, so that no value costs a text of its own.
class ElementWriter {
  public:
    explicit ElementWriter(SecretText& out) : out_(out) {}

    void boolean(bool value) {
        out_.append("<value><boolean>").append(value ? "1" : "0").append("</boolean></value>");
    }

    void document(const String& method, const std::optional<Array>& parameters) {
        out_ += "<?xml version=\"1.0\"?><methodCall><methodName>";
        appendEscapedString(out_, method.view());
        out_ += "</methodName><params>";
        if (parameters) {
            for (const Value& parameter : *parameters) {
                out_ += "<param>";
                object(parameter);
                out_ += "</param>";
            }
        }
        out_ += "</params></methodCall>";
    }

    void object(const Value& value) {
        switch (value.kind()) {
            case Value::Kind::Absent:
                return;
            case Value::Kind::Array:
                return array(*value.asArray());
            case Value::Kind::Dictionary:
                return dictionary(*value.asDictionary());
            case Value::Kind::Boolean:
                return boolean(*value.asBoolean());
            case Value::Kind::Number:
                return number(value);
            case Value::Kind::String:
                return string(*value.asText());
            case Value::Kind::Date:
                return date(*value.asDate());
            case Value::Kind::Data:
                return data(value.asData().bytes());
            default:
                out_ += "<value><nil/></value>";
        }
    }

    void array(const Array& array) {
        out_ += "<value><array><data>";
        for (const Value& element : array) object(element);
        out_ += "</data></array></value>";
    }

    void dictionary(const Dictionary& dictionary) {
        out_ += "<value><struct>";
        for (const auto& [key, value] : dictionary) {
            out_ += "<member><name>";
            appendEscapedString(out_, key.view());
            out_ += "</name>";
            object(value);
            out_ += "</member>";
        }
        out_ += "</struct></value>";
    }

    void number(const Value& number) {
        const NumberKind kind = *number.numberKind();
        if (kind == NumberKind::Float64) {
            out_ += "<value><double>";
            decimal(*number.asDouble());
            out_ += "</double></value>";
            return;
        }
        out_ += "<value><i4>";
        if (kind == NumberKind::Float32) {
            decimal(static_cast<float>(*number.asDouble()));
        } else if (kind == NumberKind::UInt64) {
            decimal(*number.asUInt64());
        } else {
            decimal(*number.asInt64());
        }
        out_ += "</i4></value>";
    }

    void string(std::string_view text) {
        out_ += "<value><string>";
        appendEscapedString(out_, text);
        out_ += "</string></value>";
    }

    void date(double seconds) {
        const platform::CalendarDate date = platform::calendarDate(seconds);
        out_ += "<value><dateTime.iso8601>";
        padded(date.year, 4, "");
        padded(date.month, 2, "");
        padded(date.day, 2, "T");
        padded(date.hour, 2, ":");
        padded(date.minute, 2, ":");
        padded(date.second, 2, "Z</dateTime.iso8601></value>");
    }

    void data(platform::Bytes bytes) {
        out_ += "<value><base64>";
        appendXMLRPCBase64(out_, bytes, true);
        out_ += "</base64></value>";
    }

  private:
    template <typename Number>
    void decimal(Number number) {
        char digits[32];
        const auto end = std::to_chars(std::begin(digits), std::end(digits), number).ptr;
        out_.append(std::begin(digits), end);
    }

    /// At least `width` digits, filled up with zeros, and what comes after them.
    void padded(int64_t number, ptrdiff_t width, std::string_view after) {
        char digits[24];
        const char* const end = std::to_chars(std::begin(digits), std::end(digits), std::abs(number)).ptr;
        if (number < 0) {
            out_ += '-';
            --width;
        }
        const ptrdiff_t size = end - std::begin(digits);
        out_.append(static_cast<size_t>(std::max<ptrdiff_t>(width - size, 0)), '0')
            .append(digits, static_cast<size_t>(size))
            .append(after);
    }

    SecretText& out_;
};

/// The text that one operation of the writer writes.
template <typename... Parameters, typename... Arguments>
SecretText written(void (ElementWriter::*write)(Parameters...), const Arguments&... arguments) {
    SecretText out;
    out.reserve(kInitialCapacity);
    ElementWriter writer(out);
    (writer.*write)(arguments...);
    return out;
}

}  // namespace

void XMLRPCDefaultEncoder::setMethod(const String& method, std::optional<Array> parameters) {
    myMethod = method;
    myParameters = std::move(parameters);
}

SecretText XMLRPCDefaultEncoder::encode() const {
    return written(&ElementWriter::document, myMethod, myParameters);
}

SecretText XMLRPCDefaultEncoder::encodeObject(const Value& value) {
    return written(&ElementWriter::object, value);
}

SecretText XMLRPCDefaultEncoder::encodeArray(const Array& array) {
    return written(&ElementWriter::array, array);
}

SecretText XMLRPCDefaultEncoder::encodeDictionary(const Dictionary& dictionary) {
    return written(&ElementWriter::dictionary, dictionary);
}

SecretText XMLRPCDefaultEncoder::encodeBoolean(bool value) { return written(&ElementWriter::boolean, value); }

SecretText XMLRPCDefaultEncoder::encodeNumber(const Value& number) {
    return number.isNumber() ? encodeObject(number) : SecretText();
}

SecretText XMLRPCDefaultEncoder::encodeString(std::string_view text, bool omitTag) {
    if (omitTag) return escapedString(text);
    return written(&ElementWriter::string, text);
}

SecretText XMLRPCDefaultEncoder::encodeDate(double seconds) { return written(&ElementWriter::date, seconds); }

SecretText XMLRPCDefaultEncoder::encodeData(platform::Bytes bytes) {
    return written(&ElementWriter::data, bytes);
}

SecretText XMLRPCDefaultEncoder::valueTag(std::string_view tag, std::string_view text) {
    SecretText out;
    out.reserve(kInitialCapacity + text.size());
    out.append("<value><").append(tag).append(">").append(text);
    return out.append("</").append(tag).append("></value>");
}

}  // namespace veltoid
