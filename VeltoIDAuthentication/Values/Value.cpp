#include "Values/Value.h"

#include <algorithm>
#include <cmath>
#include <limits>

#include "Platform/runtime/SecureMemory.h"

namespace veltoid {
namespace detail {

BytesNode* BytesNode::create(size_t size) {
    if (size > std::numeric_limits<uint32_t>::max()) throw std::bad_alloc();
    auto* node = new (::operator new(sizeof(BytesNode) + size)) BytesNode;
    node->size = static_cast<uint32_t>(size);
    return node;
}

void Node::destroy() const noexcept { delete this; }

BytesNode::~BytesNode() { platform::wipe(bytes(), size); }

struct URLText {
    String text;
    String base;
    friend bool operator==(const URLText&, const URLText&) = default;
};

namespace {

Handle<BytesNode> copyBytes(std::span<const uint8_t> bytes) {
    BytesNode* node = BytesNode::create(bytes.size());
    if (!bytes.empty()) std::memcpy(node->bytes(), bytes.data(), bytes.size());
    return Handle<BytesNode>(node);
}

bool sameBytes(const Handle<BytesNode>& a, const Handle<BytesNode>& b) {
    if (a.get() == b.get()) return true;
    if (!a || !b || a->size != b->size) return false;
    return std::memcmp(a->bytes(), b->bytes(), a->size) == 0;
}

}  // namespace
}  // namespace detail

String::String(std::string_view utf8) : node_(detail::copyBytes(platform::bytesOf(utf8))) {}

std::string_view String::view() const {
    if (!node_) return {};
    return {reinterpret_cast<const char*>(node_->bytes()), node_->size};
}

bool operator==(const String& a, const String& b) { return detail::sameBytes(a.node_, b.node_); }

Data::Data(std::span<const uint8_t> bytes) : node_(detail::copyBytes(bytes)) {}

std::span<const uint8_t> Data::bytes() const {
    if (!node_) return {};
    return {node_->bytes(), node_->size};
}

bool operator==(const Data& a, const Data& b) { return detail::sameBytes(a.node_, b.node_); }

const Value& absentValue() {
    static const Value absent;
    return absent;
}

Value::Value(String text) {
    if (!text) return;
    new (&payload_.string) veltoid::String(std::move(text));
    kind_ = Kind::String;
}

Value::Value(Data data) {
    if (!data) return;
    new (&payload_.data) veltoid::Data(std::move(data));
    kind_ = Kind::Data;
}

Value::Value(Array array) : kind_(Kind::Array) { new (&payload_.array) veltoid::Array(std::move(array)); }

Value::Value(Dictionary dictionary) : kind_(Kind::Dictionary) {
    new (&payload_.dictionary) veltoid::Dictionary(std::move(dictionary));
}

Value Value::url(String text, String base) {
    if (!text) return {};
    return boxed(Kind::URL, detail::URLText{std::move(text), std::move(base)});
}

Value Value::uuid(std::span<const uint8_t, 16> bytes) {
    std::array<uint8_t, 16> copy{};
    std::copy(bytes.begin(), bytes.end(), copy.begin());
    return boxed(Kind::UUID, copy);
}

String Value::asString() const { return kind_ == Kind::String ? payload_.string : veltoid::String(); }

std::optional<std::string_view> Value::asText() const {
    if (kind_ != Kind::String) return std::nullopt;
    return payload_.string.view();
}

Data Value::asData() const { return kind_ == Kind::Data ? payload_.data : veltoid::Data(); }
const Array* Value::asArray() const { return kind_ == Kind::Array ? &payload_.array : nullptr; }
const Dictionary* Value::asDictionary() const {
    return kind_ == Kind::Dictionary ? &payload_.dictionary : nullptr;
}

std::optional<bool> Value::asBoolean() const {
    if (kind_ != Kind::Boolean) return std::nullopt;
    return payload_.boolean;
}

std::optional<double> Value::asDate() const {
    if (kind_ != Kind::Date) return std::nullopt;
    return payload_.real;
}

std::optional<std::pair<String, String>> Value::asURL() const {
    const auto* url = unboxed<detail::URLText>(Kind::URL);
    return url != nullptr ? std::optional(std::pair(url->text, url->base)) : std::nullopt;
}

std::optional<std::array<uint8_t, 16>> Value::asUUID() const {
    const auto* uuid = unboxed<std::array<uint8_t, 16>>(Kind::UUID);
    return uuid != nullptr ? std::optional(*uuid) : std::nullopt;
}

std::optional<NumberKind> Value::numberKind() const {
    if (kind_ != Kind::Number) return std::nullopt;
    return numberKind_;
}

bool Value::isFloating() const {
    return kind_ == Kind::Number &&
           (numberKind_ == NumberKind::Float32 || numberKind_ == NumberKind::Float64);
}

std::optional<double> Value::asDouble() const {
    if (kind_ != Kind::Number) return std::nullopt;
    switch (numberKind_) {
        case NumberKind::Float64:
            return payload_.real;
        case NumberKind::Float32:
            return static_cast<double>(payload_.single);
        case NumberKind::UInt64:
            return static_cast<double>(payload_.unsignedInteger);
        default:
            return static_cast<double>(payload_.integer);
    }
}

std::optional<int64_t> Value::asInt64() const {
    if (kind_ != Kind::Number) return std::nullopt;
    if (isFloating()) {
        constexpr double kLimit = 9223372036854775808.0;
        const double real = *asDouble();
        if (!(real >= -kLimit && real < kLimit) || std::trunc(real) != real) return std::nullopt;
        return static_cast<int64_t>(real);
    }
    if (numberKind_ == NumberKind::UInt64) {
        if (payload_.unsignedInteger > static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
            return std::nullopt;
        return static_cast<int64_t>(payload_.unsignedInteger);
    }
    return payload_.integer;
}

std::optional<int32_t> Value::asInt32() const {
    const std::optional<int64_t> wide = asInt64();
    if (!wide || *wide < std::numeric_limits<int32_t>::min() || *wide > std::numeric_limits<int32_t>::max())
        return std::nullopt;
    return static_cast<int32_t>(*wide);
}

std::optional<uint64_t> Value::asUInt64() const {
    if (kind_ == Kind::Number && numberKind_ == NumberKind::UInt64) return payload_.unsignedInteger;
    const std::optional<int64_t> integer = asInt64();
    if (!integer || *integer < 0) return std::nullopt;
    return static_cast<uint64_t>(*integer);
}

namespace {

bool sameNumber(const Value& a, const Value& b) {
    if (const auto x = a.asInt64(), y = b.asInt64(); x || y) return x == y;
    if (const auto x = a.asUInt64(), y = b.asUInt64(); x || y) return x == y;
    return *a.asDouble() == *b.asDouble();
}

}  // namespace

bool operator==(const Value& a, const Value& b) {
    if (a.kind_ != b.kind_) return false;
    switch (a.kind_) {
        case Value::Kind::Absent:
        case Value::Kind::Null:
            return true;
        case Value::Kind::Boolean:
            return a.payload_.boolean == b.payload_.boolean;
        case Value::Kind::Number:
            return sameNumber(a, b);
        case Value::Kind::Date:
            return a.payload_.real == b.payload_.real;
        case Value::Kind::String:
            return a.payload_.string == b.payload_.string;
        case Value::Kind::Data:
            return a.payload_.data == b.payload_.data;
        case Value::Kind::Array:
            return a.payload_.array == b.payload_.array;
        case Value::Kind::Dictionary:
            return a.payload_.dictionary == b.payload_.dictionary;
        default:
            return a.payload_.box->equals(*b.payload_.box.get());
    }
}

}  // namespace veltoid
