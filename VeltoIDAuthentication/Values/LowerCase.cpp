#include "Values/LowerCase.h"

#include <atomic>
#include <clocale>
#include <cwctype>

#include "Platform/encoding/UTF8.h"

namespace veltoid {
namespace {

/// Of the program, like a table: Unicode's characters, in no language. None while it cannot be loaded.
locale_t unicode() {
    static std::atomic<locale_t> known{nullptr};
    if (known.load() == nullptr) {
        const locale_t made = newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr);
        locale_t none = nullptr;
        if (made != nullptr && !known.compare_exchange_strong(none, made)) freelocale(made);
    }
    return known.load();
}

char32_t lowerCased(char32_t point) {
    if (point < 0x80) return point >= 'A' && point <= 'Z' ? point + ('a' - 'A') : point;
    const locale_t locale = unicode();
    return locale != nullptr ? static_cast<char32_t>(towlower_l(static_cast<wint_t>(point), locale)) : point;
}

}  // namespace

String lowerCased(const String& original) {
    if (!original) return nullptr;
    platform::SecretText lower;
    for (std::string_view left = original.view(); !left.empty();) {
        if (const auto point = platform::takeCodePoint(left)) {
            platform::appendUTF8(lower, lowerCased(*point));
        } else {
            lower += left.front();
            left.remove_prefix(1);
        }
    }
    return String(std::string_view(lower));
}

}  // namespace veltoid
