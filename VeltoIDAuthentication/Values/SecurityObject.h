// Certificates, keys, identities and trust evaluations as values: what the log formatter needs to know of
// them.
#pragma once

#include <variant>
#include <vector>

#include "Values/Value.h"

namespace veltoid {

struct CertificateDescription {
    /// Null when the certificate has no summary.
    String subjectSummary;
};

struct KeyDescription {
    String text;
};

struct IdentityDescription {
    std::optional<CertificateDescription> certificate;
    std::optional<KeyDescription> privateKey;
};

struct TrustDescription {
    /// 0 to 7: invalid, proceed, confirm, deny, unspecified, recoverable failure, fatal failure, other error.
    std::optional<int> result;
    std::vector<CertificateDescription> certificates;
};

/// An object of a kind that the formatter does not know.
struct UnknownDescription {
    uint64_t typeID = 0;
    String text;
};

struct SecurityObject {
    std::variant<CertificateDescription, KeyDescription, IdentityDescription, TrustDescription,
                 UnknownDescription>
        description;

    friend bool operator==(const SecurityObject& a, const SecurityObject& b) { return &a == &b; }
};

inline Value Value::object(SecurityObject object) { return boxed(Kind::Object, std::move(object)); }
inline const SecurityObject* Value::asObject() const { return unboxed<SecurityObject>(Kind::Object); }

}  // namespace veltoid
