#include "model/OfflinePlugIns.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <limits>
#include <utility>

#include "model/QMError.h"
#include "platform/bundle/BundleDirectory.h"
#include "platform/catalog/BundleLayout.h"
#include "platform/catalog/PlugInDeclarations.h"
#include "platform/env/Environment.h"
#include "platform/file/PathFacts.h"
#include "platform/plist/PropertyList.h"

namespace {

using qm::stringAt;

// The catalog reads the configuration before any normalization: the top
// dictionary is "VTExtension", else the old style's "Quamber".
struct DeclaredTop {
    qm::Value top;
    bool oldStyle = false;
};

DeclaredTop declaredTop(const qm::Value& info) {
    if (const qm::Value* top = info.get(qmkey::kTop)) {
        return {*top, false};
    }
    if (const qm::Value* top = info.get(qmkey::kOldTop)) {
        return {*top, true};
    }
    return {};
}

qm::Error notAPlugInBundle(const std::string& path, const std::string& why) {
    return QMErrorWithFormat(kQMErrorPath, "no plug-in bundle at %@: %@", path, why);
}

qm::Error applicationError(const std::string& path) {
    std::string plugIns;
    for (const std::string& folder : qm::plugInsFoldersOf(path)) {
        for (const std::string& plugIn : qm::subdirectoriesOf(folder)) {
            plugIns += (plugIns.empty() ? "" : ", ") + plugIn;
        }
    }
    return QMErrorWithFormat(kQMErrorPath, "%@ is an application, not a plug-in bundle; its plug-ins: %@", path,
                             plugIns.empty() ? std::string("none") : plugIns);
}

// The bundle directory at path, or which of the ways a path is no bundle.
qm::Result<qm::BundleDirectory> bundleAt(const std::string& path) {
    struct stat facts {};
    if (::stat(path.c_str(), &facts) != 0) {
        return notAPlugInBundle(path, errno == ENOENT ? "no such path" : std::strerror(errno));
    }
    if (!S_ISDIR(facts.st_mode)) {
        return notAPlugInBundle(path, "not a directory");
    }
    auto resolved = qm::resolvedPath(path);
    if (!resolved.ok()) {
        return notAPlugInBundle(path, resolved.error().text());
    }
    if (auto bundle = qm::BundleDirectory::atPath(*resolved)) {
        return *bundle;
    }
    if (qm::looksLikeApplication(*resolved)) {
        return applicationError(*resolved);
    }
    return notAPlugInBundle(path, "no Info.plist (neither Info.plist nor Contents/Info.plist)");
}

std::optional<std::string> localizedNameOf(const qm::Value& info) {
    if (auto display = stringAt(info, qmkey::kBundleDisplayName)) {
        return display;
    }
    return stringAt(info, qmkey::kBundleName);
}

std::int32_t clampedSeconds(std::int64_t seconds) {
    return static_cast<std::int32_t>(std::clamp<std::int64_t>(seconds, std::numeric_limits<std::int32_t>::min(),
                                                              std::numeric_limits<std::int32_t>::max()));
}

// A bundle identifier names a folder of its own under Containers/.
bool isContainerName(const std::string& name) {
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos;
}

}  // namespace

OfflinePlugIns::OfflinePlugIns(SdkRegistry registry) : registry_(std::move(registry)) {}

qm::Result<std::vector<OfflinePlugIn>> OfflinePlugIns::inspectBundle(
    const std::string& bundlePath, const std::optional<std::string>& identifier) const {
    auto bundle = bundleAt(bundlePath);
    if (!bundle) {
        return bundle.error();
    }
    const std::string& path = bundle->path();
    auto info = bundle->infoDictionary();
    if (!info) {
        // Say why, so that a developer need not go looking in the log.
        auto read = qm::plist::readFile(bundle->infoPlistPath());
        std::string reason = read.ok() ? "not a dictionary" : read.error().text();
        return QMErrorWithFormat(kQMErrorPlugInUnusable, "unreadable Info dictionary in plug-in bundle at %@: %@", path,
                                 reason);
    }
    if (declaredTop(*info).top.isNull()) {
        if (qm::looksLikeApplication(path)) {
            return applicationError(path);
        }
        return QMErrorWithFormat(kQMErrorPlugInUnusable,
                                 "the bundle at %@ declares no plug-in: its Info dictionary has neither \"%@\" nor \"%@\"",
                                 path, qmkey::kTop, qmkey::kOldTop);
    }

    std::vector<std::optional<std::string>> identifiers;
    const std::vector<std::string> declared = declaredIdentifiers(*info);
    if (identifier) {
        if (std::find(declared.begin(), declared.end(), *identifier) == declared.end()) {
            std::string known;
            for (const std::string& name : declared) {
                known += (known.empty() ? "" : ", ") + name;
            }
            return QMErrorWithFormat(kQMErrorPlugInUnusable, "no plug-in %@ in the bundle at %@; it has %@", *identifier,
                                     path, known.empty() ? std::string("none") : known);
        }
        identifiers.emplace_back(*identifier);
    } else {
        identifiers.assign(declared.begin(), declared.end());
    }
    if (identifiers.empty()) {
        identifiers.emplace_back(std::nullopt);  // setup then says what is missing
    }

    const std::optional<std::string> containingPath = containingApplicationPath(path);
    std::optional<std::string> containingName;
    if (containingPath) {
        if (auto application = qm::BundleDirectory::atPath(*containingPath)) {
            if (auto applicationInfo = application->infoDictionary()) {
                containingName = localizedNameOf(*applicationInfo);
            }
        }
    }
    auto modified = qm::modificationTime(bundle->infoPlistPath());
    const bool systemVolume = isOnSystemVolume(path);
    const std::optional<std::string> executable = stringAt(*info, qmkey::kBundleExecutable);
    const std::optional<std::string> bundleIdentifier = stringAt(*info, qmkey::kBundleIdentifier);

    std::vector<OfflinePlugIn> plugIns;
    for (const auto& id : identifiers) {
        OfflinePlugIn inspected;
        inspected.identifier = id;
        auto plugIn = std::make_unique<QMPlugInCore>();
        if (auto failure = plugIn->setupWithNameExplained(id, path, *info, qm::Value(), std::nullopt)) {
            inspected.error = std::move(failure);
            plugIns.push_back(std::move(inspected));
            continue;
        }
        plugIn->setLastModified(modified.ok() ? clampedSeconds(*modified) : 0);
        plugIn->setOnSystemVolume(systemVolume);
        inspected.infoBeforeSdk = plugIn->bundleInfoDictionary();
        if (const std::string* sdkName = plugIn->sdkSpec().asString()) {
            inspected.sdkName = *sdkName;
            inspected.sdk = registry_.locate(*sdkName);
        }
        plugIn->resolveSDK(registry_);
        plugIn->setHubProtocolVersion(hubProtocolVersionOf(*plugIn));
        plugIn->setContainingUrl(containingPath);
        plugIn->setLocalizedName(localizedNameOf(*info));
        plugIn->setLocalizedShortName(stringAt(*info, qmkey::kBundleName));
        plugIn->setLocalizedContainingName(containingName);
        inspected.error = plugIn->diagnose();

        // The catalog makes a data container for a bundle that names an
        // executable; a code plug-in without one is refused by the daemon.
        if (!plugIn->isData()) {
            if (executable && !executable->empty() && bundleIdentifier && isContainerName(*bundleIdentifier)) {
                inspected.dataContainerPath = qm::xdgDataHome() + "/ovaro/Containers/" + *bundleIdentifier;
            } else if (!inspected.error) {
                inspected.error = QMError(kQMErrorPlugInUnusable, "this plug-in has no sandbox data container");
            }
        }
        inspected.plugIn = std::move(plugIn);
        plugIns.push_back(std::move(inspected));
    }
    return plugIns;
}

std::vector<std::string> OfflinePlugIns::declaredIdentifiers(const qm::Value& infoDictionary) {
    std::vector<std::string> identifiers;
    for (const qm::DeclaredPlugIn& plugIn : qm::declaredPlugIns(infoDictionary)) {
        identifiers.push_back(plugIn.identifier);
    }
    return identifiers;
}

std::optional<std::string> OfflinePlugIns::containingApplicationPath(const std::string& bundlePath) {
    return qm::containingApplicationPath(bundlePath);
}

bool OfflinePlugIns::isOnSystemVolume(const std::string& bundlePath) {
    auto resolved = qm::resolvedPath(bundlePath);
    if (!resolved.ok()) {
        return false;
    }
    std::vector<std::string> roots;
    for (const std::string& root : qm::systemRoots()) {
        if (auto resolvedRoot = qm::resolvedPath(root); resolvedRoot.ok()) {
            roots.push_back(*resolvedRoot);
        }
    }
    return qm::isUnderAnyRoot(*resolved, roots);
}

std::uint32_t OfflinePlugIns::hubProtocolVersionOf(const QMPlugInCore& plugIn) {
    const qm::Value top = plugIn.topDictionary();
    if (const qm::Value* declared = top.get(qmkey::kHubProtocolVersion)) {
        if (auto version = declared->asUnsigned(); version && *version <= std::numeric_limits<std::uint32_t>::max()) {
            return static_cast<std::uint32_t>(*version);
        }
    }
    return plugIn.bundleInfoDictionary().get(qmkey::kOldTop) != nullptr ? 1 : 2;
}
