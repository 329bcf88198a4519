#include "platform/catalog/BundleNames.h"

#include <sys/stat.h>

#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"

namespace qm {

namespace {

constexpr const char* kDisplayNameKey = "MRBundleDisplayName";
constexpr const char* kNameKey = "MRBundleName";

// The strings dictionary for the language; null when there is none.
Value localizedStrings(const std::string& infoFolder, const std::optional<std::string>& language) {
    if (!language || language->find('/') != std::string::npos) {
        return {};
    }
    std::string path = infoFolder + "/" + *language + ".lproj/InfoPlist.strings";
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0) {
        return {};
    }
    auto strings = plist::readFile(path);
    if (!strings || !strings->isDictionary()) {
        systemLogf(kLogNotice, "ignoring localized names in %@: %@", path,
                   strings ? std::string("not a dictionary") : strings.error().text());
        return {};
    }
    return std::move(strings).value();
}

}  // namespace

BundleNames bundleNames(const std::string& infoFolder, const Value& infoDictionary,
                        const std::optional<std::string>& language) {
    Value strings = localizedStrings(infoFolder, language);
    auto pick = [&](const char* key) {
        auto localized = stringAt(strings, key);
        return localized ? localized : stringAt(infoDictionary, key);
    };
    BundleNames names;
    names.localizedShortName = pick(kNameKey);
    names.localizedName = pick(kDisplayNameKey);
    if (!names.localizedName) {
        names.localizedName = names.localizedShortName;
    }
    return names;
}

}  // namespace qm
