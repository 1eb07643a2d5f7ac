#include "VeltoIDXMLServerCommunications/PasswordRefusal.h"

#include "Logging/Log.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {
namespace {

bool isIdentityError(const std::optional<Error>& error, int64_t code) {
    return error && error->domain.view() == kIdentityErrorDomain && error->code == code;
}

bool refusesClient(const std::optional<Error>& error) {
    return isIdentityError(error, identity_error::kServerNoLongerSupported);
}

}  // namespace

bool refusesPassword(const std::optional<Error>& error) {
    return isIdentityError(error, identity_error::kInvalidAccountOrPassword) ||
           isIdentityError(error, identity_error::kAccountLogonDisabled);
}

void judgeRefusal(const String& accountName, const String& /*sentPasswordHash*/,
                  const std::optional<Error>& error) {
    if (refusesPassword(error) || refusesClient(error)) __VeltoIDDBRemovePassword(accountName);
}

void handleServerError(const String& accountName, const String& sentPasswordHash,
                       const std::optional<Error>& error) {
    if (refusesClient(error))
        VELTOID_LOG(kWarning,
                    "VeltoIDAuth: The server has reported that it no longer supports this client, so "
                    "removing the "
                    "password from the system and disabling the account "
                        << accountName.view());
    if (refusesPassword(error))
        VELTOID_LOG(kNotice,
                    "VeltoIDAuth: The password for account "
                        << accountName.view()
                        << " is incorrect or the account has been disabled, so removing this password "
                           "from the system and disabling the account.");
    judgeRefusal(accountName, sentPasswordHash, error);
}

}  // namespace veltoid
