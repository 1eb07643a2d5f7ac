// The agent's side of the XML-RPC property test. Reads one line per task and answers with one line:
//
//   parse BASE64    the value of a response document, after "fault" or "value"; "none" when it has none
//   encode VALUE    the base64 text of a request with this one parameter, its method being "test"
//
// A value is a sequence of words, the first character of which is its kind: iN integer, dX double, bN
// boolean, sB string and xB data in base64, tN date, n Null, aN an array of the N values that follow, mN a
// dictionary of the N pairs of string and value that follow.
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <sstream>

#include "Values/Base64.h"
#include "XMLRPC/XMLRPCDefaultEncoder.h"
#include "XMLRPC/XMLRPCResponse.h"

namespace {

using namespace veltoid;

std::string base64(std::string_view text) {
    return xmlrpcBase64Encode(platform::bytesOf(text), false).text();
}

std::string bytesOfBase64(const std::string& text) {
    return std::string(platform::textOf(xmlrpcBase64Decode(text).bytes()));
}

void describe(std::ostream& out, const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Null:
            out << " n";
            break;
        case Value::Kind::Boolean:
            out << " b" << *value.asBoolean();
            break;
        case Value::Kind::Number: {
            char digits[32];
            const auto end = value.isFloating()
                                 ? std::to_chars(std::begin(digits), std::end(digits), *value.asDouble()).ptr
                                 : std::to_chars(std::begin(digits), std::end(digits), *value.asInt64()).ptr;
            out << (value.isFloating() ? " d" : " i") << std::string_view(digits, end);
            break;
        }
        case Value::Kind::Date:
            out << " t" << std::llround(*value.asDate());
            break;
        case Value::Kind::String:
            out << " s" << base64(*value.asText());
            break;
        case Value::Kind::Data:
            out << " x" << base64(platform::textOf(value.asData().bytes()));
            break;
        case Value::Kind::Array:
            out << " a" << value.asArray()->size();
            for (const Value& element : *value.asArray()) describe(out, element);
            break;
        case Value::Kind::Dictionary:
            out << " m" << value.asDictionary()->size();
            for (const auto& [key, member] : *value.asDictionary()) {
                out << " s" << base64(key.view());
                describe(out, member);
            }
            break;
        default:
            std::abort();
    }
}

Value readValue(std::istream& in) {
    std::string word;
    if (!(in >> word)) std::abort();
    const std::string rest = word.substr(1);
    switch (word[0]) {
        case 'n':
            return Value::null();
        case 'b':
            return Value::boolean(rest == "1");
        case 'i':
            return Value::int64(std::stoll(rest));
        case 'd':
            return Value::real(std::strtod(rest.c_str(), nullptr));
        case 't':
            return Value::date(std::strtod(rest.c_str(), nullptr));
        case 's':
            return bytesOfBase64(rest);
        case 'x':
            return xmlrpcBase64Decode(rest);
        case 'a': {
            Array array;
            for (long left = std::stol(rest); left > 0; --left) array.append(readValue(in));
            return array;
        }
        case 'm': {
            Dictionary dictionary;
            for (long left = std::stol(rest); left > 0; --left) {
                const String key = readValue(in).asString();
                dictionary.set(key, readValue(in));
            }
            return dictionary;
        }
        default:
            std::abort();
    }
}

void parse(std::istream& task) {
    std::string encoded;
    task >> encoded;
    const std::string document = bytesOfBase64(encoded);
    const XMLRPCResponse response({document.begin(), document.end()});
    if (response.object().isAbsent()) {
        std::cout << "none" << std::endl;
        return;
    }
    std::cout << (response.isFault() ? "fault" : "value");
    describe(std::cout, response.object());
    std::cout << std::endl;
}

void encode(std::istream& task) {
    XMLRPCDefaultEncoder encoder;
    encoder.setMethod("test", Array{readValue(task)});
    std::cout << base64(encoder.encode()) << std::endl;
}

}  // namespace

int main() {
    for (std::string line; std::getline(std::cin, line);) {
        std::istringstream task(line);
        std::string kind;
        task >> kind;
        kind == "parse" ? parse(task) : encode(task);
    }
}
