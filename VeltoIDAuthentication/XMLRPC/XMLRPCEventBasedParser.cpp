#include "XMLRPC/XMLRPCEventBasedParser.h"

#include "XMLRPC/XMLRPCScalarTexts.h"

namespace veltoid {
namespace {

/// More than what a string keeps inside itself, where it would not be wiped.
constexpr size_t kTextCapacity = 64;

constexpr bool holdsText(XMLRPCTag type) { return type > XMLRPCTag::Member; }

/// FNV-1a.
uint32_t hashOf(std::string_view text) {
    uint32_t hash = 2'166'136'261U;
    for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * 16'777'619U;
    return hash;
}

XMLRPCTag tagNamed(std::string_view name) {
    // By length first: one comparison decides.
    switch (name.size()) {
        case 2:
            return name == "i4" ? XMLRPCTag::Integer : XMLRPCTag::Other;
        case 3:
            return name == "int" ? XMLRPCTag::Integer : XMLRPCTag::Other;
        case 4:
            return name == "name" ? XMLRPCTag::Name : XMLRPCTag::Other;
        case 5:
            if (name == "value") return XMLRPCTag::Value;
            if (name == "array") return XMLRPCTag::Array;
            return name == "fault" ? XMLRPCTag::Fault : XMLRPCTag::Other;
        case 6:
            if (name == "member") return XMLRPCTag::Member;
            if (name == "string") return XMLRPCTag::String;
            if (name == "struct") return XMLRPCTag::Struct;
            if (name == "double") return XMLRPCTag::Double;
            return name == "base64" ? XMLRPCTag::Data : XMLRPCTag::Other;
        case 7:
            return name == "boolean" ? XMLRPCTag::Boolean : XMLRPCTag::Other;
        case 16:
            return name == "dateTime.iso8601" ? XMLRPCTag::Date : XMLRPCTag::Other;
        default:
            return XMLRPCTag::Other;
    }
}

bool isNode(XMLRPCTag tag) {
    return tag == XMLRPCTag::Value || tag == XMLRPCTag::Member || tag == XMLRPCTag::Name;
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

XMLRPCEventBasedParser::Node::Node() { text.reserve(kTextCapacity); }

Value XMLRPCEventBasedParser::parse() {
    if (!myParser.read(*this)) return {};
    return std::move(result_);
}

void XMLRPCEventBasedParser::startElement(std::string_view name) {
    const XMLRPCTag tag = tagNamed(name);
    if (isOpen() ? isNode(tag) : tag == XMLRPCTag::Value && !hasStarted_) {
        push(tag == XMLRPCTag::Value ? XMLRPCTag::String : tag);
    } else if (isOpen()) {
        if (tag <= XMLRPCTag::Data) setType(tag);
    } else if (tag == XMLRPCTag::Fault && !hasStarted_) {
        myIsFault = true;
    }
}

void XMLRPCEventBasedParser::push(XMLRPCTag type) {
    if (depth_ == kMaxXMLRPCDepth) return abortParsing();
    if (depth_ == nodes_.size()) nodes_.emplace_back();
    Node& node = nodes_[depth_++];
    node.type = type;
    node.text.clear();
    node.memberName = nullptr;
    node.memberValue = Value();
    hasStarted_ = true;
}

void XMLRPCEventBasedParser::setType(XMLRPCTag type) {
    Node& node = nodes_[depth_ - 1];
    node.type = type;
    if (holdsText(type)) return;
    node.text.clear();
    node.array = Array();
    node.dictionary = Dictionary();
}

void XMLRPCEventBasedParser::characters(std::string_view text) {
    if (isOpen() && holdsText(nodes_[depth_ - 1].type)) nodes_[depth_ - 1].text.append(text);
}

void XMLRPCEventBasedParser::endElement(std::string_view name) {
    if (!isOpen() || !isNode(tagNamed(name))) return;
    Node& node = nodes_[--depth_];
    if (depth_ == 0) {
        result_ = elementValue(node);
    } else {
        addToParent(node, nodes_[depth_ - 1]);
    }
}

Value XMLRPCEventBasedParser::elementValue(Node& node) {
    const auto text = [&] { return xmlrpc::parseString(node.text); };
    switch (node.type) {
        case XMLRPCTag::Array:
            return std::move(node.array);
        case XMLRPCTag::Struct:
            return std::move(node.dictionary);
        case XMLRPCTag::Member:
            return node.memberValue.isAbsent() ? empty_ : std::move(node.memberValue);
        case XMLRPCTag::Integer:
            return Value::int32(xmlrpc::parseInteger(text()));
        case XMLRPCTag::Double:
            return Value::real(xmlrpc::parseDouble(text()));
        case XMLRPCTag::Boolean:
            return Value::boolean(xmlrpc::parseBoolean(text()));
        case XMLRPCTag::Date:
            return xmlrpc::parseDate(text());
        case XMLRPCTag::Data:
            return xmlrpc::parseData(text());
        default:
            if (const auto trimmed = text(); !trimmed.empty()) return String(trimmed);
            return empty_;
    }
}

void XMLRPCEventBasedParser::addToParent(Node& node, Node& parent) {
    if (parent.type == XMLRPCTag::Array) {
        parent.array.append(elementValue(node));
    } else if (parent.type == XMLRPCTag::Struct) {
        addMember(parent.dictionary, node.memberName, elementValue(node));
    } else if (parent.type == XMLRPCTag::Member && node.type == XMLRPCTag::Name) {
        parent.memberName = sharedName(xmlrpc::parseString(node.text));
    } else if (parent.type == XMLRPCTag::Member) {
        parent.memberValue = elementValue(node);
    }
}

String XMLRPCEventBasedParser::sharedName(std::string_view name) {
    String& slot = names_[hashOf(name) % names_.size()];
    if (!slot || slot.view() != name) slot = name;
    return slot;
}

}  // namespace veltoid
