#include "VeltoIDAuthd/PasswordCheckService.h"

#include "IPCHelpers/Transaction.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
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
    const Data reference = request.value(message::kIdentityReference).asData();
    return reference && linkedIdentityHandler()(reference, error);
}

bool run(const Request& request, ErrorOut error) {
    switch (request.command()) {
        case command::kPing:
            return true;
        case command::kVerify:
            return verifyRequestedPassword(request, error);
        case command::kUpdateLinkedIdentity:
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
    const String password = request.string(message::kHashedPassword);
    if (!request.account() || !password) return false;
    const Dictionary options =
        copyDictionarySettingValue(request.options(), option::kDoNotSaveSessionInfo, Value::boolean(true));
    return __VeltoIDDoVerifyPassword(request.account(), password, options, error);
}

void setLinkedIdentityHandler(LinkedIdentityHandler handler) { linkedIdentityHandler() = std::move(handler); }

}  // namespace veltoid
