#include "VeltoIDAuthd/AuthenticationService.h"

#include <algorithm>

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
#include "VeltoIDAuthenticationImpl/AccountInformation.h"
#include "VeltoIDAuthenticationImpl/AddAccount.h"
#include "VeltoIDAuthenticationImpl/Breadcrumbs.h"
#include "VeltoIDAuthenticationImpl/CertificateInformation.h"
#include "VeltoIDAuthenticationImpl/FindPerson.h"
#include "VeltoIDAuthenticationImpl/ForgetAccount.h"
#include "VeltoIDAuthenticationImpl/NextAction.h"

namespace veltoid {
namespace {

constexpr const char* kHandlerName = "handleAuthenticationIPCMessage";

/// Long enough for the reply to leave before the process ends (seconds).
constexpr double kTerminationDelay = 0.1;

struct Outcome {
    bool success = false;
    std::optional<Error> error;
};

void countFor(const String& account, const Request& request, std::string_view counter) {
    __VeltoIDDBIncrementMetaInfoCounter(account, request.options(), counter, 1);
}

Outcome ping(Request& /*request*/) { return {true, {}}; }

/// Sets what the request names; none when that is nothing that can be set.
std::optional<bool> setDatabaseValue(const Request& request) {
    const String section = request.string(message::kSection);
    const String item = request.string(message::kItem);
    const String key = request.string(message::kKey);
    const Value value = request.value(message::kValue);
    const Notify notify = getBool(&request.options(), option::kDirty, true) ? Notify::Yes : Notify::No;
    if (!section || !key) return std::nullopt;
    if (section == message::kMetaInfoSection) return __VeltoIDDBSetMetaInfoValue(item, key, value);
    if (item && section == message::kAccountsSection)
        return __VeltoIDDBSetAccountValue(item, key, value, notify);
    if (item && section == message::kCertificatesSection)
        return __VeltoIDDBSetCertificateValue(item, key, value, notify);
    return std::nullopt;
}

Outcome setValueOrFail(Request& request) { return {setDatabaseValue(request).value_or(false), {}}; }

Outcome setValueIfPossible(Request& request) { return {setDatabaseValue(request).value_or(true), {}}; }

Outcome addAccount(Request& request) {
    Outcome outcome;
    AddedAccount added;
    outcome.success = addOnlyAccount(request.account(), request.string(message::kHashedPassword),
                                     request.options(), wakeAccountCheck, &added, &outcome.error);
    request.answer(message::kEncDsId, added.encDsId);
    if (added.record) request.answer(message::kAddedAccount, *added.record);
    return outcome;
}

Outcome getMyInfo(Request& request) {
    Outcome outcome;
    Dictionary info;
    outcome.success = __VeltoIDDoGetMyInfo(request.account(), request.options(), &info, &outcome.error);
    countFor(request.account(), request, kVeltoIDGetMyInfoCountKey);
    if (outcome.success) request.answer(message::kInfo, info);
    return outcome;
}

Dictionary criteriaOf(const Request& request) {
    const Value criteria = request.value(message::kCriteria);
    const Dictionary* dictionary = criteria.asDictionary();
    return dictionary != nullptr ? *dictionary : Dictionary();
}

Outcome findPerson(Request& request) {
    Outcome outcome;
    std::optional<Array> results;
    outcome.success = __VeltoIDDoFindPerson(request.account(), request.string(message::kHashedPassword),
                                            criteriaOf(request), request.options(), &results, &outcome.error);
    countFor(request.account(), request, kVeltoIDFindCountKey);
    if (outcome.success && results) request.answer(message::kResult, *results);
    return outcome;
}

Outcome findCachedPerson(Request& request) {
    const auto results = __VeltoIDDBCopyCachedFindPersonResults(criteriaOf(request));
    countFor(request.account(), request, kVeltoIDFindCachedCountKey);
    if (!results || results->empty()) return {};
    request.answer(message::kResult, *results);
    return {true, {}};
}

Outcome listAccounts(Request& request) {
    Outcome outcome;
    Array names;
    outcome.success = __VeltoIDCopyVeltoIDs(request.options(), &names, &outcome.error);
    if (outcome.success) request.answer(message::kResult, names);
    return outcome;
}

Outcome forgetAccount(Request& request) {
    Outcome outcome;
    AccountRecord record;
    if (__VeltoIDDBCopyVeltoIDAccount(request.account(), &record, &outcome.error))
        outcome.success = __VeltoIDForgetVeltoID(record.accountName(), request.options(), &outcome.error);
    if (outcome.success) {
        request.answer(message::kAccount, record.accountName());
        request.answer(message::kForgottenEncDsId, record.encDsId());
        request.answer(message::kForgottenAccount, record.values());
    }
    countFor(nullptr, request, kVeltoIDForgetVeltoIDCountKey);
    return outcome;
}

/// The signed record that vouches for the account's validated items.
Outcome copyValidationRecord(Request& request) {
    AccountRecord record;
    if (!__VeltoIDDBCopyVeltoIDAccount(request.account(), &record)) return {};
    Dictionary result;
    for (const std::string_view key :
         {kVeltoIDAccountValidationRecordDataKey, kVeltoIDAccountValidationRecordValidAsOfKey})
        result.set(key, record.values()[key]);
    request.answer(message::kResult, result);
    return {true, {}};
}

Outcome copyCertificateInformation(Request& request) {
    if (request.string(message::kCertificateType) == message::kValidationRecordType)
        return copyValidationRecord(request);
    Outcome outcome;
    Dictionary result;
    outcome.success = __VeltoIDCopyCertificateInfo(request.account(), request.string(message::kEncDsId),
                                                   request.options(), &result, &outcome.error);
    if (outcome.success) request.answer(message::kResult, result);
    return outcome;
}

Outcome setBreadcrumb(Request& request) {
    Outcome outcome;
    outcome.success = __VeltoIDDoSetBreadcrumb(
        request.account(), request.string(message::kHashedPassword), request.string(message::kBreadcrumbKey),
        request.data(message::kBreadcrumb), request.options(), &outcome.error);
    return outcome;
}

Outcome copyBreadcrumb(Request& request) {
    Outcome outcome;
    const Data breadcrumb =
        __VeltoIDDoCopyBreadcrumb(request.account(), request.string(message::kHashedPassword),
                                  request.string(message::kBreadcrumbKey), request.options(), &outcome.error);
    outcome.success = static_cast<bool>(breadcrumb);
    if (outcome.success) request.answer(message::kBreadcrumb, breadcrumb);
    return outcome;
}

Outcome verifyPassword(Request& request) {
    Outcome outcome;
    outcome.success = verifyRequestedPassword(request, &outcome.error);
    return outcome;
}

Outcome copyAllContents(Request& request) {
    std::optional<Dictionary> contents;
    const bool success = __VeltoIDDBCopyAllContents(&contents);
    if (contents) request.answer(message::kResult, *contents);
    return {success, {}};
}

Outcome check(Request& request) {
    const AccountState state = checkAccountAndDetermineNextAction(request.account(), request.options());
    request.answer(message::kStatus, Value::int64(static_cast<int64_t>(state)));
    return {true, {}};
}

void terminateAfterReply() {
    platform::WorkQueue::main().asyncAfter(kTerminationDelay, [] {
        VELTOID_LOG_FROM(
            kHandlerName, kNotice,
            "Shutting down server after receiving kVeltoIDAuthenticationStatusTerminateServerKey "
            "request.");
        shutDownByCommand();
    });
}

Outcome status(Request& request) {
    const bool terminates = getBool(&request.options(), option::kTerminateServer, false);
    if (terminates) computeRelaunchFromAccounts();
    request.answer(message::kStatus, terminates ? copyDeviceStatusDictionary()
                                                : copyAccountStatusesDictionary(request.options()));
    if (terminates) terminateAfterReply();
    return {true, {}};
}

struct Command {
    int64_t number;
    Outcome (*run)(Request& request);
};

constexpr Command kCommands[] = {
    {command::kPing, ping},
    {command::kSetValue, setValueOrFail},
    {command::kSetValueQuietly, setValueIfPossible},
    {command::kAdd, addAccount},
    {command::kInfo, getMyInfo},
    {command::kFind, findPerson},
    {command::kFindCached, findCachedPerson},
    {command::kList, listAccounts},
    {command::kForget, forgetAccount},
    {command::kCertificate, copyCertificateInformation},
    {command::kVerify, verifyPassword},
    {command::kSetBreadcrumb, setBreadcrumb},
    {command::kGetBreadcrumb, copyBreadcrumb},
    {command::kDatabase, copyAllContents},
    {command::kCheck, check},
    {command::kStatus, status},
};

Outcome dispatch(Request& request) {
    const auto* found = std::find_if(std::begin(kCommands), std::end(kCommands),
                                     [&](const Command& known) { return known.number == request.command(); });
    return found != std::end(kCommands) ? found->run(request) : Outcome();
}

}  // namespace

void handleAuthenticationIPCMessage(platform::IncomingMessage& message) {
    const Transaction guard(kHandlerName);
    Request request(message);
    if (request.command() == command::kTerminate) {
        computeRelaunchFromAccounts();
        return shutDownByCommand();
    }
    const Outcome outcome = dispatch(request);
    request.finish(outcome.success, outcome.error);
}

}  // namespace veltoid
