#include <algorithm>
#include <charconv>
#include <optional>
#include <string_view>
#include <utility>

#include "Platform/encoding/Base64Codec.h"
#include "Platform/encoding/CalendarText.h"
#include "Platform/propertylist/PropertyList.h"
#include "Platform/propertylist/PropertyListShape.h"
#include "Platform/xml/XMLReader.h"

namespace platform {
namespace {

using namespace propertylist;

// --- Scalars. White space around a number or date is passed over.

bool isSpace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && isSpace(text.front())) text.remove_prefix(1);
    while (!text.empty() && isSpace(text.back())) text.remove_suffix(1);
    return text;
}

/// The whole text as a number.
template <typename Number, typename... Format>
std::optional<Number> wholeNumber(std::string_view text, Format... format) {
    Number number{};
    const char* end = text.data() + text.size();
    const auto [stop, error] = std::from_chars(text.data(), end, number, format...);
    return error == std::errc() && stop == end ? std::optional(number) : std::nullopt;
}

bool readInteger(std::string_view text, ValueSink& sink) {
    text = trimmed(text);
    const bool isNegative = text.starts_with('-');
    if (isNegative || text.starts_with('+')) text.remove_prefix(1);
    const bool isHexadecimal = text.starts_with("0x") || text.starts_with("0X");
    if (isHexadecimal) text.remove_prefix(2);
    const auto magnitude = wholeNumber<uint64_t>(text, isHexadecimal ? 16 : 10);
    if (!magnitude || (isNegative && *magnitude > uint64_t{1} << 63U)) return false;
    if (!isNegative && *magnitude > static_cast<uint64_t>(INT64_MAX)) {
        sink.unsignedInteger(*magnitude);
    } else {
        sink.integer(static_cast<int64_t>(isNegative ? -*magnitude : *magnitude));
    }
    return true;
}

bool readReal(std::string_view text, ValueSink& sink) {
    text = trimmed(text);
    if (text.starts_with('+') && !text.starts_with("+-")) text.remove_prefix(1);
    // The library would take "nan(...)".
    const auto number =
        text.ends_with(')') ? std::nullopt : wholeNumber<double>(text, std::chars_format::general);
    if (number) sink.real(*number);
    return number.has_value();
}

/// Of the form "2014-03-05T17:04:00Z".
bool readDate(std::string_view text, ValueSink& sink) {
    text = trimmed(text);
    constexpr std::string_view kPattern = "dddd-dd-ddTdd:dd:ddZ";
    const auto fits = [](char c, char pattern) {
        return pattern == 'd' ? c >= '0' && c <= '9' : c == pattern;
    };
    if (!std::ranges::equal(text, kPattern, fits)) return false;
    const auto field = [text](size_t at, size_t size) { return *wholeNumber<int>(text.substr(at, size)); };
    // Leap seconds have no place in this form.
    const auto seconds =
        field(17, 2) < 60
            ? secondsOf({field(0, 4), field(5, 2), field(8, 2), field(11, 2), field(14, 2), field(17, 2)})
            : std::nullopt;
    if (seconds) sink.date(*seconds);
    return seconds.has_value();
}

// --- The document

enum class Element : uint8_t {
    None,
    PropertyList,
    Dictionary,
    Array,
    Key,
    String,
    Integer,
    Real,
    True,
    False,
    Date,
    Data,
};

Element elementNamed(std::string_view name) {
    static constexpr std::pair<std::string_view, Element> kNames[] = {
        {"key", Element::Key},     {"string", Element::String},      {"dict", Element::Dictionary},
        {"array", Element::Array}, {"integer", Element::Integer},    {"true", Element::True},
        {"false", Element::False}, {"real", Element::Real},          {"date", Element::Date},
        {"data", Element::Data},   {"plist", Element::PropertyList},
    };
    const auto* found = std::ranges::find(kNames, name, &std::pair<std::string_view, Element>::first);
    return found != std::end(kNames) ? found->second : Element::None;
}

/// Makes values out of the elements and texts of a document. The reading ends when the document has shown
/// itself to be no list.
class ListReader : public XMLEvents {
  public:
    ListReader(Bytes document, ValueSink& sink) : document_(document), sink_(sink) {
        text_.reserve(kTextCharacters);
    }

    bool read() { return document_.read(*this) && shape_.isComplete(); }

    void documentType(bool hasDeclarations) override { require(!hasDeclarations); }
    void startElement(std::string_view name) override { require(begin(elementNamed(name))); }
    void endElement(std::string_view name) override { require(end(elementNamed(name))); }

    void characters(std::string_view text) override {
        const bool isCollected = leaf_ != Element::None && leaf_ != Element::True && leaf_ != Element::False;
        require(isCollected ? text.size() <= kMaxText - text_.size() : std::ranges::all_of(text, isSpace));
        if (isCollected) text_.append(text);
    }

  private:
    /// Enough that short texts do not live inside the string object, where they are not wiped.
    static constexpr size_t kTextCharacters = 64;
    /// Of one element: data of the permitted payload, white space included.
    static constexpr size_t kMaxText = 2 * kMaxPropertyListPayload;

    void require(bool condition) {
        if (!condition) document_.abort();
    }

    bool begin(Element element) {
        if (leaf_ != Element::None || element == Element::None) return false;
        // The list is the outermost element and no other one.
        if (isInside_ == (element == Element::PropertyList)) return false;
        isInside_ = true;
        if (element == Element::PropertyList) return true;
        if (element == Element::Array) return shape_.begin(Container::Array) && (sink_.beginArray(), true);
        if (element == Element::Dictionary)
            return shape_.begin(Container::Dictionary) && (sink_.beginDictionary(), true);
        leaf_ = element;
        text_.clear();
        return true;
    }

    bool end(Element element) {
        if (element == Element::PropertyList) return true;
        if (element == Element::Array) return shape_.end(Container::Array) && (sink_.endArray(), true);
        if (element == Element::Dictionary)
            return shape_.end(Container::Dictionary) && (sink_.endDictionary(), true);
        leaf_ = Element::None;
        return endLeaf(element);
    }

    bool endLeaf(Element element) {
        switch (element) {
            case Element::Key:
                return shape_.key(text_.size()) && (sink_.key(text_), true);
            case Element::String:
                return shape_.value(text_.size()) && (sink_.string(text_), true);
            case Element::True:
            case Element::False:
                return shape_.value(0) && (sink_.boolean(element == Element::True), true);
            case Element::Integer:
                return shape_.value(0) && readInteger(text_, sink_);
            case Element::Real:
                return shape_.value(0) && readReal(text_, sink_);
            case Element::Date:
                return shape_.value(0) && readDate(text_, sink_);
            default:
                return decodeStrictBase64(text_, data_) && shape_.value(data_.size()) &&
                       (sink_.data(data_), true);
        }
    }

    XMLReader document_;
    ValueSink& sink_;
    /// The leaf whose text is being collected.
    Element leaf_ = Element::None;
    SecretText text_;
    SecretBytes data_;
    Shape shape_;
    bool isInside_ = false;
};

}  // namespace

bool readXMLPropertyList(Bytes bytes, ValueSink& sink) { return ListReader(bytes, sink).read(); }

}  // namespace platform
