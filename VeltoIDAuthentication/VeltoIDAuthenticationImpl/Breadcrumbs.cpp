#include "VeltoIDAuthenticationImpl/Breadcrumbs.h"

#include "VeltoIDXMLServerCommunications/Methods.h"
#include "VeltoIDXMLServerCommunications/SignIn.h"

namespace veltoid {
namespace {

/// Runs the call in a signed-in session; false, with the error, when there is none or the call fails.
template <typename Call>
bool withSession(const String& accountName, const String& hashedPassword, const Dictionary& options,
                 ErrorOut error, const Call& call) {
    std::optional<Error> held;
    const Session session =
        __VeltoIDSessionDoCreateSession(accountName, hashedPassword, options, nullptr, nullptr, &held);
    const bool succeeded = session && call(*session, &held);
    if (!succeeded) fillError(error, held ? *held : VELTOID_ERROR(identity_error::kUnknown));
    return succeeded;
}

}  // namespace

bool __VeltoIDDoSetBreadcrumb(const String& accountName, const String& hashedPassword, const String& key,
                              const Data& data, const Dictionary& options, ErrorOut error) {
    return withSession(accountName, hashedPassword, options, error,
                       [&](VeltoIDAuthenticationSessionInfo& session, ErrorOut held) {
                           return __VeltoIDSessionDoSetBreadcrumb(session, key, data, options, held);
                       });
}

Data __VeltoIDDoCopyBreadcrumb(const String& accountName, const String& hashedPassword, const String& key,
                               const Dictionary& options, ErrorOut error) {
    Data data;
    withSession(accountName, hashedPassword, options, error,
                [&](VeltoIDAuthenticationSessionInfo& session, ErrorOut held) {
                    data = __VeltoIDSessionDoCopyBreadcrumb(session, key, options, held);
                    return static_cast<bool>(data);
                });
    return data;
}

}  // namespace veltoid
