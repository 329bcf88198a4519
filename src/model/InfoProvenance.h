#pragma once
// Where each value of a plug-in's merged Info dictionary came from: the
// bundle's own Info dictionary, the SDK's defaults, both (a "Shared" set is
// their union) or the canonical values filled in last. Told by comparing the
// merged dictionary with its two sources, so it always describes what the
// merge actually did.

#include <optional>
#include <string>
#include <vector>

#include "platform/value/Value.h"

struct InfoOrigin {
    std::vector<std::string> keyPath;  // from the top of the Info dictionary
    qm::Value value;                   // a leaf: anything but a non-empty dictionary
    enum class Source { bundle, sdk, bundleAndSdk, canonical } source;
};

// `merged` is the Info dictionary after the SDK merge and canonical values,
// `bundle` the same bundle's before them, `sdk` the SDK's dictionary (none
// when no SDK was merged). In key order, depth first.
std::vector<InfoOrigin> infoProvenance(const qm::Value& merged, const qm::Value& bundle,
                                       const std::optional<qm::Dictionary>& sdk);
