#include "VeltoIDAuthd/PasswordCheckService.h"

#include "IPCHelpers/Transaction.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDAuthenticationImpl/ServerRequests.h"

namespace veltoid {
namespace {

bool updateLinkedIdentity(const Request& request, const LinkedIdentityHandler& update, ErrorOut error) {
    const Data reference = request.value(message::kIdentityReference).asData();
    if (!reference) return false;
    return update ? update(reference, error)
                  : failWith(error, VELTOID_ERROR(identity_error::kUnsupportedFeature));
}

bool run(Request& request, const LinkedIdentityHandler& linkedIdentity, ErrorOut error) {
    if (request.command() == command::kPing) return true;
    if (request.command() == command::kVerify) return verifyRequestedPassword(request, error);
    return request.command() == command::kUpdateLinkedIdentity &&
           updateLinkedIdentity(request, linkedIdentity, error);
}

}  // namespace

void handlePasswordCheckIPCMessage(platform::IncomingMessage& message,
                                   const LinkedIdentityHandler& linkedIdentity) {
    const Transaction guard("handlePasswordCheckIPCMessage");
    Request request(message);
    std::optional<Error> error;
    const bool succeeded = request.isSound(&error) && run(request, linkedIdentity, &error);
    request.finish(succeeded, error);
}

bool verifyRequestedPassword(Request& request, ErrorOut error) {
    const String password = request.string(message::kHashedPassword);
    // Where the password is to be sent is among what is stored.
    if (!request.account() || !password || !__VeltoIDDBIsReadable(error)) return false;
    const Dictionary options =
        copyDictionarySettingValue(request.options(), option::kDoNotSaveSessionInfo, Value::boolean(true));
    return __VeltoIDDoVerifyPassword(request.account(), password, options, error);
}

}  // namespace veltoid
