#include "Logging/Describe.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <sstream>
#include <vector>

#include "Platform/encoding/HexText.h"
#include "Platform/runtime/Clock.h"
#include "Values/Error.h"
#include "Values/SecurityObject.h"

namespace veltoid {
namespace {

/// Codes of kIdentityErrorDomain.
constexpr std::pair<int64_t, const char*> kErrorNames[] = {
    {identity_error::kUnknown, "kHWIdentityVeltoIDUnknownError"},
    {identity_error::kInvalidParameters, "kHWIdentityInvalidParametersErr"},
    {-10, "kHWIdentityCertificateDoesNotContainRequestedValueErr"},
    {identity_error::kAgentCommunicationFailure, "kHWIdentityAgentCommunicationFailure"},
    {identity_error::kInvalidAccountOrPassword, "kHWIdentityVeltoIDInvalidAccountOrPasswordErr"},
    {identity_error::kAccountLogonDisabled, "kHWIdentityVeltoIDAccountLogonDisabledErr"},
    {identity_error::kServerCannotBeReached, "kHWIdentityVeltoIDServerCannotBeReachedErr"},
    {identity_error::kServerProtocol, "kHWIdentityVeltoIDServerProtocolErr"},
    {identity_error::kServerNoLongerSupported, "kHWIdentityVeltoIDServerNoLongerSupportedErr"},
    {identity_error::kNoCertificateForAccount, "kHWIdentityVeltoIDNoCertificateForAccountErr"},
    {identity_error::kNoAccounts, "kHWIdentityVeltoIDNoAccounts"},
    {identity_error::kUnknownAccount, "kHWIdentityUnknownAccountErr"},
    {-110, "kHWIdentityVeltoIDValidationRecordCorruptErr"},
    {-111, "kHWIdentityVeltoIDValidationRecordBadVersionErr"},
    {-112, "kHWIdentityVeltoIDValidationRecordValidAsOfNotCurrentErr"},
    {-113, "kHWIdentityVeltoIDValidationRecordTrustNotEstablishedErr"},
    {identity_error::kUnsupportedFeature, "kHWIdentityUnsupportedFeatureOnThisDeviceErr"},
};

constexpr const char* kTrustResultNames[] = {
    "TrustResultInvalid",           "TrustResultProceed",
    "TrustResultConfirm",           "TrustResultDeny",
    "TrustResultUnspecified",       "TrustResultRecoverableTrustFailure",
    "TrustResultFatalTrustFailure", "TrustResultOtherError",
};

constexpr double kMaxRelativeWording = 300;

void append(std::string& text, const Value& value);

void appendQuoted(std::string& text, std::string_view bytes) {
    text += '"';
    appendEscapedBytes(text, bytes.data(), bytes.size());
    text += '"';
}

void appendArray(std::string& text, const Array& array) {
    text += "( ";
    bool first = true;
    for (const Value& element : array) {
        if (!std::exchange(first, false)) text += ", ";
        append(text, element);
    }
    text += ")";
}

bool lessIgnoringCase(std::string_view a, std::string_view b) {
    const auto lower = [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c + 32) : c; };
    return std::lexicographical_compare(a.begin(), a.end(), b.begin(), b.end(), [&](char x, char y) {
        return static_cast<unsigned char>(lower(x)) < static_cast<unsigned char>(lower(y));
    });
}

void appendDictionary(std::string& text, const Dictionary& dictionary) {
    std::vector<const Dictionary::Entry*> entries;
    for (const Dictionary::Entry& entry : dictionary) entries.push_back(&entry);
    std::stable_sort(entries.begin(), entries.end(), [](const auto* a, const auto* b) {
        return lessIgnoringCase(a->key.view(), b->key.view());
    });
    text += "{ ";
    bool first = true;
    for (const Dictionary::Entry* entry : entries) {
        if (!std::exchange(first, false)) text += ", ";
        appendQuoted(text, entry->key.view());
        text += '=';
        append(text, entry->value);
    }
    text += " }";
}

void appendData(std::string& text, std::span<const uint8_t> bytes) {
    const bool printable = std::all_of(bytes.begin(), bytes.end(), [](uint8_t byte) {
        return (byte >= 32 && byte <= 126) || byte == '\t' || byte == '\n' || byte == '\r';
    });
    text += '$';
    if (!printable) return void(text += platform::hexText(bytes));
    appendQuoted(text, {reinterpret_cast<const char*>(bytes.data()), bytes.size()});
}

void appendDate(std::string& text, double date) {
    const double distance = date - platform::now();
    if (distance >= -1 && distance <= 0) {
        text += "now-ish ";
    } else if (distance > 0 && distance <= 1) {
        text += "soon-ish ";
    } else if (distance > 1 && distance <= kMaxRelativeWording) {
        text += (std::ostringstream() << distance << " seconds from now, ").str();
    } else if (distance < -1 && distance >= -kMaxRelativeWording) {
        text += std::to_string(std::llround(-distance)) + " seconds ago, ";
    }

    std::tm calendar{};
    // Years beyond what the calendar can hold: nothing sensible to print.
    if (!std::isfinite(date) || std::abs(date) > 6e16) return void(text += "?");
    const auto seconds = static_cast<time_t>(std::floor(date));
    if (localtime_r(&seconds, &calendar) == nullptr) return void(text += "?");
    std::array<char, 64> buffer{};
    const int length = std::snprintf(buffer.data(), buffer.size(), "%04d/%02d/%02d %02d:%02d:%02d",
                                     calendar.tm_year + 1900, calendar.tm_mon + 1, calendar.tm_mday,
                                     calendar.tm_hour, calendar.tm_min, calendar.tm_sec);
    text.append(buffer.data(), static_cast<size_t>(length));
}

void appendFloating(std::string& text, double number) {
    if (std::isnan(number)) return void(text += "NAN");
    text += (std::ostringstream() << std::showpoint << number).str();
}

/// The bytes of a number of a kind without a decimal form, in memory order.
void appendRawNumber(std::string& text, uint64_t number) {
    std::array<uint8_t, sizeof number> bytes{};
    std::memcpy(bytes.data(), &number, sizeof number);
    const auto* firstUsed = std::find_if(bytes.begin(), bytes.end(), [](uint8_t byte) { return byte != 0; });
    text += "0x";
    if (firstUsed == bytes.end()) return void(text += '0');
    text += platform::hexText({firstUsed, bytes.end()}, platform::kUpperCaseDigits);
}

void appendNumber(std::string& text, const Value& number) {
    switch (*number.numberKind()) {
        case NumberKind::Float32:
        case NumberKind::Float64:
            return appendFloating(text, *number.asDouble());
        case NumberKind::UInt64:
            return appendRawNumber(text, *number.asUInt64());
        default:
            text += std::to_string(*number.asInt64());
    }
}

void appendURL(std::string& text, const std::pair<String, String>& url) {
    append(text, url.first);
    if (!url.second) return;
    text += " base:";
    append(text, url.second);
}

void appendError(std::string& text, const Error& error) {
    text += "ERROR:";
    append(text, error.domain);
    text += " #" + std::to_string(error.code);
    if (error.domain.view() == kIdentityErrorDomain) {
        const auto* name = std::find_if(std::begin(kErrorNames), std::end(kErrorNames),
                                        [&](const auto& entry) { return entry.first == error.code; });
        if (name != std::end(kErrorNames)) text.append(" ").append(name->second);
    }
    if (error.userInfo.empty()) return;
    text += ' ';
    appendDictionary(text, error.userInfo);
}

/// Writes the text of each kind of security object.
struct ObjectWriter {
    std::string& text;

    void operator()(const CertificateDescription& certificate) const {
        text += "CERT:";
        if (certificate.subjectSummary) append(text, certificate.subjectSummary);
        text += certificate.subjectSummary ? "  " : " ";
    }
    void operator()(const KeyDescription& key) const {
        text += "KEY:";
        append(text, key.text);
    }
    void operator()(const IdentityDescription& identity) const {
        text += "[ ";
        if (identity.certificate) (*this)(*identity.certificate);
        if (identity.privateKey) (*this)(*identity.privateKey);
        text += "] ";
    }
    void operator()(const TrustDescription& trust) const {
        text += "TRUSTOBJ:[ ";
        if (trust.result) text += resultName(*trust.result);
        text += " CERTs:[";
        for (size_t i = 0; i < trust.certificates.size(); ++i) {
            if (i > 0) text += ", ";
            (*this)(trust.certificates[i]);
        }
        text += "]";
    }
    void operator()(const UnknownDescription& unknown) const {
        text += "Unknown QVType id=" + std::to_string(unknown.typeID);
        append(text, unknown.text);
    }

    static std::string resultName(int result) {
        if (result >= 0 && result < static_cast<int>(std::size(kTrustResultNames)))
            return kTrustResultNames[result];
        return "TrustResultUnknown," + std::to_string(result);
    }
};

void append(std::string& text, const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Absent:
            return void(text += "[ NULL ] ");
        case Value::Kind::Null:
            return void(text += "NULL");
        case Value::Kind::Boolean:
            return void(text += *value.asBoolean() ? "true" : "false");
        case Value::Kind::Number:
            return appendNumber(text, value);
        case Value::Kind::Date:
            return appendDate(text, *value.asDate());
        case Value::Kind::String:
            return appendQuoted(text, *value.asText());
        case Value::Kind::Data:
            return appendData(text, value.asData().bytes());
        case Value::Kind::Array:
            return appendArray(text, *value.asArray());
        case Value::Kind::Dictionary:
            return appendDictionary(text, *value.asDictionary());
        case Value::Kind::URL:
            return appendURL(text, *value.asURL());
        case Value::Kind::UUID:
            return appendData(text, *value.asUUID());
        case Value::Kind::Error:
            return appendError(text, *value.asError());
        case Value::Kind::Object:
            return std::visit(ObjectWriter{text}, value.asObject()->description);
    }
}

}  // namespace

std::string describeValue(const Value& value) {
    std::string text;
    append(text, value);
    return text;
}

void appendEscapedBytes(std::string& text, const char* bytes, size_t length) {
    for (size_t i = 0; i < length; ++i) {
        const auto byte = static_cast<unsigned char>(bytes[i]);
        if (byte >= 32) {
            text += bytes[i];
        } else if (byte == 0) {
            text += "(null)";
        } else {
            text += '\\';
            text += byte == '\t'   ? 't'
                    : byte == '\n' ? 'n'
                    : byte == '\r' ? 'r'
                                   : static_cast<char>(byte + 96);
        }
    }
}

}  // namespace veltoid
