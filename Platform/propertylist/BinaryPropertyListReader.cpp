#include <algorithm>
#include <bit>
#include <optional>
#include <string_view>

#include "Platform/encoding/BigEndian.h"
#include "Platform/encoding/UTF8.h"
#include "Platform/propertylist/PropertyList.h"
#include "Platform/propertylist/PropertyListFormat.h"
#include "Platform/propertylist/PropertyListShape.h"

namespace platform {

namespace {

using namespace propertylist;

/// Delivers the list under the top object while it is being checked. Cycles end at the depth limit, shared
/// objects at the budget.
class Reader {
  public:
    Reader(Bytes bytes, ValueSink& sink) : bytes_(bytes), sink_(sink) {
        scratch_.reserve(kScratchCharacters);
    }

    bool read() { return open() && visit(top_, 0); }

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

    static uint64_t numberAt(Bytes table, uint64_t index, size_t width) {
        return bigEndian(table.subspan(index * width, width));
    }

    bool open() {
        if (bytes_.size() < kHeader.size() + kTrailerBytes || !textOf(bytes_).starts_with(kHeader))
            return false;
        const Bytes trailer = bytes_.last(kTrailerBytes);
        const Bytes body = bytes_.first(bytes_.size() - kTrailerBytes);
        offsetWidth_ = trailer[6];
        referenceWidth_ = trailer[7];
        count_ = numberAt(trailer, 1, 8);
        top_ = numberAt(trailer, 2, 8);
        const uint64_t table = numberAt(trailer, 3, 8);
        const auto valid = [](size_t width) { return width >= 1 && width <= 8; };
        if (!valid(offsetWidth_) || !valid(referenceWidth_) || count_ > kMaxPropertyListObjects ||
            top_ >= count_ || table > body.size() || body.size() - table < count_ * offsetWidth_)
            return false;
        objects_ = body.first(table);
        offsets_ = body.subspan(table);
        return true;
    }

    std::optional<Cursor> find(uint64_t object) const {
        if (object >= count_) return std::nullopt;
        const uint64_t offset = numberAt(offsets_, object, offsetWidth_);
        if (offset < kHeader.size() || offset >= objects_.size()) return std::nullopt;
        return objects_.subspan(offset);
    }

    static std::optional<uint64_t> takeCount(Cursor& cursor, uint8_t marker) {
        const uint64_t small = marker & 0x0FU;
        if (small < kCountFollows) return small;
        const auto integer = take(cursor, 1);
        if (!integer || (integer->front() & 0xFCU) != kInteger) return std::nullopt;
        const auto bytes = take(cursor, size_t{1} << (integer->front() & 0x0FU));
        return bytes ? std::optional(bigEndian(*bytes)) : std::nullopt;
    }

    bool visit(uint64_t object, int depth) {
        auto cursor = find(object);
        if (!cursor) return false;
        const uint8_t marker = take(*cursor, 1)->front();
        switch (marker & 0xF0U) {
            case kArray:
            case kDictionary:
                return visitContainer(marker, *cursor, depth);
            case kASCII:
            case kUTF16: {
                const auto value = text(marker, *cursor);
                if (value) sink_.string(*value);
                return value.has_value();
            }
            case kData: {
                const auto count = takeCount(*cursor, marker);
                const auto value = count ? take(*cursor, *count) : std::nullopt;
                if (!value || !budget_.spend(value->size())) return false;
                sink_.data(*value);
                return true;
            }
            default:
                return budget_.spend(0) && visitFixed(marker, *cursor);
        }
    }

    bool visitFixed(uint8_t marker, Cursor cursor) {
        if ((marker & 0xF0U) == kInteger) {
            const auto bytes =
                (marker & 0x0FU) <= 4 ? take(cursor, size_t{1} << (marker & 0x0FU)) : std::nullopt;
            return bytes && visitInteger(*bytes);
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
                return sink_.null(), true;
            case kFalse:
                return sink_.boolean(false), true;
            case kTrue:
                return sink_.boolean(true), true;
            case kFloat:
                return sink_.singleReal(std::bit_cast<float>(static_cast<uint32_t>(bits))), true;
            case kDouble:
                return sink_.real(std::bit_cast<double>(bits)), true;
            case kDate:
                return sink_.date(std::bit_cast<double>(bits) + kReferenceDate), true;
            case kUUID:
                return sink_.uuid(bytes->first<kUUIDBytes>()), true;
            default:
                return false;
        }
    }

    bool visitInteger(Bytes bytes) {
        // Up to four bytes are unsigned, eight and sixteen are two's complement.
        const uint64_t low = bigEndian(bytes.last(std::min<size_t>(bytes.size(), 8)));
        const auto asSigned = static_cast<int64_t>(low);
        if (bytes.size() <= 8) return sink_.integer(asSigned), true;
        const uint64_t high = bigEndian(bytes.first(8));
        if (high == 0 && asSigned < 0) return sink_.unsignedInteger(low), true;
        if (high != (asSigned < 0 ? UINT64_MAX : 0)) return false;
        return sink_.integer(asSigned), true;
    }

    bool visitContainer(uint8_t marker, Cursor cursor, int depth) {
        const bool dictionary = (marker & 0xF0U) == kDictionary;
        const auto count = takeCount(cursor, marker);
        if (depth == kMaxPropertyListDepth || !count || *count > objects_.size() || !budget_.spend(0))
            return false;
        const auto keys = dictionary ? take(cursor, *count * referenceWidth_) : Bytes();
        const auto values = take(cursor, *count * referenceWidth_);
        if (!keys || !values) return false;
        dictionary ? sink_.beginDictionary() : sink_.beginArray();
        for (uint64_t i = 0; i < *count; ++i) {
            if (dictionary && !visitKey(numberAt(*keys, i, referenceWidth_))) return false;
            if (!visit(numberAt(*values, i, referenceWidth_), depth + 1)) return false;
        }
        dictionary ? sink_.endDictionary() : sink_.endArray();
        return true;
    }

    bool visitKey(uint64_t object) {
        auto cursor = find(object);
        if (!cursor) return false;
        const uint8_t marker = take(*cursor, 1)->front();
        const auto value = text(marker, *cursor);
        if (value) sink_.key(*value);
        return value.has_value();
    }

    /// The text of a string object; the view lives until the next call.
    std::optional<std::string_view> text(uint8_t marker, Cursor cursor) {
        const bool ascii = (marker & 0xF0U) == kASCII;
        if (!ascii && (marker & 0xF0U) != kUTF16) return std::nullopt;
        const auto count = takeCount(cursor, marker);
        if (!count || *count > cursor.size()) return std::nullopt;
        const auto bytes = take(cursor, ascii ? *count : 2 * *count);
        if (!bytes || bytes->size() > kMaxPropertyListPayload ||
            (ascii ? !isASCII(textOf(*bytes)) : !decodeUTF16(*bytes)))
            return std::nullopt;
        const std::string_view value = ascii ? textOf(*bytes) : std::string_view(scratch_);
        return budget_.spend(value.size()) ? std::optional(value) : std::nullopt;
    }

    bool decodeUTF16(Bytes units) {
        scratch_.clear();
        while (!units.empty()) {
            auto point = static_cast<char32_t>(bigEndian(*take(units, 2)));
            if (point >= 0xD800 && point <= 0xDFFF) {
                const auto low = point < 0xDC00 ? take(units, 2) : std::nullopt;
                if (!low || (low->front() & 0xFCU) != 0xDC) return false;
                point =
                    0x10000U + ((point & 0x3FFU) << 10U | (static_cast<char32_t>(bigEndian(*low)) & 0x3FFU));
            }
            appendUTF8(scratch_, point);
        }
        return true;
    }

    const Bytes bytes_;
    ValueSink& sink_;
    /// From the start of the list, so that offsets count in it.
    Bytes objects_;
    Bytes offsets_;
    size_t offsetWidth_ = 0;
    size_t referenceWidth_ = 0;
    uint64_t count_ = 0;
    uint64_t top_ = 0;
    SecretText scratch_;
    Budget budget_;
};

}  // namespace

bool readBinaryPropertyList(Bytes bytes, ValueSink& sink) { return Reader(bytes, sink).read(); }

bool readPropertyList(Bytes bytes, ValueSink& sink) {
    constexpr std::string_view kHeaderOfAnyVersion = "bplist";
    return textOf(bytes).starts_with(kHeaderOfAnyVersion) ? readBinaryPropertyList(bytes, sink)
                                                          : readXMLPropertyList(bytes, sink);
}

}  // namespace platform
