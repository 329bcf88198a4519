#include "platform/catalog/PlugInBundleReader.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <ctime>

#include "platform/bundle/BundleDirectory.h"
#include "platform/catalog/BundleLayout.h"
#include "platform/catalog/BundleNames.h"
#include "platform/catalog/PlugInDeclarations.h"
#include "platform/codesign/Entitlements.h"
#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"

namespace qm {

namespace {

constexpr const char* kInfoFileName = "Info.plist";
constexpr const char* kEntitlementsFileName = "Entitlements.plist";

bool isContainerName(const std::string& name) {
    return !name.empty() && name.find('/') == std::string::npos && name.front() != '.';
}

bool makeFolder(const std::string& path) {
    return ::mkdir(path.c_str(), 0700) == 0 || errno == EEXIST;
}

// mkdir -p, for the containers folder itself.
bool makeFolders(const std::string& path) {
    for (std::size_t slash = path.find('/', 1); slash != std::string::npos; slash = path.find('/', slash + 1)) {
        if (!makeFolder(path.substr(0, slash))) {
            return false;
        }
    }
    return makeFolder(path);
}

}  // namespace

BundleFileKeys bundleFileKeys(const std::string& bundlePath) {
    BundleFileKeys keys;
    std::string folder = bundlePath;
    keys.info = changeKeyOf(folder + "/" + kInfoFileName);
    if (!keys.info.exists()) {
        folder = bundlePath + "/Contents";
        keys.info = changeKeyOf(folder + "/" + kInfoFileName);
    }
    if (keys.info.exists()) {
        keys.entitlements = changeKeyOf(folder + "/" + kEntitlementsFileName);
    }
    return keys;
}

std::optional<std::string> makeDataContainer(const std::string& containersDirectory, const Value& infoDictionary,
                                             const std::string& bundlePath) {
    auto executable = stringAt(infoDictionary, "MRBundleExecutable");
    if (!executable || executable->empty()) {
        return std::nullopt;
    }
    auto name = stringAt(infoDictionary, "MRBundleIdentifier");
    if (!name || !isContainerName(*name)) {
        systemLogf(kLogNotice, "no data container for the plug-in bundle at %@: its bundle identifier %@ cannot name one",
                   bundlePath, name ? "\"" + *name + "\"" : std::string("is missing"));
        return std::nullopt;
    }
    std::string container = containersDirectory + "/" + *name;
    if (!makeFolders(containersDirectory) || !makeFolder(container) || !makeFolder(container + "/tmp")) {
        systemLogf(kLogNotice, "no data container for the plug-in bundle at %@: cannot create %@: %@", bundlePath,
                   container, std::strerror(errno));
        return std::nullopt;
    }
    return container;
}

BundleReadResult readPlugInBundle(const std::string& resolvedPath, const BundleReadContext& context) {
    BundleReadResult result;
    const BundleFileKeys keys = bundleFileKeys(resolvedPath);
    auto bundle = BundleDirectory::atPath(resolvedPath);
    if (!bundle) {
        result.reason = "no bundle";
        return result;
    }
    auto info = bundle->infoDictionary();
    if (!info) {
        result.reason = "unreadable Info.plist";
        return result;
    }
    result.outcome = BundleReadOutcome::notAPlugIn;
    if (!declaresPlugIns(*info)) {
        result.reason = "the bundle declares no plug-in";
        return result;
    }
    std::vector<DeclaredPlugIn> declared = declaredPlugIns(*info);
    if (declared.empty()) {
        result.reason = "the bundle declares no identifiable plug-in";
        return result;
    }

    // What cannot be stored cannot be registered (a date beyond what a
    // property list can write, say); refused here, it blocks nothing else.
    if (auto stored = plist::serialize(*info, plist::Format::binary); !stored) {
        result.reason = "its Info dictionary cannot be stored: " + stored.error().text();
        return result;
    }

    CatalogBundle entry;
    entry.path = resolvedPath;
    entry.infoKey = keys.info;
    entry.entitlementsKey = keys.entitlements;
    entry.infoDictionary = *info;
    entry.entitlements = readEntitlements(*bundle);
    if (entry.entitlements && !plist::serialize(*entry.entitlements, plist::Format::binary)) {
        systemLogf(kLogNotice, "entitlements of %@ ignored: they cannot be stored", resolvedPath);
        entry.entitlements.reset();
    }
    entry.bundleIdentifier = stringAt(*info, "MRBundleIdentifier");
    entry.bundleVersion = stringAt(*info, "MRBundleVersion");
    BundleNames names = bundleNames(bundle->infoFolder(), *info, context.language);
    entry.localizedName = std::move(names.localizedName);
    entry.localizedShortName = std::move(names.localizedShortName);
    entry.dataContainerPath = makeDataContainer(context.containersDirectory, *info, resolvedPath);
    entry.applicationPath = containingApplicationPath(resolvedPath);
    const auto now = static_cast<std::int64_t>(std::time(nullptr));
    for (auto& plugIn : declared) {
        entry.plugIns.push_back(
            {Uuid::random(), std::move(plugIn.identifier), std::move(plugIn.extensionPoint), plugIn.plugInDictionary, now});
    }
    result.outcome = BundleReadOutcome::plugIn;
    result.entry = std::move(entry);
    return result;
}

}  // namespace qm
