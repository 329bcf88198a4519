#pragma once
// The code-signing service: a bundle's entitlements.
//
// There are no code signatures here. A bundle's entitlements are the
// dictionary in Entitlements.plist in its info folder (beside Info.plist),
// honoured only when nobody but root or this process's own user could have
// put it there: the file and its folder are owned by root or by the
// effective user and are neither group- nor world-writable, and the file is
// a regular file reached without following a symbolic link.

#include <optional>

#include "platform/bundle/BundleDirectory.h"
#include "platform/value/Value.h"

namespace qm {

// The entitlements dictionary; nothing when there is no Entitlements.plist
// (silently) or when it is untrusted, unreadable or not a dictionary (one
// log line each time).
std::optional<qm::Value> readEntitlements(const BundleDirectory& bundle);

}  // namespace qm
