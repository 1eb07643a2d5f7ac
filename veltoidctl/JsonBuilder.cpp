#include "veltoidctl/JsonBuilder.h"

#include "Platform/encoding/CalendarText.h"
#include "Values/Base64.h"

namespace veltoidctl {

veltoid::Data dataIn(const Json& dictionary, std::string_view key) {
    const auto found = dictionary.find(key);
    if (found == dictionary.end() || !found->is_string()) return {};
    return veltoid::xmlrpcBase64Decode(found->get_ref<const std::string&>());
}

void JsonBuilder::data(platform::Bytes bytes) { add(veltoid::xmlrpcBase64Encode(bytes, false).text()); }

void JsonBuilder::date(double seconds) {
    const auto text = platform::calendarText(seconds, platform::kISO8601);
    add(text ? Json(*text) : Json(seconds));
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
