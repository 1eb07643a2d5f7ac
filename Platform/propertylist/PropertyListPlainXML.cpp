#include "Platform/propertylist/PropertyListPlainXML.h"

#include <array>
#include <utility>

#include "Platform/propertylist/PropertyList.h"
#include "Platform/propertylist/PropertyListTexts.h"

namespace platform::propertylist {
namespace {

constexpr std::string_view kDeclaration = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>";
constexpr std::string_view kTypeStart = "<!DOCTYPE plist PUBLIC \"";
constexpr std::string_view kRootWithVersion = "<plist version=\"1.0\">";
constexpr std::string_view kRoot = "plist";

constexpr std::pair<std::string_view, std::string_view> kReferences[] = {
    {"&lt;", "<"}, {"&gt;", ">"}, {"&amp;", "&"}, {"&quot;", "\""}, {"&apos;", "'"}, {"&#13;", "\r"}};

bool isNameCharacter(char c) { return c >= 'a' && c <= 'z'; }

/// What may stand in the names of a document type everywhere.
bool isLocationCharacter(char c) {
    return isNameCharacter(c) || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
           std::string_view(" -/.:").find(c) != std::string_view::npos;
}

class PlainReader {
  public:
    PlainReader(std::string_view document, XMLEvents& events) : rest_(document), events_(events) {}

    bool read() {
        take(kDeclaration);
        takeSpace();
        if (rest_.starts_with(kTypeStart) && !takeType()) return false;
        takeSpace();
        do {
            if (!takeTag() || !takeText()) return false;
        } while (depth_ > 0);
        return rest_.empty();
    }

  private:
    bool take(std::string_view expected) {
        if (!rest_.starts_with(expected)) return false;
        rest_.remove_prefix(expected.size());
        return true;
    }

    template <typename Predicate>
    std::string_view takeWhile(Predicate holds) {
        size_t size = 0;
        while (size < rest_.size() && holds(rest_[size])) ++size;
        const std::string_view taken = rest_.substr(0, size);
        rest_.remove_prefix(size);
        return taken;
    }

    void takeSpace() { takeWhile(isSpace); }

    bool takeType() {
        take(kTypeStart);
        takeWhile(isLocationCharacter);
        if (!take("\" \"")) return false;
        takeWhile(isLocationCharacter);
        if (!take("\">")) return false;
        events_.documentType(false);
        return true;
    }

    bool takeTag() {
        if (depth_ == 0 && take(kRootWithVersion)) return start(kRoot);
        if (!take("<")) return false;
        const bool isEnd = take("/");
        const std::string_view name = takeWhile(isNameCharacter);
        if (name.empty()) return false;
        if (isEnd) return take(">") && end(name);
        if (take(">")) return start(name);
        return take("/>") && start(name) && end(name);
    }

    bool start(std::string_view name) {
        // Deeper ones are no list: the other reader may say so.
        if (depth_ == open_.size()) return false;
        open_[depth_++] = name;
        events_.startElement(name);
        return true;
    }

    bool end(std::string_view name) {
        if (depth_ == 0 || open_[depth_ - 1] != name) return false;
        --depth_;
        events_.endElement(name);
        return true;
    }

    /// Everything up to the next tag, or to the end of the document.
    bool takeText() {
        if (depth_ == 0) return takeSpace(), true;
        for (;;) {
            const size_t plain = plainTextLength(rest_);
            if (plain > 0) events_.characters(rest_.substr(0, plain));
            rest_.remove_prefix(plain);
            if (rest_.starts_with('<')) return true;
            if (!takeReference() && !takeBracket()) return false;
        }
    }

    bool takeReference() {
        if (!rest_.starts_with('&')) return false;
        for (const auto& [reference, character] : kReferences) {
            if (!take(reference)) continue;
            events_.characters(character);
            return true;
        }
        return false;
    }

    bool takeBracket() {
        if (rest_.starts_with("]]>") || !(rest_.starts_with(']') || rest_.starts_with('>'))) return false;
        events_.characters(rest_.substr(0, 1));
        rest_.remove_prefix(1);
        return true;
    }

    std::string_view rest_;
    XMLEvents& events_;
    /// The list, its containers and one leaf.
    std::array<std::string_view, kMaxPropertyListDepth + 2> open_;
    size_t depth_ = 0;
};

}  // namespace

bool readPlainXML(std::string_view document, XMLEvents& events) {
    return PlainReader(document, events).read();
}

}  // namespace platform::propertylist
