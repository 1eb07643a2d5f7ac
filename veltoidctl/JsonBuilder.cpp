#include "veltoidctl/JsonBuilder.h"

#include <cmath>
#include <ctime>

#include "Values/Base64.h"

namespace veltoidctl {

std::optional<std::string> dateText(double seconds) {
    std::tm calendar{};
    const auto whole = static_cast<time_t>(std::floor(seconds));
    char text[64];
    if (!std::isfinite(seconds) || std::abs(seconds) > 6e16 || gmtime_r(&whole, &calendar) == nullptr ||
        std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &calendar) == 0)
        return std::nullopt;
    return text;
}

veltoid::Data dataIn(const Json& dictionary, const char* key) {
    const auto found = dictionary.find(key);
    if (found == dictionary.end() || !found->is_string()) return {};
    return veltoid::xmlrpcBase64Decode(found->get_ref<const std::string&>());
}

void JsonBuilder::data(platform::Bytes bytes) { add(veltoid::xmlrpcBase64Encode(bytes, false).text()); }

void JsonBuilder::date(double seconds) {
    if (const auto text = dateText(seconds)) {
        add(*text);
    } else {
        add(seconds);
    }
}

void JsonBuilder::add(Json value) {
    if (open_.empty()) {
        value_ = std::move(value);
        complete_ = true;
    } else if (open_.back().container.is_array()) {
        open_.back().container.push_back(std::move(value));
    } else {
        open_.back().container[open_.back().key] = std::move(value);
    }
}

void JsonBuilder::endContainer() {
    Json container = std::move(open_.back().container);
    open_.pop_back();
    add(std::move(container));
}

}  // namespace veltoidctl
