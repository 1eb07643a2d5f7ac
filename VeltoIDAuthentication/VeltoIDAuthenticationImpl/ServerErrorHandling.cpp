#include "VeltoIDAuthenticationImpl/ServerErrorHandling.h"

#include "Logging/Log.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {

void handleServerError(const String& accountName, const std::optional<Error>& error) {
    if (!error || error->domain.view() != kIdentityErrorDomain) return;
    switch (error->code) {
        case identity_error::kServerNoLongerSupported:
            VELTOID_LOG(kWarning,
                        "VeltoIDAuth: The server has reported that it no longer supports this client, so "
                        "removing the "
                        "password from the system and disabling the account "
                            << accountName.view());
            break;
        case identity_error::kInvalidAccountOrPassword:
        case identity_error::kAccountLogonDisabled:
            VELTOID_LOG(kNotice,
                        "VeltoIDAuth: The password for account "
                            << accountName.view()
                            << " is incorrect or the account has been disabled, so removing this password "
                               "from the system and disabling the account.");
            break;
        default:
            return;
    }
    __VeltoIDDBRemovePassword(accountName);
}

}  // namespace veltoid
