#pragma once
// A bundle's names for the user: the localized name is "MRBundleDisplayName",
// else "MRBundleName"; the short name is "MRBundleName". The property list
// <info folder>/<language>.lproj/InfoPlist.strings (beside Info.plist) may
// override either key for the user's language.

#include <optional>
#include <string>

#include "platform/value/Value.h"

namespace qm {

struct BundleNames {
    std::optional<std::string> localizedName;
    std::optional<std::string> localizedShortName;
};

// Reads the strings file when a language is given and the file exists; a
// damaged one is logged and ignored.
BundleNames bundleNames(const std::string& infoFolder, const Value& infoDictionary,
                        const std::optional<std::string>& language);

}  // namespace qm
