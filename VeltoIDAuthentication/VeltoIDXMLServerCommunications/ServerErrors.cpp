#include "VeltoIDXMLServerCommunications/ServerErrors.h"

#include "VeltoIDXMLServerCommunications/PasswordRefusal.h"

namespace veltoid {
namespace {

constexpr int64_t kFaultInvalidAccount = -20101;
constexpr int64_t kFaultInvalidPassword = -20283;
constexpr int64_t kFaultAccountDisabled = -20209;

}  // namespace

Error copyAndHandleXMLErrorResponse(const String& accountName, const String& passwordHash,
                                    const std::optional<Dictionary>& response,
                                    const std::optional<Error>& error) {
    int64_t code = identity_error::kUnknown;
    ErrorTexts texts;
    Dictionary userInfo;
    if (response) userInfo.set("XMLResponse", *response);
    if (error) {
        userInfo.set(kErrorUnderlyingErrorKey, *error);
        if (error->domain.view() == kXMLErrorDomain) {
            userInfo.set("XMLFaultCode", Value::int64(error->code));
            if (error->code == kFaultInvalidAccount || error->code == kFaultInvalidPassword) {
                code = identity_error::kInvalidAccountOrPassword;
                texts.failureReason = "The Velto ID account or password are incorrect.";
            } else if (error->code == kFaultAccountDisabled) {
                code = identity_error::kAccountLogonDisabled;
                texts.failureReason = "This Velto ID has been disabled for security reasons.";
                texts.description = "Go to " + std::string(kVeltoIDAccountManagementSite) +
                                    " for information on how to re-enable this Velto ID.";
            }
        }
    }
    Error translated = makeError(code, texts, userInfo, __func__, __FILE_NAME__, __LINE__);
    judgeRefusal(accountName, passwordHash, translated);
    return translated;
}

}  // namespace veltoid
