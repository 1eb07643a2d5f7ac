// What was asked for on the command line, and how the client ends.
#pragma once

#include <string>
#include <vector>

#include "veltoidctl/Password.h"

namespace veltoidctl {

/// Exit statuses.
inline constexpr int kDone = 0;
inline constexpr int kRefused = 1;
inline constexpr int kWrongUse = 2;
inline constexpr int kAgentUnreachable = 3;

/// What was asked for on the command line.
struct Arguments {
    std::string account;
    PasswordSource password = PasswordSource::Prompt;
    bool json = false;
    /// Ask the server even if the agent's information is fresh.
    bool refresh = false;
    /// Store the account without signing in.
    bool withoutSigningIn = false;
    /// Ask for a certificate at once.
    bool withCertificate = false;
    /// Let the agent get it, and wait for it so long (seconds).
    double waitSeconds = 0;
    /// Have the accounts examined anew, certificates and server included.
    bool examine = false;

    bool wantsCertificate() const { return withCertificate || waitSeconds > 0; }

    /// Print the certificate; the chain has the intermediate certificate as well.
    bool pem = false;
    bool chain = false;
    /// The signed record of validated items instead.
    bool validationRecord = false;
    /// Export as PKCS#12 instead of PEM, under a password or none.
    bool pkcs12 = false;
    bool withoutPassword = false;

    std::string criterion;
    std::vector<std::string> values;
    /// Look only at what the agent remembers.
    bool cached = false;

    /// A breadcrumb's name.
    std::string key;

    /// Files; "-" is standard input or output.
    std::string input = "-";
    std::string output = "-";
    /// Replace a file, or write to a terminal.
    bool force = false;
};

}  // namespace veltoidctl
