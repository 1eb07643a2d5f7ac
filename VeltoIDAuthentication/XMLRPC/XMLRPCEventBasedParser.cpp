#include "XMLRPC/XMLRPCEventBasedParser.h"

#include "XMLRPC/XMLRPCScalarTexts.h"

namespace veltoid {
namespace {

/// More than what a string keeps inside itself, where it would not be wiped.
constexpr size_t kTextCapacity = 64;

constexpr bool holdsText(XMLRPCElementType type) { return type > XMLRPCElementType::Member; }

/// FNV-1a.
uint32_t hashOf(std::string_view text) {
    uint32_t hash = 2'166'136'261U;
    for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * 16'777'619U;
    return hash;
}

XMLRPCElementType tagNamed(std::string_view name) {
    // By length first: one comparison decides.
    switch (name.size()) {
        case 2:
            return name == "i4" ? XMLRPCElementType::Integer : XMLRPCElementType::Other;
        case 3:
            return name == "int" ? XMLRPCElementType::Integer : XMLRPCElementType::Other;
        case 4:
            return name == "name" ? XMLRPCElementType::Name : XMLRPCElementType::Other;
        case 5:
            if (name == "value") return XMLRPCElementType::Value;
            if (name == "array") return XMLRPCElementType::Array;
            return name == "fault" ? XMLRPCElementType::Fault : XMLRPCElementType::Other;
        case 6:
            if (name == "member") return XMLRPCElementType::Member;
            if (name == "string") return XMLRPCElementType::String;
            if (name == "struct") return XMLRPCElementType::Dictionary;
            if (name == "double") return XMLRPCElementType::Double;
            return name == "base64" ? XMLRPCElementType::Data : XMLRPCElementType::Other;
        case 7:
            return name == "boolean" ? XMLRPCElementType::Boolean : XMLRPCElementType::Other;
        case 16:
            return name == "dateTime.iso8601" ? XMLRPCElementType::Date : XMLRPCElementType::Other;
        default:
            return XMLRPCElementType::Other;
    }
}

bool isNode(XMLRPCElementType tag) {
    return tag == XMLRPCElementType::Value || tag == XMLRPCElementType::Member ||
           tag == XMLRPCElementType::Name;
}

void addMember(Dictionary& dictionary, const String& key, Value value) {
    if (!key) return;
    if (value.isNull()) {
        dictionary.remove(key.view());
    } else {
        dictionary.set(key, std::move(value));
    }
}

}  // namespace

XMLRPCEventBasedParserDelegate::XMLRPCEventBasedParserDelegate() { text.reserve(kTextCapacity); }

Value XMLRPCEventBasedParser::parse() {
    if (!myParser.read(*this)) return {};
    return std::move(result_);
}

void XMLRPCEventBasedParser::startElement(std::string_view name) {
    const XMLRPCElementType tag = tagNamed(name);
    if (isOpen() ? isNode(tag) : tag == XMLRPCElementType::Value && !hasStarted_) {
        push(tag == XMLRPCElementType::Value ? XMLRPCElementType::String : tag);
    } else if (isOpen()) {
        if (tag <= XMLRPCElementType::Data) setType(tag);
    } else if (tag == XMLRPCElementType::Fault && !hasStarted_) {
        myIsFault = true;
    }
}

void XMLRPCEventBasedParser::push(XMLRPCElementType type) {
    if (depth_ == kMaxXMLRPCDepth) return abortParsing();
    if (depth_ == nodes_.size()) nodes_.emplace_back();
    Node& node = nodes_[depth_++];
    node.myElementType = type;
    node.text.clear();
    node.myElementKey = nullptr;
    node.myMemberValue = Value();
    hasStarted_ = true;
}

void XMLRPCEventBasedParser::setType(XMLRPCElementType type) {
    Node& node = nodes_[depth_ - 1];
    node.myElementType = type;
    if (holdsText(type)) return;
    node.text.clear();
    node.array = Array();
    node.dictionary = Dictionary();
}

void XMLRPCEventBasedParser::characters(std::string_view text) {
    if (isOpen() && holdsText(nodes_[depth_ - 1].myElementType)) nodes_[depth_ - 1].text.append(text);
}

void XMLRPCEventBasedParser::endElement(std::string_view name) {
    if (!isOpen() || !isNode(tagNamed(name))) return;
    Node& node = nodes_[--depth_];
    if (depth_ == 0) {
        result_ = elementValue(node);
    } else {
        addElementValueToParent(node, nodes_[depth_ - 1]);
    }
}

Value XMLRPCEventBasedParser::elementValue(Node& node) {
    const auto text = [&] { return xmlrpc::parseString(node.text); };
    switch (node.myElementType) {
        case XMLRPCElementType::Array:
            return std::move(node.array);
        case XMLRPCElementType::Dictionary:
            return std::move(node.dictionary);
        case XMLRPCElementType::Member:
            return node.myMemberValue.isAbsent() ? empty_ : std::move(node.myMemberValue);
        case XMLRPCElementType::Integer:
            return Value::int32(xmlrpc::parseInteger(text()));
        case XMLRPCElementType::Double:
            return Value::real(xmlrpc::parseDouble(text()));
        case XMLRPCElementType::Boolean:
            return Value::boolean(xmlrpc::parseBoolean(text()));
        case XMLRPCElementType::Date:
            return xmlrpc::parseDate(text());
        case XMLRPCElementType::Data:
            return xmlrpc::parseData(text());
        default:
            if (const auto trimmed = text(); !trimmed.empty()) return String(trimmed);
            return empty_;
    }
}

void XMLRPCEventBasedParser::addElementValueToParent(Node& node, Node& parent) {
    if (parent.myElementType == XMLRPCElementType::Array) {
        parent.array.append(elementValue(node));
    } else if (parent.myElementType == XMLRPCElementType::Dictionary) {
        addMember(parent.dictionary, node.myElementKey, elementValue(node));
    } else if (parent.myElementType == XMLRPCElementType::Member &&
               node.myElementType == XMLRPCElementType::Name) {
        parent.myElementKey = sharedName(xmlrpc::parseString(node.text));
    } else if (parent.myElementType == XMLRPCElementType::Member) {
        parent.myMemberValue = elementValue(node);
    }
}

String XMLRPCEventBasedParser::sharedName(std::string_view name) {
    String& slot = names_[hashOf(name) % names_.size()];
    if (!slot || slot.view() != name) slot = name;
    return slot;
}

}  // namespace veltoid
