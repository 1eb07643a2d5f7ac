#include "Platform/xml/XMLReader.h"

#include <expat.h>
#include <malloc.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>

namespace platform {
namespace {

/// Documents are handed over in pieces that stay in the processor's cache while the parser works on its copy
/// of them.
constexpr size_t kPieceBytes = 64U << 10U;

constexpr const char* kEntitiesRefused = "entity declarations and undeclared entities are refused";
constexpr const char* kEventsFailed = "the receiver of the events failed";

/// The parser's own memory holds copies of the document, which may carry secrets.
void freeWiped(void* memory) {
    wipe(memory, malloc_usable_size(memory));
    std::free(memory);
}

void* reallocateWiped(void* memory, size_t size) {
    if (memory == nullptr) return std::malloc(size);
    void* fresh = std::malloc(size);
    if (fresh == nullptr) return nullptr;
    std::memcpy(fresh, memory, std::min(size, malloc_usable_size(memory)));
    freeWiped(memory);
    return fresh;
}

constexpr XML_Memory_Handling_Suite kWipedMemory = {std::malloc, reallocateWiped, freeWiped};

using ParserHandle = std::unique_ptr<XML_ParserStruct, decltype(&XML_ParserFree)>;

/// One read in progress: what the parser's callbacks see.
struct Reading {
    XML_Parser parser = nullptr;
    XMLEvents* events = nullptr;
    bool stopped = false;
    /// Why the reading was stopped from outside the parser; null when the parser itself has the reason.
    const char* reason = nullptr;

    void stop(const char* why) {
        if (stopped) return;
        stopped = true;
        reason = why;
        XML_StopParser(parser, XML_FALSE);
    }
};

/// Calls `deliver(events)` unless the reading was stopped. The library's frames lie between here and the
/// caller of the reading, so nothing may be thrown through them.
template <typename Deliver>
void guarded(void* context, Deliver deliver) noexcept {
    auto& reading = *static_cast<Reading*>(context);
    // The parser still reports the end of an element whose start stopped it.
    if (reading.stopped) return;
    try {
        deliver(*reading.events);
    } catch (...) {
        reading.stop(kEventsFailed);
    }
}

void onStart(void* context, const XML_Char* name, const XML_Char** /*attributes*/) {
    guarded(context, [name](XMLEvents& events) { events.startElement(name); });
}

void onEnd(void* context, const XML_Char* name) {
    guarded(context, [name](XMLEvents& events) { events.endElement(name); });
}

void onCharacters(void* context, const XML_Char* text, int length) {
    guarded(context, [=](XMLEvents& events) { events.characters({text, static_cast<size_t>(length)}); });
}

void onDocumentType(void* context, const XML_Char*, const XML_Char*, const XML_Char*, int hasDeclarations) {
    guarded(context, [=](XMLEvents& events) { events.documentType(hasDeclarations != 0); });
}

void onEntityDeclaration(void* context, const XML_Char*, int, const XML_Char*, int, const XML_Char*,
                         const XML_Char*, const XML_Char*, const XML_Char*) {
    static_cast<Reading*>(context)->stop(kEntitiesRefused);
}

/// A reference to what only a document type outside the document may declare: the text would silently lose
/// it.
void onSkippedEntity(void* context, const XML_Char*, int) {
    static_cast<Reading*>(context)->stop(kEntitiesRefused);
}

void installHandlers(XML_Parser parser, Reading& reading) {
    XML_SetUserData(parser, &reading);
    XML_SetElementHandler(parser, onStart, onEnd);
    XML_SetCharacterDataHandler(parser, onCharacters);
    XML_SetStartDoctypeDeclHandler(parser, onDocumentType);
    XML_SetEntityDeclHandler(parser, onEntityDeclaration);
    XML_SetSkippedEntityHandler(parser, onSkippedEntity);
    // References to parameter entities are looked at, so that they end the reading; without a handler for
    // external entities nothing is loaded.
    XML_SetParamEntityParsing(parser, XML_PARAM_ENTITY_PARSING_ALWAYS);
}

bool feed(XML_Parser parser, Bytes document) {
    size_t position = 0;
    do {
        const size_t size = std::min(kPieceBytes, document.size() - position);
        const bool isLast = position + size == document.size();
        const auto* piece = reinterpret_cast<const char*>(document.data() + position);
        if (XML_Parse(parser, piece, static_cast<int>(size), isLast ? XML_TRUE : XML_FALSE) != XML_STATUS_OK)
            return false;
        position += size;
    } while (position < document.size());
    return true;
}

}  // namespace

bool XMLReader::read(XMLEvents& events) {
    error_.reset();
    const ParserHandle parser(XML_ParserCreate_MM(nullptr, &kWipedMemory, nullptr), XML_ParserFree);
    if (!parser) {
        error_ = XMLError{"no memory for an XML parser", 0, 0};
        return false;
    }
    Reading reading{parser.get(), &events};
    installHandlers(parser.get(), reading);
    parser_ = &reading;
    const bool done = feed(parser.get(), document_);
    parser_ = nullptr;
    if (done) return true;

    const char* reason =
        reading.reason != nullptr ? reading.reason : XML_ErrorString(XML_GetErrorCode(parser.get()));
    const auto byteOffset = XML_GetCurrentByteIndex(parser.get());
    error_ = XMLError{reason != nullptr ? reason : "unknown error",
                      static_cast<size_t>(XML_GetCurrentLineNumber(parser.get())),
                      byteOffset < 0 ? 0 : static_cast<size_t>(byteOffset)};
    return false;
}

void XMLReader::abort() {
    if (parser_ != nullptr) static_cast<Reading*>(parser_)->stop(nullptr);
}

}  // namespace platform
