#include "Platform/encoding/Base64Codec.h"

#include <algorithm>
#include <array>
#include <cstring>
#include <utility>

namespace platform {
namespace {

constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

// --- Encoding

/// The two symbols of every 12 bits.
constexpr auto kSymbolPairs = [] {
    std::array<std::array<char, 2>, 4096> pairs{};
    for (size_t bits = 0; bits < pairs.size(); ++bits)
        pairs[bits] = {kAlphabet[bits >> 6U], kAlphabet[bits & 63U]};
    return pairs;
}();

/// A group is 24 bits.
void writeGroup(uint64_t group, char* out) {
    std::memcpy(out, kSymbolPairs[group >> 12U].data(), 2);
    std::memcpy(out + 2, kSymbolPairs[group & 4095U].data(), 2);
}

uint32_t groupAt(const uint8_t* bytes) {
    return (uint32_t{bytes[0]} << 16U) | (uint32_t{bytes[1]} << 8U) | bytes[2];
}

/// Six bytes and the two behind them.
uint64_t twoGroupsAt(const uint8_t* bytes) {
    uint64_t bits = 0;
    for (size_t i = 0; i < sizeof bits; ++i) bits = (bits << 8U) | bytes[i];
    return bits;
}

/// Writes base64Size(bytes.size()) characters.
void encodeGroups(Bytes bytes, char* out) {
    size_t i = 0;
    for (; i + sizeof(uint64_t) <= bytes.size(); i += 6, out += 8) {
        const uint64_t bits = twoGroupsAt(&bytes[i]);
        writeGroup(bits >> 40U, out);
        writeGroup((bits >> 16U) & 0xFFFFFFU, out + 4);
    }
    for (; i + 3 <= bytes.size(); i += 3, out += 4) writeGroup(groupAt(&bytes[i]), out);
    const size_t left = bytes.size() - i;
    if (left == 0) return;
    writeGroup((uint32_t{bytes[i]} << 16U) | (left == 2 ? uint32_t{bytes[i + 1]} << 8U : 0U), out);
    out[3] = '=';
    if (left == 1) out[2] = '=';
}

/// For lines of whole groups, which can be written where they belong.
void writeWholeGroupLines(Bytes bytes, const Base64Lines& lines, char* out) {
    const size_t bytesPerLine = lines.length / 4 * 3;
    for (size_t start = 0; start < bytes.size(); start += bytesPerLine) {
        const Bytes line = bytes.subspan(start, std::min(bytesPerLine, bytes.size() - start));
        if (start != 0) out = std::copy(lines.lineBreak.begin(), lines.lineBreak.end(), out);
        encodeGroups(line, out);
        out += lines.length;
    }
}

// --- Decoding

constexpr uint8_t kNoSymbol = 0xFF;
constexpr uint32_t kNoGroup = 0xFF000000;
/// What a value means at each of the four places of a group.
using PlaceTable = std::array<uint32_t, 256>;

constexpr std::array<uint8_t, 256> kSymbolValues = [] {
    std::array<uint8_t, 256> values{};
    values.fill(kNoSymbol);
    for (uint8_t i = 0; i < 64; ++i) values[static_cast<uint8_t>(kAlphabet[i])] = i;
    return values;
}();

/// Whatever is no symbol sets bits that no group has, so that one test serves all four.
constexpr std::array<PlaceTable, 4> kPlaces = [] {
    std::array<PlaceTable, 4> places{};
    for (size_t place = 0; place < places.size(); ++place) {
        for (size_t byte = 0; byte < kSymbolValues.size(); ++byte) {
            const uint32_t value = kSymbolValues[byte];
            places[place][byte] = value == kNoSymbol ? kNoGroup : value << (18 - 6 * place);
        }
    }
    return places;
}();

/// Puts symbols together to groups of four and groups to bytes.
class GroupDecoder {
  public:
    explicit GroupDecoder(uint8_t* out) : start_(out), out_(out) {}

    /// Takes whole groups for as long as four symbols stand together; the number of characters taken.
    size_t takeGroups(Bytes text) {
        if (inGroup_ != 0) return 0;
        size_t i = 0;
        for (; i + 4 <= text.size(); i += 4) {
            const uint32_t group = kPlaces[0][text[i]] | kPlaces[1][text[i + 1]] | kPlaces[2][text[i + 2]] |
                                   kPlaces[3][text[i + 3]];
            if ((group & kNoGroup) != 0) break;
            emit(group, 3);
        }
        return i;
    }

    /// Takes one symbol; true when it completed a group, which the caller then emits.
    bool take(uint32_t value) {
        group_ = (group_ << 6U) | value;
        inGroup_ = (inGroup_ + 1) % 4;
        return inGroup_ == 0;
    }

    void emitGroup(size_t bytes) { emit(std::exchange(group_, 0), bytes); }

    /// Two or three symbols left over give one byte or two.
    void emitRest() {
        if (inGroup_ >= 2) emit(group_ << (inGroup_ == 3 ? 6U : 12U), inGroup_ - 1);
    }

    size_t size() const { return static_cast<size_t>(out_ - start_); }

  private:
    void emit(uint32_t group, size_t bytes) {
        *out_++ = static_cast<uint8_t>(group >> 16U);
        if (bytes > 1) *out_++ = static_cast<uint8_t>(group >> 8U);
        if (bytes > 2) *out_++ = static_cast<uint8_t>(group);
    }

    uint8_t* const start_;
    uint8_t* out_;
    uint32_t group_ = 0;
    size_t inGroup_ = 0;
};

bool isSpace(uint8_t byte) { return byte == ' ' || (byte >= '\t' && byte <= '\r'); }

}  // namespace

size_t base64Size(size_t bytes, const Base64Lines& lines) {
    const size_t body = base64Size(bytes);
    return lines.length == 0 || body == 0 ? body : body + (body - 1) / lines.length * lines.lineBreak.size();
}

void writeBase64(Bytes bytes, const Base64Lines& lines, char* out) {
    const size_t bodySize = base64Size(bytes.size());
    if (lines.length == 0 || lines.length >= bodySize) return encodeGroups(bytes, out);
    if (lines.length % 4 == 0) return writeWholeGroupLines(bytes, lines, out);

    // The body goes to the end of the room and its lines move forward from there.
    char* body = out + base64Size(bytes.size(), lines) - bodySize;
    encodeGroups(bytes, body);
    for (size_t left = bodySize;;) {
        const size_t size = std::min(left, lines.length);
        std::memmove(out, body, size);
        if ((left -= size) == 0) return;
        body += size;
        out = std::copy(lines.lineBreak.begin(), lines.lineBreak.end(), out + size);
    }
}

size_t readBase64(std::string_view text, uint8_t* out) {
    const Bytes symbols = bytesOf(text);
    GroupDecoder decoder(out);
    for (size_t i = 0;;) {
        while (i < symbols.size() && kSymbolValues[symbols[i]] == kNoSymbol) ++i;
        if (i == symbols.size()) break;
        if (const size_t taken = decoder.takeGroups(symbols.subspan(i))) {
            i += taken;
        } else if (decoder.take(kSymbolValues[symbols[i++]])) {
            decoder.emitGroup(3);
        }
    }
    decoder.emitRest();
    return decoder.size();
}

size_t readPaddedBase64(std::string_view text, uint8_t* out) {
    const Bytes symbols = bytesOf(text);
    GroupDecoder decoder(out);
    size_t padding = 0;
    for (size_t i = 0;;) {
        if (const size_t taken = decoder.takeGroups(symbols.subspan(i))) {
            i += taken;
            padding = 0;
        }
        if (i == symbols.size() || symbols[i] == '<') return decoder.size();
        const uint8_t byte = symbols[i++];
        if (isSpace(byte)) continue;
        padding = byte == '=' ? padding + 1 : 0;
        const uint8_t value = byte == '=' ? 0 : kSymbolValues[byte];
        if (value != kNoSymbol && decoder.take(value)) decoder.emitGroup(3 - std::min<size_t>(padding, 2));
    }
}

bool decodeStrictBase64(std::string_view text, SecretBytes& data) {
    size_t symbols = 0;
    size_t padding = 0;
    for (const uint8_t byte : bytesOf(text)) {
        if (isSpace(byte)) continue;
        padding += byte == '=' ? 1 : 0;
        if (byte == '=') continue;
        if (kSymbolValues[byte] == kNoSymbol || padding > 0) return false;
        ++symbols;
    }
    // The last group may lack one symbol or two, and says so.
    if (symbols % 4 == 1 || padding != (4 - symbols % 4) % 4) return false;
    data.resize((text.size() + 3) / 4 * 3);
    data.resize(readBase64(text, data.data()));
    return true;
}

}  // namespace platform
