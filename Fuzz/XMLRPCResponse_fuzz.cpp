// Arbitrary bytes as an XML-RPC response; what is read from them must survive being written and walked.
#include <cstdlib>

#include "Logging/Describe.h"
#include "Platform/runtime/Lifetime.h"
#include "XMLRPC/XMLRPCDefaultEncoder.h"
#include "XMLRPC/XMLRPCResponse.h"

// NOLINTNEXTLINE(misc-use-internal-linkage): the fuzzer's entry point
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
    static const platform::Lifetime lifetime(platform::Product{});
    const veltoid::XMLRPCResponse response({bytes, bytes + size});
    (void)response.faultCode();
    (void)response.body();
    (void)veltoid::describeValue(response.object());

    // A value that was read, written and read again is the same value.
    if (response.object().isAbsent()) return 0;
    const auto written = veltoid::XMLRPCDefaultEncoder::encodeObject(response.object());
    const platform::Bytes document = platform::bytesOf(written);
    const veltoid::XMLRPCResponse again({document.begin(), document.end()});
    if (again.object().kind() != response.object().kind()) {
        // Null is written as nil, which reads as an empty String.
        if (!response.object().isNull()) std::abort();
    }
    return 0;
}
