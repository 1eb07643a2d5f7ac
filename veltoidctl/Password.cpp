#include "veltoidctl/Password.h"

#include <fcntl.h>
#include <termios.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>

#include "Platform/crypto/Crypto.h"
#include "Platform/encoding/HexText.h"
#include "Platform/runtime/FileDescriptor.h"

namespace veltoidctl {
namespace {

constexpr size_t kMaxPasswordBytes = 4'096;

/// Reads up to the line's end, byte by byte: what follows is not part of the password. No other buffer sees
/// it.
platform::SecretText readLine(int descriptor) {
    platform::SecretText line;
    line.reserve(kMaxPasswordBytes);
    for (uint8_t byte = 0;;) {
        const auto count = platform::readFully(descriptor, {&byte, 1});
        if (!count) throw std::runtime_error(std::string("reading the password: ") + strerror(errno));
        if (*count == 0 || byte == '\n') break;
        if (line.size() == kMaxPasswordBytes) throw std::runtime_error("the password is too long");
        line += static_cast<char>(byte);
    }
    if (!line.empty() && line.back() == '\r') line.pop_back();
    if (line.empty()) throw std::runtime_error("there is no password");
    return line;
}

/// The terminal without echo for as long as this exists.
class QuietTerminal {
  public:
    QuietTerminal() {
        if (!file_.isOpen() || tcgetattr(descriptor(), &before_) != 0)
            throw std::runtime_error("there is no terminal to ask at; use --password-stdin");
        termios quiet = before_;
        quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
        tcsetattr(descriptor(), TCSAFLUSH, &quiet);
    }
    ~QuietTerminal() {
        tcsetattr(descriptor(), TCSAFLUSH, &before_);
        say("\n");
    }

    void say(const std::string& text) const {
        [[maybe_unused]] const ssize_t written = write(descriptor(), text.data(), text.size());
    }
    int descriptor() const { return file_.number(); }

  private:
    const platform::FileDescriptor file_{open("/dev/tty", O_RDWR | O_CLOEXEC)};
    termios before_{};
};

platform::SecretText ask(const QuietTerminal& terminal, const std::string& question) {
    terminal.say(question);
    return readLine(terminal.descriptor());
}

platform::SecretText hashOf(const platform::SecretText& password) {
    platform::SHA256Digest digest = platform::sha256(platform::bytesOf(password));
    auto text = platform::hexText<platform::SecretText>(digest);
    platform::wipe(digest.data(), digest.size());
    return text;
}

}  // namespace

platform::SecretText readPasswordHash(PasswordSource source, const std::string& account) {
    if (source == PasswordSource::HashedStandardInput) return readLine(STDIN_FILENO);
    return hashOf(readPassword(source, "Password for " + account + ": "));
}

platform::SecretText readNewPassword(PasswordSource source, const std::string& purpose) {
    if (source != PasswordSource::Prompt) return readLine(STDIN_FILENO);
    const QuietTerminal terminal;
    platform::SecretText password = ask(terminal, "New password for " + purpose + ": ");
    if (ask(terminal, "\nOnce more: ") != password)
        throw std::runtime_error("the passwords are not the same");
    return password;
}

platform::SecretText readPassword(PasswordSource source, const std::string& question) {
    return source == PasswordSource::Prompt ? ask(QuietTerminal(), question) : readLine(STDIN_FILENO);
}

}  // namespace veltoidctl
