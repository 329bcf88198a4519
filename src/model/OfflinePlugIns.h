#pragma once
// Plug-ins read straight from a bundle on disk, without the daemon and its
// catalog: what a plug-in developer needs to learn whether, and why not, the
// daemon would use a plug-in. The facts the catalog would record are taken
// from the disk instead: a fresh UUID, the Info file's modification time, the
// system volume from the system roots, the containing application from the
// bundle's place in an application's plug-ins directory.

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "model/QMPlugInCore.h"
#include "model/SdkRegistry.h"
#include "platform/error/Error.h"
#include "platform/value/Value.h"

// One plug-in of a bundle, set up, resolved and validated as the daemon would.
struct OfflinePlugIn {
    std::optional<std::string> identifier;
    std::unique_ptr<QMPlugInCore> plugIn;  // null when setup failed
    // Why the daemon would ignore the plug-in: its setup failure or its
    // validation error (code 12); none when it would use it.
    qm::MaybeError error;
    // Where the catalog keeps the plug-in's data container; none for a data
    // plug-in and for a bundle that names no executable.
    std::optional<std::string> dataContainerPath;
    // The bundle's Info dictionary as set up, before the SDK's defaults and
    // the canonical values (null when setup failed).
    qm::Value infoBeforeSdk;
    // The SDK the plug-in names and where it was looked for; none when it
    // names none.
    std::optional<std::string> sdkName;
    SdkLookup sdk;
};

class OfflinePlugIns {
public:
    explicit OfflinePlugIns(SdkRegistry registry = SdkRegistry());

    // The plug-ins of the bundle at bundlePath: the one named identifier, or
    // every plug-in the bundle declares when identifier is none. Fails, saying
    // which, when the path is no plug-in bundle (code 9: no such path, not a
    // directory, no Info.plist, an application) or its Info dictionary is
    // unreadable or declares no plug-in (code 12), and when identifier names
    // none of the bundle's plug-ins (code 12, listing them).
    qm::Result<std::vector<OfflinePlugIn>> inspectBundle(const std::string& bundlePath,
                                                         const std::optional<std::string>& identifier) const;

    // The identifiers of the plug-ins an Info dictionary declares, as the
    // catalog records them: the keys of "Multiple", else the attributes'
    // declared identifier, else the bundle identifier. Empty when none is found.
    static std::vector<std::string> declaredIdentifiers(const qm::Value& infoDictionary);

    // The application bundle whose plug-ins directory (PlugIns, or
    // Contents/PlugIns) holds the bundle at bundlePath, by layout alone.
    static std::optional<std::string> containingApplicationPath(const std::string& bundlePath);

    // Whether the bundle lies under one of the system roots, resolved paths
    // compared at path-component boundaries.
    static bool isOnSystemVolume(const std::string& bundlePath);

    // The hub protocol version the daemon gives a resolved plug-in: the top
    // dictionary's "HubProtocolVersion", else 1 for an old-style bundle and 2
    // for any other.
    static std::uint32_t hubProtocolVersionOf(const QMPlugInCore& plugIn);

private:
    SdkRegistry registry_;
};
