#include "VeltoIDXMLServerCommunications/Invoke.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>

#include "Logging/Log.h"
#include "Platform/runtime/Clock.h"
#include "Platform/runtime/Lifetime.h"
#include "Platform/runtime/SystemVersion.h"
#include "Protocol/RecordKeys.h"
#include "Values/DictionaryAccess.h"
#include "VeltoIDAuthenticationDB/AccountRecords.h"
#include "VeltoIDAuthenticationDB/MetaInfo.h"
#include "VeltoIDAuthenticationDB/Store.h"
#include "VeltoIDXMLServerCommunications/WireKeys.h"
#include "XMLRPC/XMLRPCShim.h"

namespace veltoid {
namespace {

/// The shortest interval that is followed (seconds).
constexpr int32_t kMinLaunchInterval = 15;

ProcessHooks& hooks() { return platform::Lifetime::current().state<ProcessHooks>(); }

String frameworkVersionText() {
    char buffer[32];
    std::snprintf(buffer, sizeof buffer, "%g", kVeltoIDDBAccessorVersion);
    return buffer;
}

/// The server writes the text "NULL" where a value is to be removed.
Value commandValue(const Value& value) {
    return value.asText() == std::string_view("NULL") ? Value::null() : value;
}

void applyValidityDuration(VeltoIDAuthenticationSessionInfo& session, const Value& duration) {
    std::optional<double> seconds = duration.asDouble();
    if (const String text = duration.asString()) seconds = std::strtod(text.text().c_str(), nullptr);
    // No session lasts for ever, whatever the server says.
    if (seconds) session.fValidityDuration = std::isfinite(*seconds) ? std::max(*seconds, 0.0) : 0;
}

void applyRelaunch(const Dictionary& reply) {
    const int32_t interval = getInt32(&reply, wire::kNextLaunchInterval, 0);
    if (interval < 1) return;
    const double date = platform::now() + std::max(interval, kMinLaunchInterval);
    VELTOID_LOG_FROM("xmlInvoke", kNotice, "Received 'NextLaunchTimeInterval' == ", interval,
                     " from server, so setting NextLaunchDate to ", Value::date(date));
    hooks().scheduleRequestedLaunch(date);
}

void applyFlushAndExit(const Dictionary& reply) {
    if (!getBool(&reply, wire::kFlushAndExit, false)) return;
    VELTOID_LOG_FROM(
        "xmlInvoke", kNotice,
        "Received 'FlushAndExit' from server, so flushing database to disk and immediately exiting.");
    __VeltoIDDBSynchronize();
    hooks().endProcess();
}

Dictionary dictionaryIn(const Dictionary& reply, std::string_view key) {
    const Dictionary* found = reply.dictionary(key);
    return found != nullptr ? *found : Dictionary();
}

void applyCommands(VeltoIDAuthenticationSessionInfo& session, const Dictionary& reply) {
    applyValidityDuration(session, reply[wire::kSessionValidity]);
    Dictionary metaInformation = dictionaryIn(reply, wire::kMetaInformation);
    const Dictionary accountInformation = dictionaryIn(reply, wire::kAccountInformation);
    if (metaInformation.remove(kVeltoIDDBServerURLKey) || reply.contains(wire::kNewURL) ||
        accountInformation.contains(kVeltoIDAccountServerURLKey))
        VELTOID_LOG_FROM("xmlInvoke", kNotice,
                         "Ignoring a new server URL in a reply: credentials are not redirected by a reply.");
    // A dictionary would be the section of some account.
    for (const auto& [key, value] : metaInformation)
        if (!value.isDictionary()) __VeltoIDDBSetMetaInfoValue(nullptr, key, commandValue(value));
    for (const auto& [key, value] : recordValuesFromServer(session.fAccountName, accountInformation))
        __VeltoIDDBSetAccountValue(session.fAccountName, key, commandValue(value), Notify::No);
    applyRelaunch(reply);
    applyFlushAndExit(reply);
}

}  // namespace

void setProcessHooks(ProcessHooks given) { hooks() = std::move(given); }

void requestRelaunch(double date) { hooks().scheduleRelaunch(date); }

Dictionary createCallParameters(const String& accountName, const String& sessionID,
                                const Dictionary& options) {
    Dictionary parameters;
    parameters.set(wire::kSession, sessionID);
    parameters.set(wire::kProtocolVersion, Value::int64(kVeltoIDAuthProtocolVersion));
    parameters.set(wire::kFrameworkVersion, frameworkVersionText());
    parameters.set(wire::kClientTime, Value::date(platform::now()));
    const platform::SystemVersion& system = platform::systemVersion();
    if (system.productName) parameters.set(wire::kProductName, *system.productName);
    if (system.buildVersion) parameters.set(wire::kSystemVersion, *system.buildVersion);
    const auto isOn = [&](std::string_view key) {
        return __VeltoIDDBCopyMetaInfoValue(accountName, options, key, Value::Kind::Boolean).asBoolean() ==
               true;
    };
    if (isOn(kVeltoIDMetaSendServerMetaInformationItemsKey))
        if (const auto information = __VeltoIDDBCopyMetaInformation(accountName, options))
            parameters.set(wire::kMetaInformation, *information);
    if (isOn(kVeltoIDMetaSendServerAccountInformationItemsKey)) {
        AccountRecord record;
        if (__VeltoIDDBCopyVeltoIDAccount(accountName, &record))
            parameters.set(wire::kAccountInformation, record.values());
    }
    return parameters;
}

Dictionary recordValuesFromServer(const String& accountName, const Dictionary& values) {
    Dictionary taken = values;
    taken.remove(kVeltoIDAccountServerURLKey);
    const Value& name = values[kVeltoIDAccountNameKey];
    if (!taken.remove(kVeltoIDAccountNameKey)) return taken;
    taken.set(kVeltoIDAccountServerNameKey, name == Value(accountName) ? Value::null() : name);
    return taken;
}

bool xmlInvoke(VeltoIDAuthenticationSessionInfo& session, const String& methodName,
               const Dictionary& parameters, std::optional<Dictionary>* result, ErrorOut error) {
    std::optional<Dictionary> reply;
    const bool succeeded = xmlInvoke(session.fServerURL, methodName, parameters, &reply, error);
    if (succeeded && reply) applyCommands(session, *reply);
    if (result != nullptr) *result = std::move(reply);
    return succeeded;
}

}  // namespace veltoid
