#include "Platform/runtime/LazyLibrary.h"

#include <dlfcn.h>

#include <cstdlib>
#include <string>

#include "Platform/runtime/SystemLog.h"

namespace platform {
namespace {

[[noreturn]] void abortOnMissing(const char* what) {
    const char* reason = dlerror();  // NOLINT(concurrency-mt-unsafe): thread-local in glibc
    VELTOID_PLATFORM_LOG(Critical, std::string("cannot load ") + what + ": " + (reason ? reason : "?"));
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

}  // namespace platform
