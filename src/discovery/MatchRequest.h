#pragma once
// "match": the plug-ins a host may use among those its rules select, as
// plug-in forms, duplicates of one identifier resolved, replacement marked,
// each with the user's annotation. With "explain" (protocol 3, a client that
// is not sandboxed) the reply also says, for every candidate left out, the
// step that dropped it and why.
//
// Candidates, and so the reply, come in path, identifier, UUID order.

#include "registry/Request.h"

// Discovery flags ("flags" of "match").
enum QMDiscoveryFlags : std::uint64_t {
    QMDiscoverVersions = 0x1,
    QMDiscoverDuplicates = 0x4,
    QMDiscoverSystemOnly = 0x8,
    QMDiscoverAll = 0x200,
};

// Not more explanations than this in one reply; then "explanationsTruncated".
inline constexpr std::size_t kMaxExplanations = 1000;

Reply matchPlugIns(RequestContext& context);
