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

}  // namespace

Value::Value(veltoid::Error error) { *this = boxed(Kind::Error, std::move(error)); }

const Error* Value::asError() const { return unboxed<veltoid::Error>(Kind::Error); }

Error makeError(int64_t code, const ErrorTexts& texts, const Dictionary& userInfo, const char* function,
                const char* file, int line) {
    Error error{String(kIdentityErrorDomain), code, userInfo};
    error.userInfo.set(kErrorFailureReasonKey, texts.failureReason);
    error.userInfo.set(kErrorDescriptionKey, texts.description);
    error.userInfo.set(kErrorRecoverySuggestionKey, texts.recoverySuggestion);
    error.userInfo.set("function", function != nullptr ? function : "-");
    error.userInfo.set("file", file != nullptr ? file : "-");
    error.userInfo.set("line", Value::int64(line));
    return error;
}

Dictionary errorToDictionary(const Error& error) { return toDictionary(error, 0); }

std::optional<Error> dictionaryToError(const Value& dictionary) { return fromDictionary(dictionary, 0); }

}  // namespace veltoid
