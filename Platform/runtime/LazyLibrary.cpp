#include "Platform/runtime/LazyLibrary.h"

#include <dlfcn.h>

#include <algorithm>
#include <cstdlib>
#include <string>

#include "Platform/runtime/SystemLog.h"

namespace platform {
namespace {

std::string missing(const char* what) {
    const char* reason = dlerror();  // NOLINT(concurrency-mt-unsafe): thread-local in glibc
    return std::string("cannot load ") + what + ": " + (reason != nullptr ? reason : "?");
}

[[noreturn]] void abortOnMissing(const char* what) {
    VELTOID_PLATFORM_LOG(Critical, missing(what));
    std::abort();
}

}  // namespace

void* LazyLibrary::addressOf(const char* function) const {
    // Opened anew for each function: the loader finds the name among those that are loaded and counts.
    void* library = dlopen(soname_, RTLD_LAZY | RTLD_LOCAL);
    if (library == nullptr) abortOnMissing(soname_);
    if (prepare_ != nullptr) prepare_();
    void* address = dlsym(library, function);
    if (address == nullptr) abortOnMissing(function);
    return address;
}

bool LazyLibrary::provides(std::initializer_list<const char*> functions) const {
    void* library = dlopen(soname_, RTLD_NOW | RTLD_LOCAL);
    const auto* lacking = library == nullptr
                              ? functions.begin()
                              : std::find_if(functions.begin(), functions.end(), [library](const char* name) {
                                    return dlsym(library, name) == nullptr;
                                });
    if (library != nullptr && lacking == functions.end()) return true;
    VELTOID_PLATFORM_LOG(Error, missing(library == nullptr ? soname_ : *lacking));
    return false;
}

}  // namespace platform
