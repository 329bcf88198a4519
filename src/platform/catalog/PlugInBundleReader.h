#pragma once
// Reads one plug-in bundle from disk into a new catalog entry: the Info
// dictionary, the declared plug-ins (each with a new UUID and today's date),
// the trust-checked entitlements, names and the data container, which it
// creates. Files are stat'ed before they are read, so a change made during
// the read shows at the next comparison of keys. Safe on any thread.

#include <optional>
#include <string>

#include "platform/catalog/CatalogEntry.h"

namespace qm {

struct BundleReadContext {
    std::optional<std::string> language;  // for InfoPlist.strings
    std::string containersDirectory;      // data containers are made here
};

enum class BundleReadOutcome {
    plugIn,      // entry holds the bundle
    unreadable,  // no bundle, or an Info file that does not parse (yet)
    notAPlugIn,  // a bundle whose Info declares no identifiable plug-in
};

struct BundleReadResult {
    BundleReadOutcome outcome = BundleReadOutcome::unreadable;
    std::optional<CatalogBundle> entry;  // source and added are left for the caller
    std::string reason;                  // why it is not a plug-in
};

struct BundleFileKeys {
    ChangeKey info;          // zero when the directory holds no Info file
    ChangeKey entitlements;  // zero when there is no Entitlements file
};
// The keys of the Info file (flat, else Contents/) and the Entitlements file beside it.
BundleFileKeys bundleFileKeys(const std::string& bundlePath);

BundleReadResult readPlugInBundle(const std::string& resolvedPath, const BundleReadContext& context);

// Creates <containersDirectory>/<bundle identifier> and its tmp/ for a bundle
// that names an executable; nothing for one that names none (a data
// plug-in). A name that is empty, holds "/" or starts with "." is refused
// with a log line, as is a folder that cannot be made.
std::optional<std::string> makeDataContainer(const std::string& containersDirectory, const Value& infoDictionary,
                                             const std::string& bundlePath);

}  // namespace qm
