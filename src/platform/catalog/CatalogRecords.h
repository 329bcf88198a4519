#pragma once
// What the catalog hands out: immutable records of registered plug-ins and
// of the applications that hold them, the observer interface through which
// it reports installs and uninstalls, and its error codes.
//
// Records are shared and never change; a change on disk makes new records
// (with new UUIDs when the plug-in was re-registered). They may be kept and
// read on any thread.

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/error/Error.h"
#include "platform/value/Value.h"

namespace qm {

// The application whose plug-ins folder holds a plug-in bundle, found by the
// folder layout (X.app/PlugIns/ or X.app/Contents/PlugIns/).
struct ContainingApplication {
    std::string path;                            // resolved
    std::optional<std::string> localizedName;
};

// One registered plug-in. A bundle declaring "Multiple" entries has one
// record per entry, all sharing the bundle-level fields.
struct PlugInRecord {
    Uuid uuid;                                  // stable across restarts
    std::string bundlePath;                     // resolved (realpath); bundleURL() is its file URL
    std::string identifier;                     // the plug-in identifier
    std::optional<std::string> extensionPoint;  // "VTExtensionPointName" (old style "ovaro.protocol")
    Value infoDictionary;                       // the whole Info dictionary, plus "MRBundleInfoPlistURL"
    Value plugInDictionary;                     // the "Multiple" entry, else the top dictionary
    Date registrationDate;                      // whole seconds: when the catalog first registered it
    bool onSystemVolume = false;                // under a system install root (recomputed at each start)
    std::optional<ContainingApplication> containingApplication;
    std::optional<std::string> localizedName;       // "MRBundleDisplayName", else "MRBundleName"
    std::optional<std::string> localizedShortName;  // "MRBundleName"
    std::optional<Value> entitlements;          // trust-checked at registration; none when absent or untrusted
    std::optional<std::string> dataContainerPath;   // none for data plug-ins (no executable)
    std::optional<std::string> bundleIdentifier;    // "MRBundleIdentifier"
    std::optional<std::string> bundleVersion;       // "MRBundleVersion"

    std::string bundleURL() const;
};
using PlugInRecordPtr = std::shared_ptr<const PlugInRecord>;

// An application bundle known to the catalog: one found in an install root
// (with or without plug-ins), or the containing application of a registered
// plug-in.
struct ApplicationRecord {
    std::string path;  // resolved
    std::optional<std::string> localizedName;
    std::vector<PlugInRecordPtr> plugIns;  // in path, identifier, UUID order
};
using ApplicationRecordPtr = std::shared_ptr<const ApplicationRecord>;

// A bundle in a plug-ins folder (or given to registerPlugIn) that the
// catalog read and did not register, with why.
struct CatalogRefusal {
    std::string path;
    std::string reason;
};
using CatalogRefusals = std::shared_ptr<const std::vector<CatalogRefusal>>;

// Told of every change of the set of registered plug-ins, on the catalog's
// own thread, one call at a time, after the change is committed and
// published: lookups already answer for the installed records and no longer
// for the uninstalled ones. Within one change, pluginsWillUninstall comes
// first. Records are in path, identifier, UUID order. An observer may read
// the catalog; it must not call registerPlugIn or unregisterPlugIn (they
// wait for the thread that is calling it).
class AppCatalogObserver {
public:
    virtual ~AppCatalogObserver() = default;
    virtual void pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) = 0;
    virtual void pluginsWillUninstall(const std::vector<PlugInRecordPtr>& records) = 0;
};

// The filter of an extension-point query: (plug-in identifier, its
// entitlements) -> keep it. Called on the querying thread.
using PlugInFilter = std::function<bool(const std::string& identifier, const std::optional<Value>& entitlements)>;

// Errors of registerPlugIn and unregisterPlugIn carry this domain and one of
// these codes.
inline constexpr const char* kAppCatalogErrorDomain = "AppCatalog";
enum class AppCatalogError : int {
    notAPlugIn = 1,         // no bundle at the path, or a bundle declaring no identifiable plug-in
    applicationBundle = 2,  // the path is an application, not a plug-in
    notRegistered = 3,      // unregister: nothing is registered at the path
    storage = 4,            // the database refused the change
};
// The code of a catalog error; nothing for an error of another domain.
std::optional<AppCatalogError> appCatalogErrorOf(const Error& error);

}  // namespace qm
