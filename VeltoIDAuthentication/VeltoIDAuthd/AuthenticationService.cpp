#include "VeltoIDAuthd/AuthenticationService.h"

#include "IPCHelpers/Transaction.h"
#include "Logging/Log.h"
#include "Platform/runtime/WorkQueue.h"
#include "Protocol/Commands.h"
#include "Protocol/MessageKeys.h"
#include "Protocol/OptionKeys.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthd/AccountCheck.h"
#include "VeltoIDAuthd/AccountStatus.h"
#include "VeltoIDAuthd/ClientRequest.h"
#include "VeltoIDAuthd/PasswordCheckService.h"
#include "VeltoIDAuthd/Relaunch.h"
#include "VeltoIDAuthd/Shutdown.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/CertificateEntries.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDAuthenticationImpl/AccountBackOff.h"
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"
#include "VeltoIDAuthenticationImpl/ServerRequests.h"

namespace veltoid {
namespace {

constexpr const char* kHandlerName = "handleAuthenticationIPCMessage";

/// Long enough for the reply to leave before the process ends (seconds).
constexpr double kTerminationDelay = 0.1;

void countFor(const String& account, const Request& request, std::string_view counter) {
    __VeltoIDDBIncrementMetaInfoCounter(account, request.options(), counter, 1);
}

// Each handler answers one command: it fills the reply, and returns whether it succeeded, with an error if
// there is one to tell.

/// Sets the database value that the request names; none when section, item or key is missing or unknown.
std::optional<bool> setDatabaseValue(const Request& request, ErrorOut error) {
    if (request.hasDescriptor())
        return failWith(error, makeError(identity_error::kInvalidParameters,
                                         {"A file descriptor cannot be stored.", {}, {}}, {}, __func__,
                                         __FILE_NAME__, __LINE__));
    const String section = request.string(message::kSection);
    const String item = request.string(message::kItem);
    const String key = request.string(message::kKey);
    const Value value = request.value(message::kValue);
    const Notify notify = getBool(&request.options(), option::kDirty, true) ? Notify::Yes : Notify::No;
    if (!section || !key) return std::nullopt;
    if (section == message::kMetaInfoSection) return __VeltoIDDBSetMetaInfoValue(item, key, value);
    String account = item;
    std::optional<bool> isSet;
    if (item && section == message::kAccountsSection) {
        isSet = __VeltoIDDBSetAccountValue(item, key, value, notify);
    } else if (item && section == message::kCertificatesSection) {
        isSet = __VeltoIDDBSetCertificateValue(item, key, value, notify);
        __VeltoIDDBCopyVeltoIDForDSID(item, &account);
    }
    if (isSet.value_or(false) && notify == Notify::Yes) noteNews(account);
    return isSet;
}

bool addAccount(Request& request, ErrorOut error) {
    AddedAccount added;
    const AddingClient client{wakeAccountCheck, [&] { return !request.isSenderGone() && !isLeaving(); }};
    const bool succeeded = addOnlyAccount(request.account(), request.string(message::kHashedPassword),
                                          request.options(), client, &added, error);
    request.holdUntilFinished(added.decision);
    request.answer(message::kEncDsId, added.encDsId);
    if (added.record) request.answer(message::kAddedAccount, *added.record);
    return succeeded;
}

bool getMyInfo(Request& request, ErrorOut error) {
    Dictionary info;
    const bool succeeded = __VeltoIDDoGetMyInfo(request.account(), request.options(), &info, error);
    countFor(request.account(), request, kVeltoIDGetMyInfoCountKey);
    if (succeeded) request.answer(message::kInfo, info);
    return succeeded;
}

bool findPerson(Request& request, ErrorOut error) {
    std::optional<Array> results;
    const bool succeeded =
        __VeltoIDDoFindPerson(request.account(), request.string(message::kHashedPassword),
                              request.dictionary(message::kCriteria), request.options(), &results, error);
    countFor(request.account(), request, kVeltoIDFindCountKey);
    if (succeeded && results) request.answer(message::kResult, *results);
    return succeeded;
}

bool findCachedPerson(Request& request, ErrorOut /*error*/) {
    const auto results = __VeltoIDDBCopyCachedFindPersonResults(request.dictionary(message::kCriteria));
    countFor(request.account(), request, kVeltoIDFindCachedCountKey);
    if (results) request.answer(message::kResult, *results);
    return results.has_value();
}

bool listAccounts(Request& request, ErrorOut error) {
    Array names;
    if (!__VeltoIDCopyVeltoIDs(request.options(), &names, error)) return false;
    request.answer(message::kResult, names);
    return true;
}

bool forgetAccount(Request& request, ErrorOut error) {
    AccountRecord record;
    const bool succeeded = __VeltoIDDBCopyVeltoIDAccount(request.account(), nullptr, error) &&
                           __VeltoIDForgetVeltoID(request.account(), request.options(), error, &record);
    if (succeeded) {
        request.answer(message::kAccount, record.accountName());
        request.answer(message::kForgottenEncDsId, record.encDsId());
        request.answer(message::kForgottenAccount, record.values());
    }
    countFor(nullptr, request, kVeltoIDForgetVeltoIDCountKey);
    return succeeded;
}

/// The signed record that vouches for the account's validated items.
bool copyValidationRecord(Request& request) {
    AccountRecord record;
    if (!__VeltoIDDBCopyVeltoIDAccount(request.account(), &record)) return false;
    Dictionary result;
    for (const std::string_view key :
         {kVeltoIDAccountValidationRecordDataKey, kVeltoIDAccountValidationRecordValidAsOfKey})
        result.set(key, record.values()[key]);
    request.answer(message::kResult, result);
    return true;
}

bool copyCertificateInformation(Request& request, ErrorOut error) {
    if (request.string(message::kCertificateType) == message::kValidationRecordType)
        return copyValidationRecord(request);
    Dictionary result;
    if (!__VeltoIDCopyCertificateInfo(request.account(), request.string(message::kEncDsId), request.options(),
                                      &result, error))
        return false;
    request.answer(message::kResult, result);
    return true;
}

bool setBreadcrumb(Request& request, ErrorOut error) {
    return __VeltoIDDoSetBreadcrumb(request.account(), request.string(message::kHashedPassword),
                                    request.string(message::kBreadcrumbKey),
                                    request.data(message::kBreadcrumb), request.options(), error);
}

bool copyBreadcrumb(Request& request, ErrorOut error) {
    const Data breadcrumb =
        __VeltoIDDoCopyBreadcrumb(request.account(), request.string(message::kHashedPassword),
                                  request.string(message::kBreadcrumbKey), request.options(), error);
    request.answer(message::kBreadcrumb, breadcrumb);
    return static_cast<bool>(breadcrumb);
}

bool copyAllContents(Request& request, ErrorOut error) {
    std::optional<Dictionary> contents;
    const bool succeeded = __VeltoIDDBCopyAllContents(&contents, error);
    if (contents) request.answer(message::kResult, *contents);
    return succeeded;
}

bool check(Request& request, ErrorOut /*error*/) {
    const AccountState state = checkAccountAndDetermineNextAction(request.account(), request.options());
    request.answer(message::kStatus, Value::int64(static_cast<int64_t>(state)));
    return true;
}

void terminateAfterReply() {
    platform::WorkQueue::main().asyncAfter(kTerminationDelay, [] {
        VELTOID_LOG_FROM(
            kHandlerName, kNotice,
            "Shutting down server after receiving kVeltoIDAuthenticationStatusTerminateServerKey request.");
        shutDownByCommand();
    });
}

bool status(Request& request, ErrorOut error) {
    const bool terminates = getBool(&request.options(), option::kTerminateServer, false);
    if (!terminates && !__VeltoIDDBIsReadable(error)) return false;
    if (terminates) computeRelaunchFromAccounts();
    request.answer(message::kStatus, terminates ? copyDeviceStatusDictionary()
                                                : copyAccountStatusesDictionary(request.options()));
    if (terminates) terminateAfterReply();
    return true;
}

/// What a command does while the database cannot be read.
enum class WhileUnreadable { Run, Refuse };

struct Command {
    int64_t number;
    bool (*run)(Request& request, ErrorOut error);
    WhileUnreadable whileUnreadable = WhileUnreadable::Run;
};

constexpr Command kCommands[] = {
    {command::kPing, [](Request&, ErrorOut) { return true; }},
    {command::kSetValue,
     [](Request& request, ErrorOut error) { return setDatabaseValue(request, error).value_or(false); }},
    {command::kSetValueQuietly,
     [](Request& request, ErrorOut error) { return setDatabaseValue(request, error).value_or(true); }},
    {command::kAdd, addAccount},
    {command::kInfo, getMyInfo, WhileUnreadable::Refuse},
    {command::kFind, findPerson, WhileUnreadable::Refuse},
    {command::kFindCached, findCachedPerson},
    {command::kList, listAccounts, WhileUnreadable::Refuse},
    {command::kForget, forgetAccount, WhileUnreadable::Refuse},
    {command::kCertificate, copyCertificateInformation, WhileUnreadable::Refuse},
    {command::kVerify, verifyRequestedPassword},
    {command::kSetBreadcrumb, setBreadcrumb, WhileUnreadable::Refuse},
    {command::kGetBreadcrumb, copyBreadcrumb, WhileUnreadable::Refuse},
    {command::kDatabase, copyAllContents},
    {command::kCheck, check, WhileUnreadable::Refuse},
    {command::kStatus, status},
};

bool dispatch(Request& request, ErrorOut error) {
    for (const Command& known : kCommands)
        if (known.number == request.command())
            return (known.whileUnreadable == WhileUnreadable::Run || __VeltoIDDBIsReadable(error)) &&
                   known.run(request, error);
    return false;
}

}  // namespace

void handleAuthenticationIPCMessage(platform::IncomingMessage& message) {
    const Transaction guard(kHandlerName);
    Request request(message);
    if (request.command() == command::kTerminate) {
        computeRelaunchFromAccounts();
        return shutDownByCommand();
    }
    std::optional<Error> error;
    const bool succeeded = request.isSound(&error) && dispatch(request, &error);
    request.finish(succeeded, error);
}

}  // namespace veltoid
