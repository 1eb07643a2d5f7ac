#include "Platform/net/HTTPExchange.h"

#include <strings.h>

#include <algorithm>

namespace platform {
namespace {

auto fieldNamed(std::string_view name, auto& fields) {
    return std::ranges::find_if(fields, [name](const auto& field) {
        return field.first.size() == name.size() &&
               strncasecmp(field.first.data(), name.data(), name.size()) == 0;
    });
}

}  // namespace

void HTTPRequest::setHeaderField(std::string_view name, std::string_view value) {
    const auto field = fieldNamed(name, headerFields);
    if (field == headerFields.end())
        headerFields.emplace_back(name, value);
    else
        field->second = value;
}

const std::string* HTTPRequest::headerField(std::string_view name) const {
    const auto field = fieldNamed(name, headerFields);
    return field == headerFields.end() ? nullptr : &field->second;
}

}  // namespace platform
