#include "Platform/runtime/SecureMemory.h"

#include <cstring>

namespace platform {

void wipe(void* memory, size_t size) noexcept {
    if (memory != nullptr) explicit_bzero(memory, size);
}

}  // namespace platform
