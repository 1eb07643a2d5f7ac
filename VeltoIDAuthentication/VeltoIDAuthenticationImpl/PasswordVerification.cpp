#include "VeltoIDAuthenticationImpl/PasswordVerification.h"

#include "Protocol/OptionKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {

bool __VeltoIDDoVerifyPassword(const String& accountName, const String& hashedPassword,
                               const Dictionary& options, ErrorOut error) {
    if (!accountName || !hashedPassword) {
        fillError(error, VELTOID_ERROR(identity_error::kInvalidParameters));
        return false;
    }
    const Dictionary signInOptions =
        copyDictionarySettingValue(options, option::kDoNotUseCachedSession, Value::boolean(true));
    std::optional<Error> sessionError;
    const Session session = __VeltoIDSessionDoCreateSession(accountName, hashedPassword, signInOptions,
                                                            nullptr, nullptr, &sessionError);
    if (session) {
        session->spoil();
        return true;
    }
    fillError(error, sessionError ? *sessionError : VELTOID_ERROR(identity_error::kInvalidAccountOrPassword));
    return false;
}

}  // namespace veltoid
