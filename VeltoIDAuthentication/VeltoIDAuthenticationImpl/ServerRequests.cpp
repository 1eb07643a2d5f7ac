#include "VeltoIDAuthenticationImpl/ServerRequests.h"

#include "Protocol/OptionKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDXMLServerCommunications/Methods.h"
#include "VeltoIDXMLServerCommunications/ServerErrors.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

/// Runs the call in a signed-in session; false, with the error, when there is none or the call fails.
/// `otherwise`: the error where none is told.
template <typename Call>
bool inSession(const String& accountName, const String& hashedPassword, const Dictionary& options,
               const Error& otherwise, ErrorOut error, const Call& call) {
    std::optional<Error> held;
    const Session session =
        __VeltoIDSessionDoCreateSession(accountName, hashedPassword, options, nullptr, nullptr, &held);
    return (session && call(*session, &held)) || failWith(error, held.value_or(otherwise));
}

/// The first account that could sign in; null without one.
String firstAccount() {
    const auto record = __VeltoIDDBCopyFirstVeltoIDAccount({.password = true, .encDsId = true});
    return record ? record->accountName() : String();
}

}  // namespace

bool __VeltoIDDoFindPerson(const String& accountName, const String& hashedPassword,
                           const Dictionary& criteria, const Dictionary& options,
                           std::optional<Array>* results, ErrorOut error) {
    const String name = accountName ? accountName : firstAccount();
    if (!name) return failWith(error, VELTOID_ERROR(identity_error::kNoAccountForRequest));
    const String password =
        accountName && hashedPassword ? hashedPassword : __VeltoIDDBCopyHashedPassword(accountRecordOf(name));
    std::optional<Error> held;
    const bool found =
        inSession(name, password, options, VELTOID_ERROR(identity_error::kUnknown), &held,
                  [&](VeltoIDAuthenticationSessionInfo& session, ErrorOut callError) {
                      return __VeltoIDSessionDoFindPerson(session, criteria, options, results, callError);
                  });
    if (found) return true;
    handleServerError(name, password, held);
    return failWith(error, *held);
}

bool __VeltoIDDoSetBreadcrumb(const String& accountName, const String& hashedPassword, const String& key,
                              const Data& data, const Dictionary& options, ErrorOut error) {
    return inSession(accountName, hashedPassword, options, VELTOID_ERROR(identity_error::kUnknown), error,
                     [&](VeltoIDAuthenticationSessionInfo& session, ErrorOut held) {
                         return __VeltoIDSessionDoSetBreadcrumb(session, key, data, options, held);
                     });
}

Data __VeltoIDDoCopyBreadcrumb(const String& accountName, const String& hashedPassword, const String& key,
                               const Dictionary& options, ErrorOut error) {
    Data data;
    inSession(accountName, hashedPassword, options, VELTOID_ERROR(identity_error::kUnknown), error,
              [&](VeltoIDAuthenticationSessionInfo& session, ErrorOut held) {
                  data = __VeltoIDSessionDoCopyBreadcrumb(session, key, options, held);
                  return static_cast<bool>(data);
              });
    return data;
}

bool __VeltoIDDoVerifyPassword(const String& accountName, const String& hashedPassword,
                               const Dictionary& options, ErrorOut error) {
    if (!accountName || !hashedPassword)
        return failWith(error, VELTOID_ERROR(identity_error::kInvalidParameters));
    return inSession(
        accountName, hashedPassword,
        copyDictionarySettingValue(options, option::kDoNotUseCachedSession, Value::boolean(true)),
        VELTOID_ERROR(identity_error::kInvalidAccountOrPassword), error,
        [](VeltoIDAuthenticationSessionInfo& session, ErrorOut /*held*/) {
            session.spoil();
            return true;
        });
}

}  // namespace veltoid
