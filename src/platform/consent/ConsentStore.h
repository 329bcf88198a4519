#pragma once
// The PVC consent service: the consent services granted to applications,
// kept per user in the property list $XDG_DATA_HOME/ovaro/Consent.plist:
//   { <application bundle identifier>: { <consent service identifier>: <granted> } }
// The file is read afresh on every query, so a grant or a withdrawal counts
// at once. Thread-safe; blocks on the file read.

#include <string>
#include <vector>

#include "platform/env/Environment.h"
#include "platform/error/Error.h"

namespace qm {

// The consent service that lets a keyboard reach the network.
inline constexpr const char* kKeyboardNetworkConsentService = "ovaro.pvc.keyboard-network";

// Errors that are not the operating system's carry this domain.
inline constexpr const char* kConsentErrorDomain = "consent";
inline constexpr int kConsentErrorDamaged = 1;  // the file or the application's entry has the wrong shape

struct ConsentRecord {
    std::string service;
    bool granted = false;  // only a Boolean true grants
    bool operator==(const ConsentRecord&) const = default;
};

// The application's records, by service identifier. No file, or no entry
// for the application: no records. Failures: a file that cannot be read (a
// posix error), does not parse (a plist error), or whose root or whose entry
// for the application is not a dictionary (kConsentErrorDamaged).
Result<std::vector<ConsentRecord>> consentRecordsForApplication(const std::string& applicationIdentifier,
                                                                const std::string& consentFile = consentStorePath());

}  // namespace qm
