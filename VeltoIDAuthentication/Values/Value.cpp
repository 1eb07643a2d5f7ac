#include "Values/Value.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <new>

#include "Platform/SecureMemory.h"
#include "Values/Error.h"
#include "Values/SecurityObject.h"

namespace veltoid {
namespace detail {

BytesNode* BytesNode::create(size_t size) {
    auto* node = new (::operator new(sizeof(BytesNode) + size)) BytesNode;
    node->size = size;
    return node;
}

template <>
void destroy<BytesNode>(Counted* counted) noexcept {
    auto* node = static_cast<BytesNode*>(counted);
    platform::wipe(node->bytes(), node->size);
    node->~BytesNode();
    ::operator delete(node);
}

struct ArrayNode : Counted {
    std::vector<Value> elements;
};

template <>
void destroy<ArrayNode>(Counted* counted) noexcept {
    delete static_cast<ArrayNode*>(counted);
}

/// Entries in insertion order, with an open-addressing index beside them once a scan would cost more.
struct DictionaryNode : Counted {
    static constexpr size_t kScanLimit = 8;
    static constexpr uint32_t kFree = 0;
    static constexpr size_t kNotFound = std::numeric_limits<size_t>::max();

    std::vector<Dictionary::Entry> entries;
    /// Entry position + 1; a power of two in size, at most half full; empty while entries are scanned.
    std::vector<uint32_t> slots;

    static size_t hashOf(std::string_view key) { return std::hash<std::string_view>()(key); }

    size_t find(std::string_view key) const {
        if (slots.empty()) {
            for (size_t position = 0; position < entries.size(); ++position)
                if (entries[position].key.view() == key) return position;
            return kNotFound;
        }
        const size_t mask = slots.size() - 1;
        for (size_t slot = hashOf(key) & mask; slots[slot] != kFree; slot = (slot + 1) & mask)
            if (entries[slots[slot] - 1].key.view() == key) return slots[slot] - 1;
        return kNotFound;
    }

    void append(String key, Value value) {
        entries.push_back({std::move(key), std::move(value)});
        if (entries.size() * 2 > slots.size()) {
            rebuildIndex();
        } else {
            occupy(entries.size() - 1);
        }
    }

    void rebuildIndex() {
        slots.clear();
        if (entries.size() <= kScanLimit) return;
        size_t capacity = 4 * kScanLimit;
        while (capacity < entries.size() * 4) capacity *= 2;
        slots.assign(capacity, kFree);
        for (size_t position = 0; position < entries.size(); ++position) occupy(position);
    }

  private:
    void occupy(size_t position) {
        if (slots.empty()) return;
        const size_t mask = slots.size() - 1;
        size_t slot = hashOf(entries[position].key.view()) & mask;
        while (slots[slot] != kFree) slot = (slot + 1) & mask;
        slots[slot] = static_cast<uint32_t>(position + 1);
    }
};

template <>
void destroy<DictionaryNode>(Counted* counted) noexcept {
    delete static_cast<DictionaryNode*>(counted);
}

struct URLText {
    String text;
    String base;
    friend bool operator==(const URLText&, const URLText&) = default;
};

struct BoxNode : Counted {
    std::variant<URLText, std::array<uint8_t, 16>, Error, SecurityObject> content;
};

template <>
void destroy<BoxNode>(Counted* counted) noexcept {
    delete static_cast<BoxNode*>(counted);
}

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

/// Makes `handle` the only holder of its node, copying what `copy` names from a shared one.
template <typename Node, typename Copy>
Node& makeWritable(Handle<Node>& handle, Copy copy) {
    if (!handle) {
        handle = Handle<Node>(new Node);
    } else if (handle.isShared()) {
        auto* fresh = new Node;
        copy(*fresh, *handle.get());
        handle = Handle<Node>(fresh);
    }
    return *handle.get();
}

}  // namespace
}  // namespace detail

// --- String and Data

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

// --- Array

Array::Array(std::initializer_list<Value> elements) {
    reserve(elements.size());
    for (const Value& element : elements) append(element);
}

size_t Array::size() const { return node_ ? node_->elements.size() : 0; }
const Value& Array::operator[](size_t index) const { return node_->elements[index]; }
const Value* Array::begin() const { return node_ ? node_->elements.data() : nullptr; }
const Value* Array::end() const { return begin() + size(); }

detail::ArrayNode& Array::writable() {
    return detail::makeWritable(node_, [](detail::ArrayNode& to, const detail::ArrayNode& from) {
        to.elements.reserve(from.elements.size() + 1);
        to.elements = from.elements;
    });
}

void Array::append(Value value) {
    if (!value.isAbsent()) writable().elements.push_back(std::move(value));
}

void Array::reserve(size_t count) { writable().elements.reserve(count); }

bool operator==(const Array& a, const Array& b) {
    return a.node_.get() == b.node_.get() || std::equal(a.begin(), a.end(), b.begin(), b.end());
}

// --- Dictionary

Dictionary::Dictionary(std::initializer_list<std::pair<std::string_view, Value>> entries) {
    for (const auto& [key, value] : entries) set(key, value);
}

size_t Dictionary::size() const { return node_ ? node_->entries.size() : 0; }
const Dictionary::Entry* Dictionary::begin() const { return node_ ? node_->entries.data() : nullptr; }
const Dictionary::Entry* Dictionary::end() const { return begin() + size(); }

const Value& Dictionary::operator[](std::string_view key) const {
    const size_t position = node_ ? node_->find(key) : detail::DictionaryNode::kNotFound;
    return position == detail::DictionaryNode::kNotFound ? absentValue() : node_->entries[position].value;
}

bool Dictionary::contains(std::string_view key) const { return !(*this)[key].isAbsent(); }

detail::DictionaryNode& Dictionary::writable() {
    return detail::makeWritable(node_, [](detail::DictionaryNode& to, const detail::DictionaryNode& from) {
        to.entries = from.entries;
        to.slots = from.slots;
    });
}

void Dictionary::set(std::string_view key, Value value) {
    if (value.isAbsent()) return;
    detail::DictionaryNode& node = writable();
    const size_t position = node.find(key);
    if (position == detail::DictionaryNode::kNotFound) {
        node.append(String(key), std::move(value));
    } else {
        node.entries[position].value = std::move(value);
    }
}

void Dictionary::set(const String& key, Value value) {
    if (value.isAbsent() || !key) return;
    detail::DictionaryNode& node = writable();
    const size_t position = node.find(key.view());
    if (position == detail::DictionaryNode::kNotFound) {
        node.append(key, std::move(value));
    } else {
        node.entries[position].value = std::move(value);
    }
}

bool Dictionary::remove(std::string_view key) {
    if (!contains(key)) return false;
    detail::DictionaryNode& node = writable();
    node.entries.erase(node.entries.begin() + static_cast<ptrdiff_t>(node.find(key)));
    node.rebuildIndex();
    return true;
}

void Dictionary::reserve(size_t count) { writable().entries.reserve(count); }

String Dictionary::string(std::string_view key) const { return (*this)[key].asString(); }
Data Dictionary::data(std::string_view key) const { return (*this)[key].asData(); }
std::optional<bool> Dictionary::boolean(std::string_view key) const { return (*this)[key].asBoolean(); }
std::optional<double> Dictionary::date(std::string_view key) const { return (*this)[key].asDate(); }
std::optional<double> Dictionary::number(std::string_view key) const { return (*this)[key].asDouble(); }
const Array* Dictionary::array(std::string_view key) const { return (*this)[key].asArray(); }
const Dictionary* Dictionary::dictionary(std::string_view key) const { return (*this)[key].asDictionary(); }

bool operator==(const Dictionary& a, const Dictionary& b) {
    if (a.node_.get() == b.node_.get()) return true;
    return a.size() == b.size() && std::all_of(a.begin(), a.end(), [&](const Dictionary::Entry& entry) {
               return entry.value == b[entry.key.view()];
           });
}

// --- Value

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

Value Value::boxed(Kind kind, detail::BoxNode* node) {
    Value value;
    new (&value.payload_.box) Box(node);
    value.kind_ = kind;
    return value;
}

Value::Value(Error error) {
    auto* node = new detail::BoxNode;
    node->content = std::move(error);
    *this = boxed(Kind::Error, node);
}

Value Value::null() {
    Value value;
    value.kind_ = Kind::Null;
    return value;
}

Value Value::boolean(bool boolean) {
    Value value;
    value.kind_ = Kind::Boolean;
    value.payload_.boolean = boolean;
    return value;
}

Value Value::integer(int64_t integer, NumberKind kind) {
    Value value;
    value.kind_ = Kind::Number;
    value.numberKind_ = kind;
    value.payload_.integer = integer;
    return value;
}

Value Value::uint64(uint64_t integer) {
    Value value;
    value.kind_ = Kind::Number;
    value.numberKind_ = NumberKind::UInt64;
    value.payload_.unsignedInteger = integer;
    return value;
}

Value Value::real(double real) {
    Value value;
    value.kind_ = Kind::Number;
    value.numberKind_ = NumberKind::Float64;
    value.payload_.real = real;
    return value;
}

Value Value::singleReal(float single) {
    Value value;
    value.kind_ = Kind::Number;
    value.numberKind_ = NumberKind::Float32;
    value.payload_.single = single;
    return value;
}

Value Value::date(double seconds) {
    Value value;
    value.kind_ = Kind::Date;
    value.payload_.real = seconds;
    return value;
}

Value Value::url(String text, String base) {
    if (!text) return {};
    auto* node = new detail::BoxNode;
    node->content = detail::URLText{std::move(text), std::move(base)};
    return boxed(Kind::URL, node);
}

Value Value::uuid(std::span<const uint8_t, 16> bytes) {
    std::array<uint8_t, 16> copy{};
    std::copy(bytes.begin(), bytes.end(), copy.begin());
    auto* node = new detail::BoxNode;
    node->content = copy;
    return boxed(Kind::UUID, node);
}

Value Value::object(SecurityObject object) {
    auto* node = new detail::BoxNode;
    node->content = std::move(object);
    return boxed(Kind::Object, node);
}

Value::Value(const Value& other) noexcept : kind_(other.kind_), numberKind_(other.numberKind_) {
    switch (kind_) {
        case Kind::String:
            new (&payload_.string) veltoid::String(other.payload_.string);
            break;
        case Kind::Data:
            new (&payload_.data) veltoid::Data(other.payload_.data);
            break;
        case Kind::Array:
            new (&payload_.array) veltoid::Array(other.payload_.array);
            break;
        case Kind::Dictionary:
            new (&payload_.dictionary) veltoid::Dictionary(other.payload_.dictionary);
            break;
        case Kind::URL:
        case Kind::UUID:
        case Kind::Error:
        case Kind::Object:
            new (&payload_.box) Box(other.payload_.box);
            break;
        default:
            std::memcpy(static_cast<void*>(&payload_), static_cast<const void*>(&other.payload_),
                        sizeof payload_);
    }
}

void Value::releasePayload() noexcept {
    switch (kind_) {
        case Kind::String:
            payload_.string.~String();
            break;
        case Kind::Data:
            payload_.data.~Data();
            break;
        case Kind::Array:
            payload_.array.~Array();
            break;
        case Kind::Dictionary:
            payload_.dictionary.~Dictionary();
            break;
        default:
            payload_.box.~Box();
    }
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

const Error* Value::asError() const {
    return kind_ == Kind::Error ? std::get_if<veltoid::Error>(&payload_.box->content) : nullptr;
}

const SecurityObject* Value::asObject() const {
    return kind_ == Kind::Object ? std::get_if<SecurityObject>(&payload_.box->content) : nullptr;
}

std::optional<std::pair<String, String>> Value::asURL() const {
    if (kind_ != Kind::URL) return std::nullopt;
    const auto& url = std::get<detail::URLText>(payload_.box->content);
    return std::pair(url.text, url.base);
}

std::optional<std::array<uint8_t, 16>> Value::asUUID() const {
    if (kind_ != Kind::UUID) return std::nullopt;
    return std::get<std::array<uint8_t, 16>>(payload_.box->content);
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
            return a.payload_.box->content == b.payload_.box->content;
    }
}

}  // namespace veltoid
