// The remote methods that the account engine calls on an open session. Each runs synchronously on the
// session's queue and blocks for at most 5 seconds; outputs are handed over only on success, the error only
// on failure. A failed call leaves the session usable for the same operation but never cached.
#pragma once

#include <optional>

#include "Values/Error.h"
#include "Values/Value.h"
#include "VeltoIDXMLServerCommunications/Session.h"

namespace veltoid {

/// Asks for the account's details. `encDsId` null: the session's; parameters "SerialNumber" (unless the
/// encDsId's certificate entry has one) and "VeltoIDAccountValidationRecordIdentifierKey" say what the agent
/// has already. The result holds names, addresses, phones, the certificate's state and the signed validation
/// record, as far as given.
bool _VeltoIDSessionDoGetMyInfo(VeltoIDAuthenticationSessionInfo& session, const String& encDsId,
                                const Dictionary& parameters, const Dictionary& options, Dictionary* result,
                                ErrorOut error);

}  // namespace veltoid
