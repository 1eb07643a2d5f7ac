#include "Platform/propertylist/PropertyList.h"

#include <algorithm>
#include <bit>
#include <optional>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "Platform/propertylist/PropertyListFormat.h"
#include "Platform/propertylist/PropertyListShape.h"

namespace platform {

namespace {

using namespace propertylist;

/// Collects the events as finished leaves and lists of indexes; a container is known only when it ends, so it
/// comes after its members and the top object is the last one.
class Writer : public ValueSink {
  public:
    void null() override { addFixed(kNull, 0, 0); }
    void boolean(bool value) override { addFixed(value ? kTrue : kFalse, 0, 0); }

    void integer(int64_t value) override {
        const auto bits = static_cast<uint64_t>(value);
        addInteger(bits, value < 0 ? 8 : widthOf(bits));
    }
    void unsignedInteger(uint64_t value) override {
        addInteger(value, value > static_cast<uint64_t>(INT64_MAX) ? 16 : widthOf(value));
    }

    void real(double value) override { addFixed(kDouble, std::bit_cast<uint64_t>(value), sizeof value); }
    void singleReal(float value) override { addFixed(kFloat, std::bit_cast<uint32_t>(value), sizeof value); }
    void date(double seconds) override {
        addFixed(kDate, std::bit_cast<uint64_t>(seconds - kReferenceDate), sizeof seconds);
    }

    void string(std::string_view utf8) override { addValue(addText(utf8), utf8.size()); }

    void data(Bytes bytes) override {
        const size_t begin = leaves_.size();
        appendMarker(leaves_, kData, bytes.size());
        leaves_.insert(leaves_.end(), bytes.begin(), bytes.end());
        addValue(addLeaf(begin), bytes.size());
    }

    void uuid(std::span<const uint8_t, 16> bytes) override {
        const size_t begin = leaves_.size();
        leaves_.push_back(kUUID);
        leaves_.insert(leaves_.end(), bytes.begin(), bytes.end());
        addValue(addLeaf(begin), bytes.size());
    }

    void fileDescriptor(int) override { shape_.fail(); }

    void beginArray() override { begin(Container::Array); }
    void endArray() override { end(Container::Array); }
    void beginDictionary() override { begin(Container::Dictionary); }
    void endDictionary() override { end(Container::Dictionary); }

    void key(std::string_view utf8) override {
        if (shape_.key(utf8.size())) frames_.back().keys.push_back(addText(utf8));
    }

    SecretBytes finish() const;

  private:
    /// `begin` and `count` are a range of leaves_ or, for containers, of references_.
    struct Object {
        Marker container;
        size_t begin;
        size_t count;
    };

    struct Frame {
        std::vector<uint32_t> keys;
        std::vector<uint32_t> values;
    };

    static constexpr Marker kLeaf = kNull;

    static void appendMarker(SecretBytes& output, Marker marker, uint64_t count) {
        output.push_back(static_cast<uint8_t>(marker | std::min(count, kCountFollows)));
        if (count < kCountFollows) return;
        const size_t width = widthOf(count);
        output.push_back(static_cast<uint8_t>(kInteger | std::countr_zero(width)));
        appendBigEndian(output, count, width);
    }

    uint32_t addObject(const Object& object) {
        objects_.push_back(object);
        return static_cast<uint32_t>(objects_.size() - 1);
    }

    /// The leaf is what was appended to leaves_ since `begin`.
    uint32_t addLeaf(size_t begin) { return addObject({kLeaf, begin, leaves_.size() - begin}); }

    void addFixed(Marker marker, uint64_t bits, size_t width) {
        const size_t begin = leaves_.size();
        leaves_.push_back(marker);
        appendBigEndian(leaves_, bits, width);
        addValue(addLeaf(begin), 0);
    }

    void addInteger(uint64_t bits, size_t width) {
        const size_t begin = leaves_.size();
        leaves_.push_back(static_cast<uint8_t>(kInteger | std::countr_zero(width)));
        if (width > 8) appendBigEndian(leaves_, 0, width - 8);
        appendBigEndian(leaves_, bits, std::min<size_t>(width, 8));
        addValue(addLeaf(begin), 0);
    }

    uint32_t addText(std::string_view utf8);
    void appendUTF16(std::string_view utf8);

    void addValue(uint32_t object, size_t payload) {
        if (shape_.value(payload)) place(object);
    }

    void place(uint32_t object) {
        if (frames_.empty()) {
            top_ = object;
        } else {
            frames_.back().values.push_back(object);
        }
    }

    void begin(Container container) {
        if (shape_.begin(container)) frames_.emplace_back();
    }

    void end(Container container) {
        if (!shape_.end(container)) return;
        const Frame frame = std::move(frames_.back());
        frames_.pop_back();
        const size_t begin = references_.size();
        references_.insert(references_.end(), frame.keys.begin(), frame.keys.end());
        references_.insert(references_.end(), frame.values.begin(), frame.values.end());
        const Marker marker = container == Container::Array ? kArray : kDictionary;
        place(addObject({marker, begin, frame.values.size()}));
    }

    SecretBytes leaves_;
    std::vector<uint32_t> references_;
    std::vector<Object> objects_;
    std::vector<Frame> frames_;
    /// Hash of an encoded text to the object that has it.
    std::unordered_map<size_t, uint32_t> texts_;
    uint32_t top_ = 0;
    Shape shape_;
};

void Writer::appendUTF16(std::string_view utf8) {
    SecretBytes units;
    units.reserve(2 * utf8.size());
    while (!utf8.empty()) {
        const auto point = takeCodePoint(utf8);
        if (!point) {
            shape_.fail();
            return;
        }
        if (*point < 0x10000) {
            appendBigEndian(units, *point, 2);
        } else {
            appendBigEndian(units, 0xD800U + ((*point - 0x10000U) >> 10U), 2);
            appendBigEndian(units, 0xDC00U + (*point & 0x3FFU), 2);
        }
    }
    appendMarker(leaves_, kUTF16, units.size() / 2);
    leaves_.insert(leaves_.end(), units.begin(), units.end());
}

uint32_t Writer::addText(std::string_view utf8) {
    const size_t begin = leaves_.size();
    if (isASCII(utf8)) {
        appendMarker(leaves_, kASCII, utf8.size());
        leaves_.insert(leaves_.end(), utf8.begin(), utf8.end());
    } else {
        appendUTF16(utf8);
    }
    const Bytes encoded = Bytes(leaves_).subspan(begin);
    const size_t hash = std::hash<std::string_view>()(textOf(encoded));
    if (const auto known = texts_.find(hash); known != texts_.end()) {
        const Object& object = objects_[known->second];
        // Two texts of one hash are rare: the second is simply not shared.
        if (textOf(Bytes(leaves_).subspan(object.begin, object.count)) == textOf(encoded)) {
            leaves_.resize(begin);
            return known->second;
        }
    }
    const uint32_t object = addLeaf(begin);
    texts_.emplace(hash, object);
    return object;
}

SecretBytes Writer::finish() const {
    if (!shape_.isComplete()) return {};
    SecretBytes output(kHeader.begin(), kHeader.end());
    std::vector<uint64_t> offsets;
    offsets.reserve(objects_.size());
    const size_t referenceWidth = widthOf(objects_.size());
    for (const Object& object : objects_) {
        offsets.push_back(output.size());
        if (object.container == kLeaf) {
            const Bytes leaf = Bytes(leaves_).subspan(object.begin, object.count);
            output.insert(output.end(), leaf.begin(), leaf.end());
            continue;
        }
        appendMarker(output, object.container, object.count);
        const size_t references = object.container == kDictionary ? 2 * object.count : object.count;
        for (size_t i = 0; i < references; ++i) {
            appendBigEndian(output, references_[object.begin + i], referenceWidth);
        }
    }
    const size_t table = output.size();
    const size_t offsetWidth = widthOf(table);
    for (const uint64_t offset : offsets) appendBigEndian(output, offset, offsetWidth);
    appendBigEndian(output, 0, 6);
    output.push_back(static_cast<uint8_t>(offsetWidth));
    output.push_back(static_cast<uint8_t>(referenceWidth));
    appendBigEndian(output, objects_.size(), 8);
    appendBigEndian(output, top_, 8);
    appendBigEndian(output, table, 8);
    return output;
}

/// Takes the events of the validating pass.
class Discard final : public ValueSink {
  public:
    void null() override {}
    void boolean(bool) override {}
    void integer(int64_t) override {}
    void unsignedInteger(uint64_t) override {}
    void real(double) override {}
    void string(std::string_view) override {}
    void data(Bytes) override {}
    void date(double) override {}
    void uuid(std::span<const uint8_t, 16>) override {}
    void fileDescriptor(int) override {}
    void beginArray() override {}
    void endArray() override {}
    void beginDictionary() override {}
    void key(std::string_view) override {}
    void endDictionary() override {}
};

/// Delivers the list under the top object. The same walk validates (into nothing) and delivers. Cycles end at
/// the depth limit, shared objects at the budget.
class Reader {
  public:
    explicit Reader(Bytes bytes) : bytes_(bytes) { scratch_.reserve(kScratchCharacters); }

    bool open();

    /// The sink's own type makes the walk of the validating pass free of calls.
    template <typename Sink>
    bool deliver(Sink& sink) {
        budget_ = Budget();
        isValid_ = visit(top_, 0, sink);
        return isValid_;
    }

  private:
    /// Enough that short texts do not live inside the string object, where they are not wiped.
    static constexpr size_t kScratchCharacters = 64;

    /// The part of the list where an object's bytes are still to be taken.
    using Cursor = Bytes;

    static std::optional<Bytes> take(Cursor& cursor, uint64_t count) {
        if (count > cursor.size()) return std::nullopt;
        const Bytes taken = cursor.first(count);
        cursor = cursor.subspan(count);
        return taken;
    }

    /// The trailer is behind every table, so that eight bytes can be read at each of its numbers.
    static uint64_t numberAt(Bytes table, uint64_t index, size_t width) {
        return bigEndianAt(table.data() + index * width, width);
    }

    static std::optional<uint64_t> takeCount(Cursor& cursor, uint8_t marker);
    std::optional<Cursor> find(uint64_t object) const;

    template <typename Sink>
    bool visit(uint64_t object, int depth, Sink& sink);
    template <typename Sink>
    bool visitFixed(uint8_t marker, Cursor cursor, Sink& sink);
    template <typename Sink>
    bool visitInteger(Bytes bytes, Sink& sink);
    template <typename Sink>
    bool visitContainer(uint8_t marker, Cursor cursor, int depth, Sink& sink);
    template <typename Sink>
    bool visitKey(uint64_t object, Sink& sink);
    std::optional<std::string_view> text(uint8_t marker, Cursor cursor);
    bool decodeUTF16(Bytes units);

    Bytes bytes_;
    Bytes objects_;  ///< From the start of the list, so that offsets count in it.
    Bytes offsets_;
    size_t offsetWidth_ = 0;
    size_t referenceWidth_ = 0;
    uint64_t count_ = 0;
    uint64_t top_ = 0;
    SecretText scratch_;
    Budget budget_;
    /// A walk has come to its end: the texts need no second look.
    bool isValid_ = false;
};

bool Reader::open() {
    if (bytes_.size() < kHeader.size() + kTrailerBytes || !textOf(bytes_).starts_with(kHeader)) return false;
    const Bytes trailer = bytes_.last(kTrailerBytes);
    const Bytes body = bytes_.first(bytes_.size() - kTrailerBytes);
    offsetWidth_ = trailer[6];
    referenceWidth_ = trailer[7];
    count_ = bigEndian(trailer.subspan(8, 8));
    top_ = bigEndian(trailer.subspan(16, 8));
    const uint64_t table = bigEndian(trailer.subspan(24, 8));
    const auto valid = [](size_t width) { return width >= 1 && width <= 8; };
    if (!valid(offsetWidth_) || !valid(referenceWidth_) || count_ > kMaxPropertyListObjects ||
        top_ >= count_ || table > body.size() || body.size() - table < count_ * offsetWidth_) {
        return false;
    }
    objects_ = body.first(table);
    offsets_ = body.subspan(table);
    return true;
}

std::optional<Reader::Cursor> Reader::find(uint64_t object) const {
    if (object >= count_) return std::nullopt;
    const uint64_t offset = numberAt(offsets_, object, offsetWidth_);
    if (offset < kHeader.size() || offset >= objects_.size()) return std::nullopt;
    return objects_.subspan(offset);
}

std::optional<uint64_t> Reader::takeCount(Cursor& cursor, uint8_t marker) {
    const uint64_t small = marker & 0x0FU;
    if (small < kCountFollows) return small;
    const auto integer = take(cursor, 1);
    if (!integer || (integer->front() & 0xFCU) != kInteger) return std::nullopt;
    const auto bytes = take(cursor, size_t{1} << (integer->front() & 0x0FU));
    return bytes ? std::optional(bigEndian(*bytes)) : std::nullopt;
}

template <typename Sink>
bool Reader::visit(uint64_t object, int depth, Sink& sink) {
    auto cursor = find(object);
    if (!cursor) return false;
    const uint8_t marker = take(*cursor, 1)->front();
    switch (marker & 0xF0U) {
        case kArray:
        case kDictionary:
            return visitContainer(marker, *cursor, depth, sink);
        case kASCII:
        case kUTF16: {
            const auto value = text(marker, *cursor);
            if (value) sink.string(*value);
            return value.has_value();
        }
        case kData: {
            const auto count = takeCount(*cursor, marker);
            const auto value = count ? take(*cursor, *count) : std::nullopt;
            if (!value || !budget_.spend(value->size())) return false;
            sink.data(*value);
            return true;
        }
        default:
            return budget_.spend(0) && visitFixed(marker, *cursor, sink);
    }
}

template <typename Sink>
bool Reader::visitFixed(uint8_t marker, Cursor cursor, Sink& sink) {
    if ((marker & 0xF0U) == kInteger) {
        const auto bytes = (marker & 0x0FU) <= 4 ? take(cursor, size_t{1} << (marker & 0x0FU)) : std::nullopt;
        return bytes && visitInteger(*bytes, sink);
    }
    const size_t width = marker == kFloat                       ? sizeof(float)
                         : marker == kDouble || marker == kDate ? sizeof(double)
                         : marker == kUUID                      ? kUUIDBytes
                                                                : 0;
    const auto bytes = take(cursor, width);
    if (!bytes) return false;
    const uint64_t bits = width <= sizeof(uint64_t) ? bigEndian(*bytes) : 0;
    switch (marker) {
        case kNull:
            return sink.null(), true;
        case kFalse:
            return sink.boolean(false), true;
        case kTrue:
            return sink.boolean(true), true;
        case kFloat:
            return sink.singleReal(std::bit_cast<float>(static_cast<uint32_t>(bits))), true;
        case kDouble:
            return sink.real(std::bit_cast<double>(bits)), true;
        case kDate:
            return sink.date(std::bit_cast<double>(bits) + kReferenceDate), true;
        case kUUID:
            return sink.uuid(bytes->first<kUUIDBytes>()), true;
        default:
            return false;
    }
}

template <typename Sink>
bool Reader::visitInteger(Bytes bytes, Sink& sink) {
    // Up to four bytes are unsigned, eight and sixteen are two's complement.
    const uint64_t low = bigEndian(bytes.last(std::min<size_t>(bytes.size(), 8)));
    const auto asSigned = static_cast<int64_t>(low);
    if (bytes.size() <= 8) return sink.integer(asSigned), true;
    const uint64_t high = bigEndian(bytes.first(8));
    if (high == 0 && asSigned < 0) return sink.unsignedInteger(low), true;
    if (high != (asSigned < 0 ? UINT64_MAX : 0)) return false;
    return sink.integer(asSigned), true;
}

template <typename Sink>
bool Reader::visitContainer(uint8_t marker, Cursor cursor, int depth, Sink& sink) {
    const bool dictionary = (marker & 0xF0U) == kDictionary;
    const auto count = takeCount(cursor, marker);
    if (depth == kMaxPropertyListDepth || !count || *count > objects_.size() || !budget_.spend(0))
        return false;
    const auto keys = dictionary ? take(cursor, *count * referenceWidth_) : Bytes();
    const auto values = take(cursor, *count * referenceWidth_);
    if (!keys || !values) return false;
    dictionary ? sink.beginDictionary() : sink.beginArray();
    for (uint64_t i = 0; i < *count; ++i) {
        if (dictionary && !visitKey(numberAt(*keys, i, referenceWidth_), sink)) return false;
        if (!visit(numberAt(*values, i, referenceWidth_), depth + 1, sink)) return false;
    }
    dictionary ? sink.endDictionary() : sink.endArray();
    return true;
}

template <typename Sink>
bool Reader::visitKey(uint64_t object, Sink& sink) {
    auto cursor = find(object);
    if (!cursor) return false;
    const uint8_t marker = take(*cursor, 1)->front();
    const auto value = text(marker, *cursor);
    if (value) sink.key(*value);
    return value.has_value();
}

/// The text of a string object; the view lives until the next call.
std::optional<std::string_view> Reader::text(uint8_t marker, Cursor cursor) {
    const bool ascii = (marker & 0xF0U) == kASCII;
    if (!ascii && (marker & 0xF0U) != kUTF16) return std::nullopt;
    const auto count = takeCount(cursor, marker);
    if (!count || *count > cursor.size()) return std::nullopt;
    const auto bytes = take(cursor, ascii ? *count : 2 * *count);
    if (!bytes || bytes->size() > kMaxPropertyListPayload ||
        (ascii ? !isValid_ && !isASCII(textOf(*bytes)) : !decodeUTF16(*bytes))) {
        return std::nullopt;
    }
    const std::string_view value = ascii ? textOf(*bytes) : std::string_view(scratch_);
    return budget_.spend(value.size()) ? std::optional(value) : std::nullopt;
}

bool Reader::decodeUTF16(Bytes units) {
    scratch_.clear();
    while (!units.empty()) {
        auto point = static_cast<char32_t>(bigEndian(*take(units, 2)));
        if (point >= 0xD800 && point <= 0xDFFF) {
            const auto low = point < 0xDC00 ? take(units, 2) : std::nullopt;
            if (!low || (low->front() & 0xFCU) != 0xDC) return false;
            point = 0x10000U + ((point & 0x3FFU) << 10U | (static_cast<char32_t>(bigEndian(*low)) & 0x3FFU));
        }
        appendUTF8(scratch_, point);
    }
    return true;
}

}  // namespace

SecretBytes writeBinaryPropertyList(const ValueWriter& writer) {
    Writer sink;
    writer(sink);
    return sink.finish();
}

bool readBinaryPropertyList(Bytes bytes, ValueSink& sink) {
    Reader reader(bytes);
    Discard nothing;
    return reader.open() && reader.deliver(nothing) && reader.deliver(sink);
}

bool readPropertyList(Bytes bytes, ValueSink& sink) {
    return textOf(bytes).starts_with(kAnyHeader) ? readBinaryPropertyList(bytes, sink)
                                                 : readXMLPropertyList(bytes, sink);
}

}  // namespace platform
