#include "Values/LowerCase.h"

#include <cwchar>
#include <cwctype>
#include <string>

namespace veltoid {

String lowerCased(const String& original) {
    if (!original) return nullptr;
    const std::string_view text = original.view();
    std::string lower;
    std::mbstate_t readState{};
    std::mbstate_t writeState{};
    for (size_t position = 0; position < text.size();) {
        wchar_t wide = 0;
        const size_t length = std::mbrtowc(&wide, text.data() + position, text.size() - position, &readState);
        char narrow[16];
        if (length == 0 || length > text.size() - position) {
            const char c = text[position++];
            lower += c >= 'A' && c <= 'Z' ? static_cast<char>(c + 32) : c;
            readState = {};
            continue;
        }
        const size_t written =
            std::wcrtomb(narrow, static_cast<wchar_t>(std::towlower(static_cast<wint_t>(wide))), &writeState);
        if (written == static_cast<size_t>(-1)) {
            lower += text.substr(position, length);
            writeState = {};
        } else {
            lower.append(narrow, written);
        }
        position += length;
    }
    return String(lower);
}

}  // namespace veltoid
