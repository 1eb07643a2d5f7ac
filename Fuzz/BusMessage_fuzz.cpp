// Messages of any shape, as clients may send them: reading one must end well, and what was read and written
// again must read the same.
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <cstdlib>
#include <cstring>
#include <iterator>
#include <memory>

#include "IPCHelpers/IPCMessage.h"
#include "Platform/bus/BusMessage.h"

namespace {

using Message = std::unique_ptr<sd_bus_message, decltype(&sd_bus_message_unref)>;

/// A bus that is never spoken over, since messages cannot be made without one.
sd_bus* deafBus() {
    static sd_bus* const bus = [] {
        int sockets[2];
        sd_bus* fresh = nullptr;
        if (socketpair(AF_UNIX, SOCK_STREAM, 0, sockets) < 0 || sd_bus_new(&fresh) < 0 ||
            sd_bus_set_fd(fresh, sockets[0], sockets[0]) < 0 || sd_bus_start(fresh) < 0)
            std::abort();
        return fresh;
    }();
    return bus;
}

Message newMessage() {
    sd_bus_message* message = nullptr;
    if (sd_bus_message_new_method_call(deafBus(), &message, "a.b", "/", "a.b", "Send") < 0) std::abort();
    return {message, sd_bus_message_unref};
}

/// Takes the fuzzer's bytes as orders to append values.
class Appender {
  public:
    Appender(sd_bus_message* message, const uint8_t* bytes, size_t size)
        : message_(message), bytes_(bytes), left_(size) {}

    void dictionary(int depth) {
        sd_bus_message_open_container(message_, 'a', "{sv}");
        while (left_ > 0 && next() % 8 != 0) {
            sd_bus_message_open_container(message_, 'e', "sv");
            sd_bus_message_append(message_, "s", next() % 4 == 0 ? "command" : "key");
            variant(depth);
            sd_bus_message_close_container(message_);
        }
        sd_bus_message_close_container(message_);
    }

  private:
    uint8_t next() {
        if (left_ == 0) return 0;
        --left_;
        return *bytes_++;
    }

    void variant(int depth) {
        static constexpr const char* kSignatures[] = {
            "x", "y",  "n",   "q",    "i",   "u",  "t",     "b",     "d",  "s",     "o",
            "g", "ay", "(d)", "(ay)", "(s)", "as", "a{ss}", "a{us}", "av", "a{sv}", "v"};
        const char* signature = kSignatures[next() % std::size(kSignatures)];
        constexpr int kDeepest = 18;
        if (depth >= kDeepest) signature = "x";
        sd_bus_message_open_container(message_, 'v', signature);
        content(signature, depth);
        sd_bus_message_close_container(message_);
    }

    void content(const char* signature, int depth) {
        const uint8_t byte = next();
        const uint64_t number = uint64_t{byte} << (byte % 56U);
        const char text[] = {static_cast<char>(1 + byte % 127), '\0'};
        if (std::strlen(signature) == 1 && std::strchr("xynqiut", *signature) != nullptr) {
            sd_bus_message_append_basic(message_, *signature, &number);
        } else if (*signature == 'b') {
            const int yes = byte % 2;
            sd_bus_message_append_basic(message_, 'b', &yes);
        } else if (*signature == 'd') {
            double real = 0;
            std::memcpy(&real, &number, sizeof real);
            sd_bus_message_append_basic(message_, 'd', &real);
        } else if (*signature == 's') {
            sd_bus_message_append_basic(message_, 's', text);
        } else if (*signature == 'o') {
            sd_bus_message_append_basic(message_, 'o', "/some/path");
        } else if (*signature == 'g') {
            sd_bus_message_append_basic(message_, 'g', byte % 2 ? "" : "a{sv}");
        } else if (*signature == 'v') {
            variant(depth + 1);
        } else if (std::strcmp(signature, "ay") == 0) {
            sd_bus_message_append_array(message_, 'y', text, byte % 2U);
        } else if (*signature == '(') {
            structure(signature, byte);
        } else {
            container(signature, depth, byte);
        }
    }

    void structure(const char* signature, uint8_t byte) {
        const uint8_t bytes[16] = {byte};
        const std::string members(signature + 1, std::strlen(signature) - 2);
        sd_bus_message_open_container(message_, 'r', members.c_str());
        if (members == "d") {
            const double seconds = byte * 1e7;
            sd_bus_message_append_basic(message_, 'd', &seconds);
        } else if (members == "ay") {
            sd_bus_message_append_array(message_, 'y', bytes, byte % 2 ? 16 : byte % 16U);
        } else {
            sd_bus_message_append_basic(message_, 's', "member");
        }
        sd_bus_message_close_container(message_);
    }

    void container(const char* signature, int depth, uint8_t byte) {
        if (std::strcmp(signature, "a{sv}") == 0) {
            dictionary(depth + 1);
            return;
        }
        sd_bus_message_open_container(message_, 'a', signature + 1);
        for (int i = 0; i < byte % 3; ++i) {
            if (std::strcmp(signature, "av") == 0) {
                variant(depth + 1);
            } else if (std::strcmp(signature, "as") == 0) {
                sd_bus_message_append(message_, "s", "element");
            } else if (std::strcmp(signature, "a{ss}") == 0) {
                sd_bus_message_append(message_, "{ss}", "k", "v");
            } else {
                sd_bus_message_append(message_, "{us}", 1U, "v");
            }
        }
        sd_bus_message_close_container(message_);
    }

    sd_bus_message* message_;
    const uint8_t* bytes_;
    size_t left_;
};

veltoid::MessageValue read(sd_bus_message* message) {
    if (sd_bus_message_seal(message, 1, 0) < 0 || sd_bus_message_has_signature(message, "a{sv}") <= 0)
        return {};
    veltoid::MessageValueBuilder builder;
    (void)platform::bus::peekInteger(message, "command");
    platform::bus::readDictionary(message, builder);
    return builder.take();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
    const Message first = newMessage();
    Appender(first.get(), bytes, size).dictionary(0);
    const veltoid::MessageValue value = read(first.get());
    const Message second = newMessage();
    if (platform::bus::appendDictionary(
            second.get(), [&](platform::ValueSink& sink) { veltoid::writeMessageValue(value, sink); }) < 0)
        return 0;
    if (veltoid::describe(value) != veltoid::describe(read(second.get()))) __builtin_trap();
    (void)veltoid::messageFromValue(veltoid::valueFromMessage(value));
    return 0;
}
