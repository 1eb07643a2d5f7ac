// Errors: a domain, a code and a dictionary that explains.
#pragma once

#include <optional>

#include "Values/Value.h"

namespace veltoid {

/// The agent's own errors.
inline constexpr std::string_view kIdentityErrorDomain = "HWIdentityErrorDomain";
/// Faults that the identity server answered; the code is the fault code.
inline constexpr std::string_view kXMLErrorDomain = "HWXMLErrorDomain";
/// Statuses of the platform's own services.
inline constexpr std::string_view kOSStatusErrorDomain = "HWOSStatusErrorDomain";

// Standard keys of the user information.
inline constexpr std::string_view kErrorFailureReasonKey = "HWLocalizedFailureReason";
inline constexpr std::string_view kErrorDescriptionKey = "HWLocalizedDescription";
inline constexpr std::string_view kErrorRecoverySuggestionKey = "HWLocalizedRecoverySuggestion";
inline constexpr std::string_view kErrorUnderlyingErrorKey = "HWUnderlyingError";

/// Codes of kIdentityErrorDomain.
namespace identity_error {
inline constexpr int64_t kNotYet = 99;
inline constexpr int64_t kSignInFailed = 1;
/// No answer from the server.
inline constexpr int64_t kNoResponse = -1;
/// The same code, where nothing more precise is known.
inline constexpr int64_t kUnspecified = -1;
inline constexpr int64_t kNoAccountForRequest = -2;
inline constexpr int64_t kAgentCommunicationFailure = -11;
inline constexpr int64_t kInvalidParameters = -99;
inline constexpr int64_t kUnknown = -100;
inline constexpr int64_t kInvalidAccountOrPassword = -101;
inline constexpr int64_t kAccountLogonDisabled = -102;
inline constexpr int64_t kServerCannotBeReached = -103;
inline constexpr int64_t kServerProtocol = -104;
inline constexpr int64_t kServerNoLongerSupported = -105;
inline constexpr int64_t kNoCertificateForAccount = -106;
inline constexpr int64_t kNoAccounts = -107;
inline constexpr int64_t kUnknownAccount = -108;
inline constexpr int64_t kUnsupportedFeature = -114;
}  // namespace identity_error

struct Error {
    String domain;
    int64_t code = 0;
    Dictionary userInfo;

    friend bool operator==(const Error& a, const Error& b) {
        return a.domain == b.domain && a.code == b.code && a.userInfo == b.userInfo;
    }
};

/// Where an operation puts its error: filled only on failure; null when the caller does not ask.
using ErrorOut = std::optional<Error>*;

/// Texts for people inside an error; null ones are left out.
struct ErrorTexts {
    String failureReason;
    String description;
    String recoverySuggestion;
};

/// An error of kIdentityErrorDomain whose user information is a copy of `userInfo` plus the given texts and
/// "function", "file" ("-" when null) and "line". Without a reason or a description it gets the description
/// of its code. Any thread.
Error makeError(int64_t code, const ErrorTexts& texts, const Dictionary& userInfo, const char* function,
                const char* file, int line);

/// The same of kOSStatusErrorDomain, with the code -1.
Error makeStatusError(const String& description, const char* function, const char* file, int line);

/// "Domain", "Code" and "UserInfo", an underlying error being converted too.
Dictionary errorToDictionary(const Error& error);

/// None unless "Domain" is a String and "Code" an integer Number. An underlying-error entry that is no
/// Dictionary is kept as it is.
std::optional<Error> dictionaryToError(const Value& dictionary);

/// Fills an out-parameter when there is one.
template <typename Output>
void fill(Output* out, Output value) {
    if (out != nullptr) *out = std::move(value);
}

inline void fillError(ErrorOut out, std::optional<Error> error) { fill(out, std::move(error)); }

/// Hands out the error of a failed operation; false.
inline bool failWith(ErrorOut out, Error error) {
    fillError(out, std::move(error));
    return false;
}

}  // namespace veltoid

/// An error of kIdentityErrorDomain that names the place where it was made, by default the function.
#define VELTOID_ERROR(code) VELTOID_ERROR_FROM(__func__, code)
#define VELTOID_ERROR_FROM(function, code) \
    ::veltoid::makeError((code), {}, {}, function, __FILE_NAME__, __LINE__)
