#include "VeltoIDAuthd/PasswordCheckService.h"

#include "IPCHelpers/Transaction.h"
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
    constexpr int64_t kPing = 1;
    constexpr int64_t kVerifyPassword = 0x180;
    constexpr int64_t kUpdateLinkedIdentity = 400;
    switch (request.command()) {
        case kPing:
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
    return request.account() && password &&
           __VeltoIDDoVerifyPassword(request.account(), password,
                                     request.optionsWith("DoNotSaveSessionInfo", Value::boolean(true)),
                                     error);
}

void setLinkedIdentityHandler(LinkedIdentityHandler handler) { linkedIdentityHandler() = std::move(handler); }

}  // namespace veltoid
