#include "Platform/bus/BusMessage.h"

#include <systemd/sd-bus.h>

#include <optional>
#include <string>
#include <vector>

#include "Platform/bus/PeerConnection.h"
#include "Platform/encoding/UTF8.h"

namespace platform::bus {
namespace {

/// The bus refuses messages whose containers nest deeper than this, variants and dictionary entries included,
/// and drops the connection that sent one.
constexpr int kMaxWireDepth = 62;

// --- Reading

class Reader {
  public:
    Reader(sd_bus_message* message, ValueSink& sink) : message_(message), sink_(sink) {}

    /// The value at the current position, whatever its type; false at the end of the container or on damage.
    bool readValue(int depth) {
        char type = 0;
        const char* contents = nullptr;
        if (sd_bus_message_peek_type(message_, &type, &contents) <= 0) return false;
        switch (type) {
            case SD_BUS_TYPE_VARIANT:
                return inside(type, contents, [&] { return readValue(depth); });
            case SD_BUS_TYPE_ARRAY:
                return readArrayLike(contents, depth);
            case SD_BUS_TYPE_STRUCT:
                return readStruct(contents);
            default:
                return readBasic(type);
        }
    }

  private:
    /// Reads in the container at the current position. The type of what it contains is a copy: the message
    /// may reuse its own text while the container is entered.
    template <typename Read>
    bool inside(char type, const std::string& contents, Read readContents) {
        return sd_bus_message_enter_container(message_, type, contents.c_str()) > 0 && readContents() &&
               sd_bus_message_exit_container(message_) >= 0;
    }

    bool readArrayLike(const char* contents, int depth) {
        const std::string element(contents);
        if (element == "y") return readBytes([this](Bytes bytes) { sink_.data(bytes); });
        if (depth >= kMaxMessageDepth) return replaceByNull("a" + element);
        if (element.front() != SD_BUS_TYPE_DICT_ENTRY_BEGIN) return readArray(element, depth + 1);
        const char keyType = element[1];
        if (keyType != SD_BUS_TYPE_STRING && keyType != SD_BUS_TYPE_OBJECT_PATH)
            return replaceByNull("a" + element);
        return readDictionary(element.substr(1, element.size() - 2), keyType, depth + 1);
    }

    template <typename Take>
    bool readBytes(Take take) {
        const void* bytes = nullptr;
        size_t size = 0;
        if (sd_bus_message_read_array(message_, 'y', &bytes, &size) < 0) return false;
        take(Bytes(static_cast<const uint8_t*>(bytes), size));
        return true;
    }

    bool readUUID() {
        return readBytes(
            [this](Bytes bytes) { bytes.size() == 16 ? sink_.uuid(bytes.first<16>()) : sink_.null(); });
    }

    bool readArray(const std::string& element, int depth) {
        return inside(SD_BUS_TYPE_ARRAY, element, [&] {
            sink_.beginArray();
            while (sd_bus_message_at_end(message_, false) == 0)
                if (!readValue(depth)) return false;
            sink_.endArray();
            return true;
        });
    }

    bool readDictionary(const std::string& entry, char keyType, int depth) {
        const auto readEntry = [&] {
            return read<const char*>(keyType, &ValueSink::key) && readValue(depth);
        };
        return inside(SD_BUS_TYPE_ARRAY, "{" + entry + "}", [&] {
            sink_.beginDictionary();
            while (sd_bus_message_at_end(message_, false) == 0)
                if (!inside(SD_BUS_TYPE_DICT_ENTRY, entry, readEntry)) return false;
            sink_.endDictionary();
            return true;
        });
    }

    /// (d) is a date, (ay) of 16 bytes a UUID; nothing else has a meaning.
    bool readStruct(const std::string& members) {
        if (members != "d" && members != "ay") return replaceByNull("(" + members + ")");
        return inside(SD_BUS_TYPE_STRUCT, members, [&] {
            return members == "d" ? read<double>(SD_BUS_TYPE_DOUBLE, &ValueSink::date) : readUUID();
        });
    }

    bool replaceByNull(const std::string& signature) {
        if (sd_bus_message_skip(message_, signature.c_str()) < 0) return false;
        sink_.null();
        return true;
    }

    template <typename Wire, typename Value>
    bool read(char type, void (ValueSink::*take)(Value)) {
        Wire value{};
        if (sd_bus_message_read_basic(message_, type, static_cast<void*>(&value)) <= 0) return false;
        (sink_.*take)(static_cast<Value>(value));
        return true;
    }

    bool readSignature() {
        const char* text = nullptr;
        if (sd_bus_message_read_basic(message_, SD_BUS_TYPE_SIGNATURE, static_cast<void*>(&text)) <= 0)
            return false;
        *text == '\0' ? sink_.null() : sink_.string(text);
        return true;
    }

    bool readBasic(char type) {
        switch (type) {
            case SD_BUS_TYPE_BYTE:
                return read<uint8_t>(type, &ValueSink::integer);
            case SD_BUS_TYPE_INT16:
                return read<int16_t>(type, &ValueSink::integer);
            case SD_BUS_TYPE_UINT16:
                return read<uint16_t>(type, &ValueSink::integer);
            case SD_BUS_TYPE_INT32:
                return read<int32_t>(type, &ValueSink::integer);
            case SD_BUS_TYPE_UINT32:
                return read<uint32_t>(type, &ValueSink::integer);
            case SD_BUS_TYPE_INT64:
                return read<int64_t>(type, &ValueSink::integer);
            case SD_BUS_TYPE_UINT64:
                return read<uint64_t>(type, &ValueSink::unsignedInteger);
            case SD_BUS_TYPE_BOOLEAN:
                return read<int>(type, &ValueSink::boolean);
            case SD_BUS_TYPE_DOUBLE:
                return read<double>(type, &ValueSink::real);
            case SD_BUS_TYPE_UNIX_FD:
                return read<int>(type, &ValueSink::fileDescriptor);
            case SD_BUS_TYPE_SIGNATURE:
                return readSignature();
            default:
                return read<const char*>(type, &ValueSink::string);
        }
    }

    sd_bus_message* message_;
    ValueSink& sink_;
};

// --- Writing

/// Appends values as variants; the outermost dictionary is the body itself. After the first failure nothing
/// more is written and `result` tells it.
class MessageSink : public ValueSink {
  public:
    explicit MessageSink(sd_bus_message* message) : message_(message) {}

    int result() const { return result_; }

    void null() override { basic("g", SD_BUS_TYPE_SIGNATURE, ""); }
    void boolean(bool value) override {
        const int number = value ? 1 : 0;
        basic("b", SD_BUS_TYPE_BOOLEAN, &number);
    }
    void integer(int64_t value) override { basic("x", SD_BUS_TYPE_INT64, &value); }
    void unsignedInteger(uint64_t value) override { basic("t", SD_BUS_TYPE_UINT64, &value); }
    void real(double value) override { basic("d", SD_BUS_TYPE_DOUBLE, &value); }
    void fileDescriptor(int descriptor) override { basic("h", SD_BUS_TYPE_UNIX_FD, &descriptor); }

    void string(std::string_view utf8) override {
        // The bus carries neither NUL bytes nor text that is not UTF-8: such a string travels as data.
        if (utf8.find('\0') != std::string_view::npos || !isUTF8(utf8)) {
            data(bytesOf(utf8));
        } else {
            // Any text may be a secret: none stays behind in this copy.
            SecretText text;
            text.reserve(utf8.size() + 32);
            text += utf8;
            basic("s", SD_BUS_TYPE_STRING, text.c_str());
        }
    }

    void data(Bytes bytes) override {
        variant("ay", [&] { appendBytes(bytes); });
    }
    void date(double seconds) override {
        variant("(d)", [&] { check(sd_bus_message_append(message_, "(d)", seconds)); });
    }
    void uuid(std::span<const uint8_t, 16> bytes) override {
        variant("(ay)", [&] {
            check(sd_bus_message_open_container(message_, SD_BUS_TYPE_STRUCT, "ay"));
            appendBytes(bytes);
            check(sd_bus_message_close_container(message_));
        });
    }

    void beginArray() override { begin("av", "v", 2); }
    void endArray() override { end(2); }
    void beginDictionary() override { begin("a{sv}", "{sv}", 3); }
    void endDictionary() override { end(3); }

    void key(std::string_view utf8) override {
        if (tooDeep_ > 0) return;
        check(sd_bus_message_open_container(message_, SD_BUS_TYPE_DICT_ENTRY, "sv"));
        check(sd_bus_message_append_basic(message_, SD_BUS_TYPE_STRING, std::string(utf8).c_str()));
        entryOpen_.back() = true;
    }

  private:
    void check(int result) {
        if (result < 0 && result_ >= 0) result_ = result;
    }

    void openVariant(const char* signature) {
        if (!entryOpen_.empty())
            check(sd_bus_message_open_container(message_, SD_BUS_TYPE_VARIANT, signature));
    }

    /// Closes the dictionary entry, too, whose value the variant was.
    void closeVariant() {
        if (entryOpen_.empty()) return;
        check(sd_bus_message_close_container(message_));
        if (!entryOpen_.back()) return;
        entryOpen_.back() = false;
        check(sd_bus_message_close_container(message_));
    }

    template <typename Append>
    void variant(const char* signature, Append append) {
        if (tooDeep_ > 0) return;
        openVariant(signature);
        append();
        closeVariant();
    }

    void basic(const char* signature, char type, const void* value) {
        variant(signature, [&] { check(sd_bus_message_append_basic(message_, type, value)); });
    }

    void appendBytes(Bytes bytes) {
        check(sd_bus_message_append_array(message_, 'y', bytes.data(), bytes.size()));
    }

    void begin(const char* signature, const char* contents, int wireDepth) {
        if (tooDeep_ > 0 || wireDepth_ + wireDepth > kMaxWireDepth ||
            static_cast<int>(entryOpen_.size()) >= kMaxMessageDepth) {
            if (tooDeep_ == 0) null();
            ++tooDeep_;
            return;
        }
        openVariant(signature);
        check(sd_bus_message_open_container(message_, SD_BUS_TYPE_ARRAY, contents));
        wireDepth_ += wireDepth;
        entryOpen_.push_back(false);
    }

    void end(int wireDepth) {
        if (tooDeep_ > 0) {
            --tooDeep_;
            return;
        }
        entryOpen_.pop_back();
        wireDepth_ -= wireDepth;
        check(sd_bus_message_close_container(message_));
        closeVariant();
    }

    sd_bus_message* message_;
    int result_ = 0;
    int wireDepth_ = 0;
    /// Open containers whose place was taken by null.
    int tooDeep_ = 0;
    /// One per open container: whether a dictionary entry is open in it.
    std::vector<bool> entryOpen_;
};

}  // namespace

void readDictionary(sd_bus_message* message, ValueSink& sink) {
    sd_bus_message_rewind(message, true);
    Reader(message, sink).readValue(0);
}

std::optional<int64_t> peekInteger(sd_bus_message* message, std::string_view key) {
    std::optional<int64_t> found;
    sd_bus_message_rewind(message, true);
    if (sd_bus_message_enter_container(message, SD_BUS_TYPE_ARRAY, "{sv}") <= 0) return found;
    while (sd_bus_message_enter_container(message, SD_BUS_TYPE_DICT_ENTRY, "sv") > 0) {
        const char* name = nullptr;
        if (sd_bus_message_read_basic(message, SD_BUS_TYPE_STRING, static_cast<void*>(&name)) <= 0) break;
        if (key == name) {
            int64_t value = 0;
            if (sd_bus_message_read(message, "v", "x", &value) > 0) found = value;
            break;
        }
        if (sd_bus_message_skip(message, "v") < 0 || sd_bus_message_exit_container(message) < 0) break;
    }
    sd_bus_message_rewind(message, true);
    return found;
}

int appendDictionary(sd_bus_message* message, const ValueWriter& writer) {
    MessageSink sink(message);
    writer(sink);
    return sink.result();
}

}  // namespace platform::bus
