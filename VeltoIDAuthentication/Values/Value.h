// Values: what records, options, requests, replies and server parameters are made of.
//
// A Value is a small handle on something immutable: copying one, or a whole section of the database, costs a
// reference. Array and Dictionary are handles too; changing one copies its entries first if another handle
// shares them. Texts and data are wiped when their last handle goes, since any of them may be a secret.
//
// A value of the wrong type counts as absent: typed getters return null, none or a default and never throw.
// Handles of the same content may be used from different threads; one handle belongs to one thread at a time.
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <cstring>
#include <initializer_list>
#include <new>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace veltoid {

class Value;
struct Error;
struct SecurityObject;

namespace detail {

/// What handles share.
struct Node {
    mutable std::atomic<uint32_t> references{1};

    virtual ~Node() = default;
    void retain() const noexcept { references.fetch_add(1, std::memory_order_relaxed); }
    void release() const noexcept {
        if (references.fetch_sub(1, std::memory_order_acq_rel) == 1) destroy();
    }
    void destroy() const noexcept;
};

/// Bytes in one allocation behind their header, which is small for the sake of many short ones; wiped when
/// freed.
struct BytesNode final : Node {
    uint32_t size = 0;
    ~BytesNode() override;
    uint8_t* bytes() { return reinterpret_cast<uint8_t*>(this + 1); }
    const uint8_t* bytes() const { return reinterpret_cast<const uint8_t*>(this + 1); }
    /// Throws std::bad_alloc.
    static BytesNode* create(size_t size);
    /// Without the size, which is not the header's.
    static void operator delete(void* memory) { ::operator delete(memory); }
};

struct ArrayNode;
struct DictionaryNode;

/// Content of a type that this header does not declare. The source of that type also defines how it becomes a
/// Value.
struct BoxNode : Node {
    /// `other` holds content of the same type.
    virtual bool equals(const BoxNode& other) const = 0;
};

template <typename Content>
struct Boxed final : BoxNode {
    explicit Boxed(Content boxedContent) : content(std::move(boxedContent)) {}
    bool equals(const BoxNode& other) const override {
        return content == static_cast<const Boxed&>(other).content;
    }
    const Content content;
};

/// Reference-counted pointer; the kind of node may be incomplete.
template <typename Kind>
class Handle {
  public:
    Handle() = default;
    explicit Handle(Node* adopted) noexcept : node_(adopted) {}
    Handle(const Handle& other) noexcept : node_(other.node_) {
        if (node_ != nullptr) node_->retain();
    }
    Handle(Handle&& other) noexcept : node_(std::exchange(other.node_, nullptr)) {}
    Handle& operator=(Handle other) noexcept {
        std::swap(node_, other.node_);
        return *this;
    }
    ~Handle() {
        if (node_ != nullptr) node_->release();
    }

    Kind* get() const { return static_cast<Kind*>(node_); }
    Kind* operator->() const { return get(); }
    explicit operator bool() const { return node_ != nullptr; }
    bool isShared() const { return node_->references.load(std::memory_order_acquire) > 1; }

  private:
    Node* node_ = nullptr;
};

}  // namespace detail

/// Immutable UTF-8 text, or no text at all (null). Operations take one by const reference; null means absent.
class String {
  public:
    String() = default;
    String(std::string_view utf8);  // NOLINT(google-explicit-constructor): literals name accounts and keys
    String(const char* utf8) : String(std::string_view(utf8)) {}
    String(const std::string& utf8) : String(std::string_view(utf8)) {}
    String(std::nullptr_t) {}

    /// New text of `size` bytes, all of which `write(char*)` writes.
    template <typename Write>
    static String writtenBy(size_t size, Write&& write) {
        String result;
        result.node_ = detail::Handle<detail::BytesNode>(detail::BytesNode::create(size));
        write(reinterpret_cast<char*>(result.node_->bytes()));
        return result;
    }

    explicit operator bool() const { return static_cast<bool>(node_); }
    /// Empty when null.
    std::string_view view() const;
    std::string text() const { return std::string(view()); }
    bool empty() const { return view().empty(); }

    /// Two null strings are equal; a null one equals no text, not even the empty one.
    friend bool operator==(const String& a, const String& b);

  private:
    friend class Value;
    detail::Handle<detail::BytesNode> node_;
};

/// Immutable bytes, or none at all (null).
class Data {
  public:
    Data() = default;
    explicit Data(std::span<const uint8_t> bytes);

    /// New data of `size` bytes, filled by `fill(uint8_t*)`, which returns how many of them it used.
    template <typename Fill>
    static Data filledBy(size_t size, Fill&& fill) {
        Data result;
        result.node_ = detail::Handle<detail::BytesNode>(detail::BytesNode::create(size));
        result.node_->size = static_cast<uint32_t>(fill(result.node_->bytes()));
        return result;
    }

    explicit operator bool() const { return static_cast<bool>(node_); }
    std::span<const uint8_t> bytes() const;
    size_t size() const { return bytes().size(); }

    friend bool operator==(const Data& a, const Data& b);

  private:
    friend class Value;
    detail::Handle<detail::BytesNode> node_;
};

class Array {
  public:
    Array() = default;
    Array(std::initializer_list<Value> elements);

    size_t size() const;
    bool empty() const { return size() == 0; }
    const Value& operator[](size_t index) const;
    const Value* begin() const;
    const Value* end() const;

    /// An absent value is not appended.
    void append(Value value);
    void reserve(size_t count);

    friend bool operator==(const Array& a, const Array& b);

  private:
    friend class Value;
    detail::ArrayNode& writable();
    detail::Handle<detail::ArrayNode> node_;
};

/// String keys to values; iterates in the order in which keys were first set. Look-up is constant time at any
/// size.
class Dictionary {
  public:
    struct Entry;

    Dictionary() = default;
    /// Pairs whose value is absent are left out.
    Dictionary(std::initializer_list<std::pair<std::string_view, Value>> entries);

    size_t size() const;
    bool empty() const { return size() == 0; }
    const Entry* begin() const;
    const Entry* end() const;

    /// The value under key; absent when there is none.
    const Value& operator[](std::string_view key) const;
    bool contains(std::string_view key) const;

    /// Sets or replaces; an absent value changes nothing. A String key is shared, not copied.
    void set(std::string_view key, Value value);
    void set(const String& key, Value value);
    void set(const char* key, Value value);

    /// False when there was none.
    bool remove(std::string_view key);
    void reserve(size_t count);

    // Typed reads: null, none or the default when the key is missing or holds another type.
    String string(std::string_view key) const;
    Data data(std::string_view key) const;
    std::optional<bool> boolean(std::string_view key) const;
    std::optional<double> date(std::string_view key) const;
    std::optional<double> number(std::string_view key) const;
    const Array* array(std::string_view key) const;
    const Dictionary* dictionary(std::string_view key) const;

    friend bool operator==(const Dictionary& a, const Dictionary& b);

  private:
    friend class Value;
    detail::DictionaryNode& writable();
    detail::Handle<detail::DictionaryNode> node_;
};

/// How a Number is stored; it decides how it is written and described.
enum class NumberKind : uint8_t { Int8, Int16, Int32, Int64, UInt64, Index, Float32, Float64 };

class Value {
  public:
    enum class Kind : uint8_t {
        Absent,
        Null,
        Boolean,
        Number,
        Date,
        // From here on a value holds a reference.
        String,
        Data,
        Array,
        Dictionary,
        URL,
        UUID,
        Error,
        Object
    };

    /// The absent value.
    Value() = default;
    Value(String text);  // NOLINT(google-explicit-constructor)
    Value(const char* text) : Value(String(text)) {}
    Value(std::string_view text) : Value(String(text)) {}
    Value(const std::string& text) : Value(String(text)) {}
    Value(Data data);              // NOLINT(google-explicit-constructor)
    Value(Array array);            // NOLINT(google-explicit-constructor)
    Value(Dictionary dictionary);  // NOLINT(google-explicit-constructor)
    Value(Error error);            // NOLINT(google-explicit-constructor)
    Value(bool) = delete;
    Value(int) = delete;

    static Value null() { return scalar(Kind::Null, &Payload::integer, int64_t{0}); }
    static Value boolean(bool value) { return scalar(Kind::Boolean, &Payload::boolean, value); }
    static Value int32(int32_t value) { return integer(value, NumberKind::Int32); }
    static Value int64(int64_t value) { return integer(value, NumberKind::Int64); }
    /// An integer stored as `kind` (one of the integer kinds other than UInt64).
    static Value integer(int64_t value, NumberKind kind) {
        return scalar(Kind::Number, &Payload::integer, value, kind);
    }
    static Value uint64(uint64_t value) {
        return scalar(Kind::Number, &Payload::unsignedInteger, value, NumberKind::UInt64);
    }
    static Value real(double value) {
        return scalar(Kind::Number, &Payload::real, value, NumberKind::Float64);
    }
    static Value singleReal(float value) {
        return scalar(Kind::Number, &Payload::single, value, NumberKind::Float32);
    }
    /// Seconds since 1970-01-01 00:00:00 UTC.
    static Value date(double seconds) { return scalar(Kind::Date, &Payload::real, seconds); }
    static Value url(String text, String base = nullptr);
    static Value uuid(std::span<const uint8_t, 16> bytes);
    static Value object(SecurityObject object);

    Value(const Value& other) noexcept {
        copyBits(other);
        if (const detail::Node* shared = node()) shared->retain();
    }
    Value(Value&& other) noexcept { take(other); }
    Value& operator=(const Value& other) noexcept { return *this = Value(other); }
    Value& operator=(Value&& other) noexcept {
        if (this != &other) {
            reset();
            take(other);
        }
        return *this;
    }
    ~Value() { reset(); }

    Kind kind() const { return kind_; }
    bool isAbsent() const { return kind_ == Kind::Absent; }
    bool isNull() const { return kind_ == Kind::Null; }
    bool isString() const { return kind_ == Kind::String; }
    bool isNumber() const { return kind_ == Kind::Number; }
    bool isDictionary() const { return kind_ == Kind::Dictionary; }

    // Each returns null or none unless the value is of that kind.
    String asString() const;
    std::optional<std::string_view> asText() const;
    Data asData() const;
    const Array* asArray() const;
    const Dictionary* asDictionary() const;
    std::optional<bool> asBoolean() const;
    std::optional<double> asDate() const;
    const Error* asError() const;
    const SecurityObject* asObject() const;
    /// The text of a URL and of its base (null when it has none).
    std::optional<std::pair<String, String>> asURL() const;
    std::optional<std::array<uint8_t, 16>> asUUID() const;

    // Numbers.
    std::optional<NumberKind> numberKind() const;
    bool isFloating() const;
    /// The number as a double; none for other kinds of value.
    std::optional<double> asDouble() const;
    /// The number as a 64-bit integer when it is exactly that.
    std::optional<int64_t> asInt64() const;
    std::optional<int32_t> asInt32() const;
    std::optional<uint64_t> asUInt64() const;

    /// Equal kind and content; numbers by value, whatever their stored kind.
    friend bool operator==(const Value& a, const Value& b);

  private:
    using Box = detail::Handle<detail::BoxNode>;

    union Payload {
        Payload() : integer(0) {}
        ~Payload() {}
        bool boolean;
        int64_t integer;
        uint64_t unsignedInteger;
        float single;
        double real;
        veltoid::String string;
        veltoid::Data data;
        veltoid::Array array;
        veltoid::Dictionary dictionary;
        Box box;
    };

    template <typename Content>
    static Value scalar(Kind kind, Content Payload::*member, Content content,
                        NumberKind numberKind = NumberKind::Int8) {
        Value value;
        value.kind_ = kind;
        value.numberKind_ = numberKind;
        value.payload_.*member = content;
        return value;
    }
    template <typename Content>
    static Value boxed(Kind kind, Content content) {
        Value value;
        new (&value.payload_.box) Box(new detail::Boxed<Content>(std::move(content)));
        value.kind_ = kind;
        return value;
    }
    /// The content of a value of this kind, else null.
    template <typename Content>
    const Content* unboxed(Kind kind) const {
        return kind_ == kind ? &static_cast<const detail::Boxed<Content>*>(payload_.box.get())->content
                             : nullptr;
    }

    /// Every member is one word or a single counted pointer, so that the bytes can move without a count
    /// changing.
    void copyBits(const Value& other) noexcept {
        kind_ = other.kind_;
        numberKind_ = other.numberKind_;
        std::memcpy(static_cast<void*>(&payload_), static_cast<const void*>(&other.payload_),
                    sizeof payload_);
    }
    void take(Value& other) noexcept {
        copyBits(other);
        other.kind_ = Kind::Absent;
    }
    void reset() noexcept {
        if (const detail::Node* shared = node()) shared->release();
        kind_ = Kind::Absent;
    }
    /// What the value refers to, or null: whatever the kind, it is one pointer.
    const detail::Node* node() const noexcept {
        const detail::Node* node = nullptr;
        static_assert(sizeof payload_ == sizeof(void*));
        if (kind_ >= Kind::String)
            std::memcpy(static_cast<void*>(&node), static_cast<const void*>(&payload_), sizeof payload_);
        return node;
    }

    Kind kind_ = Kind::Absent;
    NumberKind numberKind_ = NumberKind::Int8;
    Payload payload_;
};

struct Dictionary::Entry {
    String key;
    Value value;
};

inline void Dictionary::set(const char* key, Value value) { set(std::string_view(key), std::move(value)); }

/// The absent value, for getters that return a reference.
const Value& absentValue();

}  // namespace veltoid
