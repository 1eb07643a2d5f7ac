#include "Values/Error.h"

namespace veltoid {
namespace {

constexpr std::string_view kDomainKey = "Domain";
constexpr std::string_view kCodeKey = "Code";
constexpr std::string_view kUserInfoKey = "UserInfo";

/// Errors may have underlying errors, and those again; deeper chains are cut.
constexpr int kMaxUnderlyingErrors = 16;

Dictionary toDictionary(const Error& error, int depth) {
    Dictionary userInfo = error.userInfo;
    if (const Error* underlying = userInfo[kErrorUnderlyingErrorKey].asError()) {
        if (depth < kMaxUnderlyingErrors) {
            userInfo.set(kErrorUnderlyingErrorKey, toDictionary(*underlying, depth + 1));
        } else {
            userInfo.remove(kErrorUnderlyingErrorKey);
        }
    }
    return {{kDomainKey, error.domain}, {kCodeKey, Value::int64(error.code)}, {kUserInfoKey, userInfo}};
}

std::optional<Error> fromDictionary(const Value& value, int depth) {
    const Dictionary* dictionary = value.asDictionary();
    if (dictionary == nullptr) return std::nullopt;
    const String domain = dictionary->string(kDomainKey);
    const std::optional<int64_t> code = (*dictionary)[kCodeKey].asInt64();
    if (!domain || !code) return std::nullopt;

    Error error{domain, *code, {}};
    if (const Dictionary* userInfo = dictionary->dictionary(kUserInfoKey)) error.userInfo = *userInfo;
    if (depth < kMaxUnderlyingErrors) {
        if (auto underlying = fromDictionary(error.userInfo[kErrorUnderlyingErrorKey], depth + 1))
            error.userInfo.set(kErrorUnderlyingErrorKey, std::move(*underlying));
    }
    return error;
}

/// What happened, as far as the code alone tells.
const char* descriptionOf(int64_t code) {
    switch (code) {
        case identity_error::kNotYet:
            return "It is not time for that yet";
        case identity_error::kSignInFailed:
            return "The server's answer to the sign-in is none";
        case identity_error::kUnspecified:
            return "The stored accounts cannot be read or changed at the moment";
        case identity_error::kNoAccountForRequest:
            return "There is no signed-in account on this device to ask the server with";
        case identity_error::kInvalidParameters:
            return "An account name, a password or another argument is missing";
        case identity_error::kInvalidAccountOrPassword:
            return "The server did not accept the account or its password";
        case identity_error::kAccountLogonDisabled:
            return "The server has disabled the account";
        case identity_error::kServerCannotBeReached:
            return "The server has asked not to be contacted for a while";
        case identity_error::kServerProtocol:
            return "The server and this agent do not understand each other";
        case identity_error::kServerNoLongerSupported:
            return "The server no longer supports this agent";
        case identity_error::kNoCertificateForAccount:
            return "The stored certificates cannot be read";
        case identity_error::kNoAccounts:
            return "There are no accounts on this device";
        case identity_error::kUnknownAccount:
            return "There is no such account on this device";
        case identity_error::kUnsupportedFeature:
            return "This device does not support that";
        default:
            return "It could not be done";
    }
}

}  // namespace

Value::Value(veltoid::Error error) { *this = boxed(Kind::Error, std::move(error)); }

const Error* Value::asError() const { return unboxed<veltoid::Error>(Kind::Error); }

Error makeError(int64_t code, const ErrorTexts& texts, const Dictionary& userInfo, const char* function,
                const char* file, int line) {
    Error error{String(kIdentityErrorDomain), code, userInfo};
    error.userInfo.set(kErrorFailureReasonKey, texts.failureReason);
    error.userInfo.set(kErrorDescriptionKey, texts.description);
    error.userInfo.set(kErrorRecoverySuggestionKey, texts.recoverySuggestion);
    if (!error.userInfo.contains(kErrorFailureReasonKey) && !error.userInfo.contains(kErrorDescriptionKey))
        error.userInfo.set(kErrorDescriptionKey, descriptionOf(code));
    error.userInfo.set("function", function != nullptr ? function : "-");
    error.userInfo.set("file", file != nullptr ? file : "-");
    error.userInfo.set("line", Value::int64(line));
    return error;
}

Error makeStatusError(const String& description, const char* function, const char* file, int line) {
    Error error = makeError(-1, {{}, description, {}}, {}, function, file, line);
    error.domain = kOSStatusErrorDomain;
    return error;
}

Dictionary errorToDictionary(const Error& error) { return toDictionary(error, 0); }

std::optional<Error> dictionaryToError(const Value& dictionary) { return fromDictionary(dictionary, 0); }

}  // namespace veltoid
