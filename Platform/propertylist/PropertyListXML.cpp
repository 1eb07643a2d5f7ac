#include <algorithm>
#include <array>
#include <charconv>
#include <optional>
#include <string_view>
#include <utility>
#include <variant>

#include "Platform/propertylist/PropertyList.h"
#include "Platform/propertylist/PropertyListPlainXML.h"
#include "Platform/propertylist/PropertyListShape.h"
#include "Platform/propertylist/PropertyListTape.h"
#include "Platform/propertylist/PropertyListTexts.h"
#include "Platform/xml/XMLReader.h"

namespace platform {
namespace {

using namespace propertylist;

constexpr std::string_view kDocumentStart =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n";
constexpr std::string_view kDocumentEnd = "</plist>\n";

/// One line per key, leaf and end of a container.
class XMLWriter : public ValueSink {
  public:
    XMLWriter() { appendText(output_, kDocumentStart); }

    void null() override { shape_.fail(); }
    void uuid(std::span<const uint8_t, 16>) override { shape_.fail(); }
    void fileDescriptor(int) override { shape_.fail(); }

    void boolean(bool value) override {
        if (startValue(0)) appendText(output_, value ? "<true/>\n" : "<false/>\n");
    }
    void integer(int64_t value) override { addInteger(value); }
    void unsignedInteger(uint64_t value) override { addInteger(value); }

    void real(double value) override {
        if (!startValue(0)) return;
        appendText(output_, "<real>");
        appendReal(output_, value);
        appendText(output_, "</real>\n");
    }

    void date(double seconds) override {
        if (!startValue(0)) return;
        appendText(output_, "<date>");
        if (!appendDate(output_, seconds)) shape_.fail();
        appendText(output_, "</date>\n");
    }

    void data(Bytes bytes) override {
        if (!startValue(bytes.size())) return;
        appendText(output_, "<data>");
        appendBase64(output_, bytes);
        appendText(output_, "</data>\n");
    }

    void string(std::string_view utf8) override {
        if (startValue(utf8.size())) addEscaped("<string>", utf8, "</string>\n");
    }

    void key(std::string_view utf8) override {
        if (!shape_.key(utf8.size())) return;
        indent();
        addEscaped("<key>", utf8, "</key>\n");
    }

    void beginArray() override { begin(Container::Array, "<array>\n"); }
    void endArray() override { end(Container::Array, "</array>\n"); }
    void beginDictionary() override { begin(Container::Dictionary, "<dict>\n"); }
    void endDictionary() override { end(Container::Dictionary, "</dict>\n"); }

    SecretBytes finish() && {
        if (!shape_.isComplete()) return {};
        appendText(output_, kDocumentEnd);
        return std::move(output_);
    }

  private:
    void indent() { output_.insert(output_.end(), shape_.depth(), '\t'); }

    bool startValue(size_t payload) {
        if (!shape_.value(payload)) return false;
        indent();
        return true;
    }

    template <typename Integer>
    void addInteger(Integer value) {
        if (!startValue(0)) return;
        char digits[24];
        const auto end = std::to_chars(std::begin(digits), std::end(digits), value).ptr;
        appendText(output_, "<integer>");
        appendText(output_, {digits, end});
        appendText(output_, "</integer>\n");
    }

    void addEscaped(std::string_view start, std::string_view utf8, std::string_view finish) {
        appendText(output_, start);
        if (!appendEscaped(output_, utf8)) shape_.fail();
        appendText(output_, finish);
    }

    void begin(Container container, std::string_view tag) {
        if (!shape_.begin(container)) return;
        output_.insert(output_.end(), shape_.depth() - 1, '\t');
        appendText(output_, tag);
    }

    void end(Container container, std::string_view tag) {
        if (!shape_.end(container)) return;
        indent();
        appendText(output_, tag);
    }

    SecretBytes output_;
    Shape shape_;
};

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

/// Makes a tape of values out of the elements and texts of a document.
class ListReader : public XMLEvents {
  public:
    /// The reader of the events is asked to end when the document has shown itself to be no list.
    explicit ListReader(size_t documentBytes, XMLReader* events = nullptr)
        : events_(events), tape_(std::min(documentBytes, kMaxExpectedTape)) {
        text_.reserve(kTextCharacters);
    }

    void documentType(bool hasDeclarations) override {
        if (hasDeclarations) refuse();
    }
    void startElement(std::string_view name) override;
    void endElement(std::string_view name) override;
    void characters(std::string_view text) override;

    bool isGood() const { return !isRefused_ && shape_.isComplete(); }
    void deliver(ValueSink& sink) const { tape_.replay(sink); }

  private:
    /// Enough that short texts do not live inside the string object, where they are not wiped.
    static constexpr size_t kTextCharacters = 64;
    static constexpr size_t kMaxExpectedTape = kMaxPropertyListPayload;
    /// Of one element: data of the permitted payload, white space included.
    static constexpr size_t kMaxText = 2 * kMaxPropertyListPayload;

    void refuse() {
        isRefused_ = true;
        if (events_ != nullptr) events_->abort();
    }

    bool begin(Element element);
    bool end(Element element);
    bool endLeaf(Element element);

    /// Puts a value on the tape if it is one and may come here.
    template <typename Read, typename Put>
    bool put(const std::optional<Read>& value, Put put) {
        if (!value || !shape_.value(0)) return false;
        put(*value);
        return true;
    }

    XMLReader* events_;
    /// The leaf whose text is being collected.
    Element leaf_ = Element::None;
    SecretText text_;
    SecretBytes data_;
    Shape shape_;
    Tape tape_;
    bool isInside_ = false;
    bool isRefused_ = false;
};

void ListReader::startElement(std::string_view name) {
    if (!isRefused_ && !begin(elementNamed(name))) refuse();
}

void ListReader::endElement(std::string_view name) {
    if (!isRefused_ && !end(elementNamed(name))) refuse();
}

void ListReader::characters(std::string_view text) {
    if (isRefused_) return;
    const bool isCollected = leaf_ != Element::None && leaf_ != Element::True && leaf_ != Element::False;
    if (isCollected && text.size() <= kMaxText - text_.size()) {
        text_.append(text);
    } else if (isCollected || !std::ranges::all_of(text, isSpace)) {
        refuse();
    }
}

bool ListReader::begin(Element element) {
    if (leaf_ != Element::None || element == Element::None) return false;
    // The list is the outermost element and no other one.
    if (isInside_ == (element == Element::PropertyList)) return false;
    isInside_ = true;
    switch (element) {
        case Element::PropertyList:
            return true;
        case Element::Array:
            tape_.beginArray();
            return shape_.begin(Container::Array);
        case Element::Dictionary:
            tape_.beginDictionary();
            return shape_.begin(Container::Dictionary);
        default:
            leaf_ = element;
            text_.clear();
            return true;
    }
}

bool ListReader::end(Element element) {
    switch (element) {
        case Element::PropertyList:
            return true;
        case Element::Array:
            tape_.endArray();
            return shape_.end(Container::Array);
        case Element::Dictionary:
            tape_.endDictionary();
            return shape_.end(Container::Dictionary);
        default:
            leaf_ = Element::None;
            return endLeaf(element);
    }
}

bool ListReader::endLeaf(Element element) {
    switch (element) {
        case Element::Key:
            tape_.key(text_);
            return shape_.key(text_.size());
        case Element::String:
            tape_.string(text_);
            return shape_.value(text_.size());
        case Element::True:
        case Element::False:
            tape_.boolean(element == Element::True);
            return shape_.value(0);
        case Element::Integer:
            return put(readInteger(text_), [this](const auto& integer) {
                const auto* fits = std::get_if<int64_t>(&integer);
                fits != nullptr ? tape_.integer(*fits) : tape_.unsignedInteger(std::get<uint64_t>(integer));
            });
        case Element::Real:
            return put(readReal(text_), [this](double value) { tape_.real(value); });
        case Element::Date:
            return put(readDate(text_), [this](double seconds) { tape_.date(seconds); });
        default:
            if (!readBase64(text_, data_) || !shape_.value(data_.size())) return false;
            tape_.data(data_);
            return true;
    }
}

}  // namespace

SecretBytes writeXMLPropertyList(const ValueWriter& writer) {
    XMLWriter sink;
    writer(sink);
    return std::move(sink).finish();
}

bool readXMLPropertyList(Bytes bytes, ValueSink& sink) {
    {
        ListReader list(bytes.size());
        if (readPlainXML(textOf(bytes), list)) {
            if (list.isGood()) list.deliver(sink);
            return list.isGood();
        }
    }
    XMLReader document(bytes);
    ListReader list(bytes.size(), &document);
    if (!document.read(list) || !list.isGood()) return false;
    list.deliver(sink);
    return true;
}

}  // namespace platform
