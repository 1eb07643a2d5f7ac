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

template <typename Number>
std::string digits(Number number) {
    char text[32];
    return {text, std::to_chars(std::begin(text), std::end(text), number).ptr};
}

std::string described(const Value& value) {
    if (value.isNull()) return " n";
    if (const auto flag = value.asBoolean()) return *flag ? " b1" : " b0";
    if (const auto date = value.asDate()) return " t" + digits(std::llround(*date));
    if (value.isString()) return " s" + base64(*value.asText());
    if (value.kind() == Value::Kind::Data) return " x" + base64(platform::textOf(value.asData().bytes()));
    if (const Array* array = value.asArray()) {
        std::string text = " a" + digits(array->size());
        for (const Value& element : *array) text += described(element);
        return text;
    }
    if (const Dictionary* dictionary = value.asDictionary()) {
        std::string text = " m" + digits(dictionary->size());
        for (const auto& [key, member] : *dictionary) text += described(key) + described(member);
        return text;
    }
    if (value.kind() != Value::Kind::Number) std::abort();
    return value.isFloating() ? " d" + digits(*value.asDouble()) : " i" + digits(*value.asInt64());
}

Value readValue(std::istream& in) {
    std::string word;
    if (!(in >> word)) std::abort();
    const char kind = word[0];
    const std::string rest = word.substr(1);
    if (kind == 'n') return Value::null();
    if (kind == 'b') return Value::boolean(rest == "1");
    if (kind == 'i') return Value::int64(std::stoll(rest));
    if (kind == 'd') return Value::real(std::strtod(rest.c_str(), nullptr));
    if (kind == 't') return Value::date(std::strtod(rest.c_str(), nullptr));
    if (kind == 's') return bytesOfBase64(rest);
    if (kind == 'x') return xmlrpcBase64Decode(rest);
    Array array;
    Dictionary dictionary;
    for (long left = std::stol(rest); left > 0; --left) {
        const Value first = readValue(in);
        if (kind == 'a')
            array.append(first);
        else
            dictionary.set(first.asString(), readValue(in));
    }
    if (kind != 'a' && kind != 'm') std::abort();
    return kind == 'a' ? Value(array) : Value(dictionary);
}

void parse(std::istream& task) {
    std::string encoded;
    task >> encoded;
    const std::string document = bytesOfBase64(encoded);
    const XMLRPCResponse response({document.begin(), document.end()});
    if (response.object().isAbsent())
        std::cout << "none" << std::endl;
    else
        std::cout << (response.isFault() ? "fault" : "value") << described(response.object()) << std::endl;
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
