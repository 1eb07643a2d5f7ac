#include "VeltoIDAuthenticationImpl/FindPerson.h"

#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDXMLServerCommunications/Methods.h"
#include "VeltoIDXMLServerCommunications/PasswordRefusal.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

/// The first account that could sign in; null without one.
String firstAccount() {
    const auto record = __VeltoIDDBCopyFirstVeltoIDAccount({.password = true, .encDsId = true});
    return record ? record->accountName() : String();
}

String storedPassword(const String& accountName) {
    AccountRecord record;
    return __VeltoIDDBCopyVeltoIDAccount(accountName, &record) ? __VeltoIDDBCopyHashedPassword(record)
                                                               : String();
}

}  // namespace

bool __VeltoIDDoFindPerson(const String& accountName, const String& hashedPassword,
                           const Dictionary& criteria, const Dictionary& options,
                           std::optional<Array>* results, ErrorOut error) {
    const String name = accountName ? accountName : firstAccount();
    if (!name) {
        fillError(error, VELTOID_ERROR(identity_error::kNoAccountForRequest));
        return false;
    }
    const String password = accountName && hashedPassword ? hashedPassword : storedPassword(name);
    std::optional<Error> held;
    const Session session = __VeltoIDSessionDoCreateSession(name, password, options, nullptr, nullptr, &held);
    const bool found = session && __VeltoIDSessionDoFindPerson(*session, criteria, options, results, &held);
    if (found) return true;
    handleServerError(name, password, held);
    fillError(error, held ? *held : VELTOID_ERROR(identity_error::kUnknown));
    return false;
}

}  // namespace veltoid
