#include "VeltoIDXMLServerCommunications/ServerErrors.h"

#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Protocol/RecordKeys.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"

namespace veltoid {
namespace {

constexpr int64_t kFaultInvalidAccount = -20101;
constexpr int64_t kFaultInvalidPassword = -20283;
constexpr int64_t kFaultAccountDisabled = -20209;

constexpr std::string_view kFaultCodeKey = "XMLFaultCode";

// Codes of the HTTPS client library: the server has accepted the connection and closed it without an answer.
constexpr int64_t kEmptyAnswer = 52;
constexpr int64_t kReceiveFailed = 56;
constexpr int64_t kPartialAnswer = 18;

/// What happened in a call that failed for none of the known reasons.
std::string descriptionOf(const std::optional<Error>& error) {
    if (!error) return kUnusableAnswer;
    const auto withText = [](const std::string& what, const Error& cause) {
        const String text = cause.userInfo.string(kErrorDescriptionKey);
        return text ? what + ": " + text.text() : what;
    };
    if (error->domain == kXMLErrorDomain)
        return withText("The server answered with the fault " + std::to_string(error->code), *error);
    const Error* cause = error->userInfo[kErrorUnderlyingErrorKey].asError();
    if (cause == nullptr) return withText("The server did not answer, or not with success", *error);
    if (cause->code == kEmptyAnswer || cause->code == kReceiveFailed || cause->code == kPartialAnswer)
        return withText("The server closed the connection without an answer", *cause);
    return withText("The server cannot be reached", *cause);
}

bool isIdentityError(const std::optional<Error>& error, int64_t code) {
    return error && error->domain.view() == kIdentityErrorDomain && error->code == code;
}

bool refusesClient(const std::optional<Error>& error) {
    return isIdentityError(error, identity_error::kServerNoLongerSupported);
}

/// The verdict on a failed call that was made with this password hash: when the server refuses it, the stored
/// password goes if it is the same; when the server has disabled the account, or no longer supports this
/// client (-105), whatever it is. That disables the account until a client adds it again. Nothing for any
/// other error. False when a refused password is not the stored one.
bool judgeRefusal(const String& accountName, const String& sentPasswordHash,
                  const std::optional<Error>& error) {
    if (!refusesPassword(error) && !refusesClient(error)) return true;
    const bool concernsPassword = isIdentityError(error, identity_error::kInvalidAccountOrPassword);
    if (concernsPassword && !sentPasswordHash) return false;
    return __VeltoIDDBRemovePassword(accountName, concernsPassword ? sentPasswordHash : String()) ||
           !concernsPassword;
}

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
            userInfo.set(kFaultCodeKey, Value::int64(error->code));
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
    if (code == identity_error::kUnknown) texts.description = descriptionOf(error);
    Error translated = makeError(code, texts, userInfo, __func__, __FILE_NAME__, __LINE__);
    judgeRefusal(accountName, passwordHash, translated);
    return translated;
}

bool refusesPassword(const std::optional<Error>& error) {
    return isIdentityError(error, identity_error::kInvalidAccountOrPassword) ||
           isIdentityError(error, identity_error::kAccountLogonDisabled);
}

bool isOtherFault(const std::optional<Error>& error) {
    return isIdentityError(error, identity_error::kUnknown) && error->userInfo.contains(kFaultCodeKey);
}

void noteAttempt(const String& accountName, std::string_view what, std::string_view outcome,
                 const String& reason) {
    __VeltoIDDBSetAccountValues(
        accountName,
        {{kVeltoIDAccountLastAttemptKey, what},
         {kVeltoIDAccountLastAttemptDateKey, Value::date(platform::now())},
         {kVeltoIDAccountLastAttemptOutcomeKey, outcome},
         {kVeltoIDAccountLastAttemptReasonKey, reason ? Value(reason) : Value::null()}},
        Notify::No);
}

void noteAttempt(const String& accountName, std::string_view what, const std::optional<Error>& error) {
    if (!error) return noteAttempt(accountName, what, kAttemptSucceeded);
    const bool isRefused = refusesPassword(error) || refusesClient(error);
    const String description = error->userInfo.string(kErrorDescriptionKey);
    const String reason = error->userInfo.string(kErrorFailureReasonKey);
    // What people are told to do is no reason.
    const bool isReason = reason && (isRefused || !description);
    noteAttempt(accountName, what, isRefused ? kAttemptRefused : kAttemptFailed,
                (isReason ? reason : description));
}

void handleServerError(const String& accountName, const String& sentPasswordHash,
                       const std::optional<Error>& error) {
    if (refusesClient(error))
        VELTOID_LOG(kWarning,
                    "VeltoIDAuth: The server has reported that it no longer supports this client, so "
                    "removing the password from the system and disabling the account ",
                    accountName);
    const bool isRemoved = judgeRefusal(accountName, sentPasswordHash, error);
    if (refusesPassword(error) && isRemoved)
        VELTOID_LOG(kNotice, "VeltoIDAuth: The password for account ", accountName,
                    " is incorrect or the account has been disabled, so removing this password from the "
                    "system and disabling the account.");
}

}  // namespace veltoid
