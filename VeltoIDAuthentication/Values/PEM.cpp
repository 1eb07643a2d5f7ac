#include "Values/PEM.h"

#include <algorithm>

#include "Values/Base64.h"

namespace veltoid {
namespace {

constexpr std::string_view kBegin = "----BEGIN";
constexpr std::string_view kEnd = "-----END";

bool sameIgnoringCase(char a, char b) { return (a >= 'a' && a <= 'z' ? a - 32 : a) == b; }

}  // namespace

Data pemBodyToData(const String& text) {
    const std::string_view pem = text.view();
    auto start = pem.begin();
    const auto begin = std::search(pem.begin(), pem.end(), kBegin.begin(), kBegin.end(), sameIgnoringCase);
    if (begin != pem.end()) {
        start = std::find(begin + kBegin.size(), pem.end(), '-');
        start = std::find_if(start, pem.end(), [](char c) { return c != '-'; });
    }
    const auto end = std::find_end(pem.begin(), pem.end(), kEnd.begin(), kEnd.end(), sameIgnoringCase);
    if (end <= start) return {};
    return base64Decode(String(std::string_view(start, end)));
}

}  // namespace veltoid
