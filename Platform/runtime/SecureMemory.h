// Memory for secrets: wiped when it is given back.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <vector>

namespace platform {

using Bytes = std::span<const uint8_t>;

/// Overwrites `size` bytes with zeros in a way that the compiler does not remove. Any thread.
void wipe(void* memory, size_t size) noexcept;

/// Allocator whose blocks are wiped before they are freed, so that a growing container leaves no copy behind.
template <typename T>
struct WipingAllocator {
    using value_type = T;

    WipingAllocator() = default;
    template <typename U>
    WipingAllocator(const WipingAllocator<U>&) noexcept {}

    T* allocate(size_t count) { return std::allocator<T>().allocate(count); }
    void deallocate(T* memory, size_t count) noexcept {
        wipe(memory, count * sizeof(T));
        std::allocator<T>().deallocate(memory, count);
    }
    friend bool operator==(const WipingAllocator&, const WipingAllocator&) noexcept { return true; }
};

/// Bytes that may hold a secret. A vector keeps nothing inside the object itself, so all of it is wiped.
using SecretBytes = std::vector<uint8_t, WipingAllocator<uint8_t>>;

/// Text that may hold a secret. Up to 15 characters live inside the object and are not wiped: reserve first.
using SecretText = std::basic_string<char, std::char_traits<char>, WipingAllocator<char>>;

inline Bytes bytesOf(std::string_view text) {
    return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

inline std::string_view textOf(Bytes bytes) {
    return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}

}  // namespace platform
