#include "VeltoIDAuthd/PasswordCheckService.h"

#include "IPCHelpers/Transaction.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationImpl/PasswordVerification.h"

namespace veltoid {
namespace {

bool linkedIdentityUnsupported(const Data& /*identityReference*/, ErrorOut error) {
    fillError(error, VELTOID_ERROR(identity_error::kUnsupportedFeature));
    return false;
}

LinkedIdentityHandler& linkedIdentityHandler() {
    static auto* handler = new LinkedIdentityHandler(linkedIdentityUnsupported);
    return *handler;
}

bool updateLinkedIdentity(const Request& request, ErrorOut error) {
    const Data reference = request.value("identityReferenceData").asData();
    return reference && linkedIdentityHandler()(reference, error);
}

bool run(const Request& request, ErrorOut error) {
    constexpr int64_t kVerifyPassword = 0x180;
    constexpr int64_t kUpdateLinkedIdentity = 400;
    switch (request.command()) {
        case kVeltoIDPingCommand:
            return true;
        case kVerifyPassword:
            return verifyRequestedPassword(request, error);
        case kUpdateLinkedIdentity:
            return updateLinkedIdentity(request, error);
        default:
            return false;
    }
}

}  // namespace

void handlePasswordCheckIPCMessage(platform::IncomingMessage& message) {
    const Transaction guard("handlePasswordCheckIPCMessage");
    Request request(message);
    std::optional<Error> error;
    const bool success = run(request, &error);
    request.finish(success, error);
}

bool verifyRequestedPassword(const Request& request, ErrorOut error) {
    const String password = request.string("hashedpassword");
    if (!request.account() || !password) return false;
    const Dictionary options =
        copyDictionarySettingValue(request.options(), "DoNotSaveSessionInfo", Value::boolean(true));
    return __VeltoIDDoVerifyPassword(request.account(), password, options, error);
}

void setLinkedIdentityHandler(LinkedIdentityHandler handler) { linkedIdentityHandler() = std::move(handler); }

}  // namespace veltoid
