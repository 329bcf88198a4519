#pragma once
// "list" (an extension request, for clients that are not sandboxed): the
// registered plug-ins, optionally of one extension point, a page at a time,
// each valid or with the reason it is not, and the bundles the catalog
// refused. For tools, never for hosts: nothing is filtered by election,
// visibility or holds.

#include "registry/Request.h"

// {"point"?: string, "offset"?: uint, "limit"?: uint <= kListPageLimit}
// answers {"plugins": [{"uuid"?, "identifier", "path", "point", "version",
// "valid", "reason"?, "election"?}], "total"}.
inline constexpr std::uint64_t kListPageLimit = 1000;

Reply listPlugIns(RequestContext& context);
