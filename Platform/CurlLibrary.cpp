#include "Platform/CurlLibrary.h"

#include <dlfcn.h>
#include <openssl/crypto.h>

#include <string>

#include "Platform/SystemLog.h"

namespace platform {
namespace {

constexpr const char* kLibraryName = "libcurl.so.4";

/// Looks functions up until one is missing.
class SymbolReader {
  public:
    explicit SymbolReader(void* library) : library_(library) {}

    template <typename Function>
    void find(Function& function, const char* name) {
        function = reinterpret_cast<Function>(dlsym(library_, name));
        if (function == nullptr && missing_ == nullptr) missing_ = name;
    }

    const char* missing() const { return missing_; }

  private:
    void* library_;
    const char* missing_ = nullptr;
};

const char* findAll(void* library, CurlLibrary& curl) {
    SymbolReader symbols(library);
    symbols.find(curl.globalInit, "curl_global_init");
    symbols.find(curl.easyInit, "curl_easy_init");
    symbols.find(curl.easyCleanup, "curl_easy_cleanup");
    symbols.find(curl.easySetopt, "curl_easy_setopt");
    symbols.find(curl.easyGetinfo, "curl_easy_getinfo");
    symbols.find(curl.easyStrerror, "curl_easy_strerror");
    symbols.find(curl.slistAppend, "curl_slist_append");
    symbols.find(curl.slistFreeAll, "curl_slist_free_all");
    symbols.find(curl.multiInit, "curl_multi_init");
    symbols.find(curl.multiCleanup, "curl_multi_cleanup");
    symbols.find(curl.multiAddHandle, "curl_multi_add_handle");
    symbols.find(curl.multiRemoveHandle, "curl_multi_remove_handle");
    symbols.find(curl.multiPerform, "curl_multi_perform");
    symbols.find(curl.multiPoll, "curl_multi_poll");
    symbols.find(curl.multiWakeup, "curl_multi_wakeup");
    symbols.find(curl.multiInfoRead, "curl_multi_info_read");
    symbols.find(curl.url, "curl_url");
    symbols.find(curl.urlCleanup, "curl_url_cleanup");
    symbols.find(curl.urlSet, "curl_url_set");
    symbols.find(curl.urlGet, "curl_url_get");
    symbols.find(curl.free, "curl_free");
    return symbols.missing();
}

const CurlLibrary* load() {
    // Never closed: its threads and TLS state live as long as the process.
    void* library = dlopen(kLibraryName, RTLD_NOW | RTLD_LOCAL);
    if (library == nullptr) {
        const char* reason = dlerror();  // NOLINT(concurrency-mt-unsafe): thread-local in glibc
        VELTOID_PLATFORM_LOG(Error,
                             std::string("cannot load the HTTPS client library: ") + (reason ? reason : "?"));
        return nullptr;
    }
    static CurlLibrary curl;
    if (const char* missing = findAll(library, curl)) {
        VELTOID_PLATFORM_LOG(Error, std::string(kLibraryName) + " lacks " + missing);
        return nullptr;
    }
    // An exchange may be under way when the process exits: OpenSSL, which the library is built on, must not
    // take its tables down underneath it. Only the first caller of OpenSSL in a process can choose that.
    OPENSSL_init_crypto(OPENSSL_INIT_NO_ATEXIT, nullptr);
    if (curl.globalInit(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
        VELTOID_PLATFORM_LOG(Error, "cannot initialise the HTTPS client library");
        return nullptr;
    }
    return &curl;
}

}  // namespace

const CurlLibrary* CurlLibrary::shared() {
    static const CurlLibrary* const curl = load();
    return curl;
}

}  // namespace platform
