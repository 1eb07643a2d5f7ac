#include "Platform/net/HTTPExchange.h"

#include <strings.h>

#include <algorithm>

namespace platform {
namespace {

bool isSameFieldName(std::string_view a, std::string_view b) {
    return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

}  // namespace

void HTTPRequest::setHeaderField(std::string_view name, std::string_view value) {
    for (auto& [fieldName, fieldValue] : headerFields) {
        if (!isSameFieldName(fieldName, name)) continue;
        fieldValue = value;
        return;
    }
    headerFields.emplace_back(name, value);
}

const std::string* HTTPRequest::headerField(std::string_view name) const {
    const auto field = std::find_if(headerFields.begin(), headerFields.end(),
                                    [=](const auto& each) { return isSameFieldName(each.first, name); });
    return field == headerFields.end() ? nullptr : &field->second;
}

}  // namespace platform
