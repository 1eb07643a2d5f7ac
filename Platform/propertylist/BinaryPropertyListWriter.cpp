#include <algorithm>
#include <bit>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "Platform/encoding/BigEndian.h"
#include "Platform/encoding/UTF8.h"
#include "Platform/propertylist/PropertyList.h"
#include "Platform/propertylist/PropertyListFormat.h"
#include "Platform/propertylist/PropertyListShape.h"

namespace platform {

namespace {

using namespace propertylist;

/// The smallest of 1, 2, 4 and 8 bytes that holds the value.
size_t widthOf(uint64_t value) {
    if (value <= UINT8_MAX) return 1;
    if (value <= UINT16_MAX) return 2;
    return value <= UINT32_MAX ? 4 : 8;
}

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

    SecretBytes finish() const {
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
        appendBigEndian(leaves_, bits, width);
        addValue(addLeaf(begin), 0);
    }

    uint32_t addText(std::string_view utf8) {
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

    void appendUTF16(std::string_view utf8) {
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

}  // namespace

SecretBytes writeBinaryPropertyList(const ValueWriter& writer) {
    Writer sink;
    writer(sink);
    return sink.finish();
}

}  // namespace platform
