#pragma once
// A qm::Value as a libplist tree (the mapping is described in PropertyList.h).

#include "platform/error/Error.h"
#include "platform/plist/LibplistSupport.h"
#include "platform/value/Value.h"

namespace qm::plist {

// Errors name where in the value they lie.
qm::Result<PlistPtr> plistFromValue(const qm::Value& value);

}  // namespace qm::plist
