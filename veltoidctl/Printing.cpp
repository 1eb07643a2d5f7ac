#include "veltoidctl/Printing.h"

#include <iomanip>
#include <iostream>

#include "Protocol/MessageKeys.h"
#include "Values/Error.h"
#include "veltoidctl/AgentRequest.h"

namespace veltoidctl {

namespace message = veltoid::message;

namespace {

constexpr int kLabelWidth = 22;

/// The control characters that a terminal obeys: those of ASCII, and U+0080 to U+009F (two bytes in UTF-8).
std::string withoutControls(std::string text) {
    for (size_t i = 0; i < text.size(); ++i) {
        const auto byte = static_cast<unsigned char>(text[i]);
        const auto next = static_cast<unsigned char>(i + 1 < text.size() ? text[i + 1] : 0);
        if (byte < ' ' || byte == 0x7f) text[i] = '?';
        if (byte == 0xc2 && next >= 0x80 && next < 0xa0) text.replace(i, 2, "?");
    }
    return text;
}

/// The most telling text of an error, its own or that of the one underneath; else `otherwise`.
std::string reasonOf(const Json& error, const std::string& otherwise) {
    const Json information = error.value(message::kErrorUserInfo, Json::object());
    const bool hasCause = information.contains(veltoid::kErrorUnderlyingErrorKey);
    // Then the caller knows better.
    const bool isVague = error.value(message::kErrorCode, int64_t{0}) == veltoid::identity_error::kUnknown;
    if (isVague && !hasCause && !otherwise.empty()) return otherwise;
    for (const std::string_view key : {veltoid::kErrorFailureReasonKey, veltoid::kErrorDescriptionKey})
        if (information.contains(key)) return textOf(information[key]);
    if (hasCause) return reasonOf(information[veltoid::kErrorUnderlyingErrorKey], otherwise);
    return otherwise.empty() ? "the agent could not do it" : otherwise;
}

}  // namespace

std::string textOf(const Json& value) {
    if (value.is_string()) return withoutControls(value.get<std::string>());
    if (value.is_boolean()) return value.get<bool>() ? "yes" : "no";
    if (!value.is_array()) return value.dump(-1, ' ', false, Json::error_handler_t::replace);
    std::string joined;
    for (const Json& element : value) joined += (joined.empty() ? "" : ", ") + textOf(element);
    return joined.empty() ? "none" : joined;
}

void printLine(const std::string& label, const Json& value) {
    std::cout << std::left << std::setw(kLabelWidth) << label + ":" << textOf(value) << "\n";
}

void printEntries(const Json& dictionary,
                  std::initializer_list<std::pair<std::string_view, const char*>> entries) {
    for (const auto& [key, label] : entries)
        if (dictionary.contains(key)) printLine(label, dictionary[key]);
}

void printJson(const Json& value) {
    std::cout << value.dump(2, ' ', false, Json::error_handler_t::replace) << "\n";
}

void printRefusal(const Json& reply, const std::string& what, const std::string& otherwise) {
    std::cerr << "veltoidctl: " << what << ": ";
    if (!reply.contains(message::kError)) {
        std::cerr << (otherwise.empty() ? "the agent could not do it" : otherwise) << "\n";
        return;
    }
    const Json& error = reply[message::kError];
    std::cerr << reasonOf(error, otherwise) << " (" << error.value(message::kErrorDomain, "?") << " "
              << error.value(message::kErrorCode, 0) << ")\n";
}

int present(const Json& reply, const Arguments& arguments, const std::string& what,
            const std::function<void(const Json&)>& print, const std::string& otherwise) {
    if (arguments.json) {
        printJson(reply);
    } else if (succeeded(reply)) {
        print(reply);
    }
    if (succeeded(reply)) return kDone;
    if (!arguments.json) printRefusal(reply, what, otherwise);
    return kRefused;
}

}  // namespace veltoidctl
