#pragma once
// A libplist tree as a qm::Value (the mapping is described in PropertyList.h).

#include <plist/plist.h>

#include "platform/error/Error.h"
#include "platform/value/Value.h"

namespace qm::plist {

// Errors name where in the tree they lie. The tree must already have passed
// the structure checks; nesting is limited again here all the same.
qm::Result<qm::Value> valueFromPlist(plist_t root);

}  // namespace qm::plist
