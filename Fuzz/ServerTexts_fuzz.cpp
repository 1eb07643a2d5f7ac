// Texts that come from the server inside its answers: dates, base64, PEM and error dictionaries.
#include "Values/Base64.h"
#include "Values/DateText.h"
#include "Values/Error.h"
#include "Values/PEM.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(bytes), size);
    const veltoid::String string(text);
    (void)veltoid::dateFromValue(string);
    (void)veltoid::pemBodyToData(string);
    const veltoid::Data decoded = veltoid::base64Decode(string);
    // Whatever was decoded encodes to something that decodes to it again.
    if (decoded.size() > 0 && veltoid::base64Decode(veltoid::base64Encode(decoded)) != decoded)
        __builtin_trap();
    const veltoid::Data loose = veltoid::xmlrpcBase64Decode(text);
    if (veltoid::xmlrpcBase64Decode(veltoid::xmlrpcBase64Encode(loose.bytes(), true).view()) != loose)
        __builtin_trap();
    return 0;
}
