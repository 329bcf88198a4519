#pragma once
// QMPlugInCore: the description of one plug-in, built from its bundle's Info
// dictionary. It knows who the plug-in is (identifier, UUID), where it lies
// (bundle path, containing application) and what it declares, reduced to one
// plug-in dictionary and one attributes dictionary in the new ("VTExtension")
// vocabulary whichever style the bundle was written in.
//
// Calling order: set up (from bundle facts, or from a form), then resolveSDK
// (SDK defaults merged, canonical values filled), then diagnose.
//
// Dictionary invariant: bundleInfoDictionary["VTExtension"] is topDictionary;
// plugInDictionary is topDictionary, or topDictionary["Multiple"][identifier]
// for a multiplexed bundle. The rebuilding setters keep it, so a form needs to
// carry only bundleInfoDictionary.
//
// Concurrency: each property read or write is atomic (copies out under the
// object's lock; Values are shared handles, so copies are cheap). Composite
// operations (setup, resolveSDK, canonicalize, the rebuilding setters, the
// form operations) take no lock of their own: callers must not run two of
// them on one descriptor at once, nor read the dictionaries meanwhile.
//
// "URLs" of the design are absolute file-system paths here.

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "model/PlugInKeys.h"
#include "platform/error/Error.h"
#include "platform/value/Uuid.h"
#include "platform/value/Value.h"

class SdkRegistry;

class QMPlugInCore {
public:
    QMPlugInCore();  // empty: no field set
    virtual ~QMPlugInCore();
    QMPlugInCore(const QMPlugInCore&) = delete;
    QMPlugInCore& operator=(const QMPlugInCore&) = delete;

    // --- setup ---------------------------------------------------------

    // A set-up descriptor, or null when setupWithName fails.
    static std::unique_ptr<QMPlugInCore> initWithName(const std::optional<std::string>& identifier,
                                                      const std::optional<std::string>& url,
                                                      const qm::Value& bundleInfo, const qm::Value& info,
                                                      std::optional<qm::Uuid> uuid);

    // Derives all three dictionaries from bundleInfo; info (the plug-in
    // dictionary as a catalog record carries it) is accepted and not
    // consulted. Without a uuid a fresh random one is taken. Failures are
    // logged and leave uuid unset.
    bool setupWithName(const std::optional<std::string>& identifier, const std::optional<std::string>& url,
                       const qm::Value& bundleInfo, const qm::Value& info, std::optional<qm::Uuid> uuid);

    // setupWithName that also hands back why it failed: an error of code 12
    // whose description is the line it logged (none when the URL was missing).
    qm::MaybeError setupWithNameExplained(const std::optional<std::string>& identifier,
                                          const std::optional<std::string>& url, const qm::Value& bundleInfo,
                                          const qm::Value& info, std::optional<qm::Uuid> uuid);

    // The new-style Info dictionary (one with "VTExtension"), or nothing when
    // the dictionary has neither style or its old-style part cannot be
    // translated whole.
    static std::optional<qm::Dictionary> normalizeInfoDictionary(const qm::Value& infoDictionary);

    // Translations of old-style ("Quamber") dictionaries into new-style names.
    // Values are carried unchanged; attribute dictionaries nested deeper than
    // a plug-in's own "Attributes" are not translated. Nothing when the
    // argument, its "Attributes", its "Multiple" or an entry of "Multiple" is
    // not a dictionary.
    static std::optional<qm::Dictionary> newQuamberDictionaryFrom(const qm::Value& oldStyle);
    static std::optional<qm::Dictionary> newMultiplesFrom(const qm::Value& oldStyleMultiples);
    static std::optional<qm::Dictionary> newAttributesFrom(const qm::Value& oldStyleAttributes);

    // Installs an Info dictionary without the rebuilding setters. True when it
    // was installed and a plug-in dictionary was found for identifier.
    bool setDictionaries(const qm::Value& infoDictionary);

    // --- SDK (QMPlugInCore+SDK.cpp) ------------------------------------

    // The SDK dictionary named name, from the default SdkRegistry.
    static std::optional<qm::Dictionary> readSDKDictionary(std::string_view name);

    // Merges the SDK named by sdkSpec under the bundle's Info dictionary, then
    // canonicalizes. An sdkSpec that is not a string is logged and leaves the
    // descriptor as set up, not canonicalized.
    void resolveSDK();
    void resolveSDK(const SdkRegistry& registry);

    // The bundle side wins for every key both sides hold, except
    // "CleanTimeout" (the SDK wins), "Shared" (union) and dictionaries (merged
    // key by key), at every depth.
    static qm::Dictionary mergeDictionaryInto(const qm::Dictionary& sdk, const qm::Dictionary& bundle);
    static bool sdkOverridesKey(std::string_view key);
    // The union of both: every element of bundle in order, then the
    // elements of sdk that bundle lacks.
    static qm::Array mergeSharedResourcesInto(const qm::Array& sdk, const qm::Array& bundle);

    // --- canonical values and validation -------------------------------

    // Fills the canonical values: app-extension defaults, "ovaro.format",
    // "VTExtensionPointVersion". Visible through all three dictionary levels.
    void canonicalize();

    // The reason the plug-in is mis-configured (code 12), or none.
    virtual qm::MaybeError diagnose() const;

    // --- rebuilding setters ---------------------------------------------

    // Replace one level and rebuild the enclosing ones.
    void setTopDictionary(const qm::Value& topDictionary);
    void setPlugInDictionary(const qm::Value& plugInDictionary);

    // --- forms (QMPlugInCore+Form.cpp) -----------------------------------

    // The plug-in form: the dictionary that carries this descriptor to
    // clients. Keys whose value the descriptor lacks are left out.
    qm::Dictionary exportForm() const;
    static std::unique_ptr<QMPlugInCore> initWithForm(const qm::Value& form);
    // True when set up from the form; the form's "info" is not consulted.
    bool setupWithForm(const qm::Value& form);
    // Takes the form's "annotations" (none when it has none or they are not a dictionary).
    void updateFromForm(const qm::Value& form);
    // Sets or (value none) removes one annotation. Annotations that are none
    // stay none: there is no annotation dictionary to change.
    void setAnnotationValue(const std::string& key, const std::optional<qm::Value>& value);

    // --- identity ---------------------------------------------------------

    // By UUID; comparing a descriptor that has none is a programming error.
    bool isEqual(const QMPlugInCore& other) const;
    std::size_t hash() const;
    bool operator==(const QMPlugInCore& other) const { return isEqual(other); }

    // --- stored properties ----------------------------------------------

    std::optional<std::string> identifier() const;
    void setIdentifier(std::optional<std::string> identifier);
    std::optional<std::string> url() const;
    void setUrl(std::optional<std::string> url);
    std::optional<std::string> containingUrl() const;
    void setContainingUrl(std::optional<std::string> containingUrl);
    bool onSystemVolume() const;
    void setOnSystemVolume(bool onSystemVolume);
    qm::Value bundleInfoDictionary() const;
    qm::Value topDictionary() const;
    qm::Value plugInDictionary() const;
    std::uint32_t hubProtocolVersion() const;
    void setHubProtocolVersion(std::uint32_t version);
    // The name getters are virtual: the daemon record answers from the catalog.
    virtual std::optional<std::string> localizedName() const;
    void setLocalizedName(std::optional<std::string> name);
    virtual std::optional<std::string> localizedShortName() const;
    void setLocalizedShortName(std::optional<std::string> name);
    virtual std::optional<std::string> localizedContainingName() const;
    void setLocalizedContainingName(std::optional<std::string> name);
    std::optional<qm::Dictionary> annotations() const;
    void setAnnotations(std::optional<qm::Dictionary> annotations);
    std::int32_t lastModified() const;
    void setLastModified(std::int32_t secondsSince1970);
    std::optional<qm::Uuid> uuid() const;
    std::optional<qm::Bytes> cdhash() const;
    void setCdhash(std::optional<qm::Bytes> cdhash);
    std::optional<std::string> requirement() const;
    void setRequirement(std::optional<std::string> requirement);

    // --- computed properties --------------------------------------------

    std::optional<std::string> path() const { return url(); }
    std::optional<std::string> containingPath() const { return containingUrl(); }
    // plugInDictionary["VTExtensionAttributes"] when it is a dictionary.
    qm::Value attributes() const;
    qm::Value version() const;       // attributes["VTExtensionPointVersion"]
    qm::Value protocolSpec() const;  // plugInDictionary["VTExtensionProtocol"]
    qm::Value sdkSpec() const;       // plugInDictionary["VTExtensionPointIdentifier"]
    qm::Value embeddedProtocolSpec() const;
    std::optional<std::string> embeddedCodePath() const { return std::nullopt; }
    bool isAppExtension() const;
    bool isMultiplexed() const;
    bool isHybrid() const;
    bool isDedicated() const;
    bool isData() const;
    qm::Date timestamp() const;
    // False for a new-style Info dictionary, true for an old-style one that
    // was never normalized; neither style is a programming error.
    bool oldStyle() const;

private:
    void storeDictionaries(qm::Value bundleInfo, qm::Value top, qm::Value plugIn);
    void setUuid(std::optional<qm::Uuid> uuid);

    mutable std::mutex lock_;  // guards every non-atomic field below
    std::optional<std::string> identifier_;
    std::optional<std::string> url_;
    std::optional<std::string> containingUrl_;
    qm::Value bundleInfoDictionary_;
    qm::Value topDictionary_;
    qm::Value plugInDictionary_;
    std::optional<std::string> localizedName_;
    std::optional<std::string> localizedShortName_;
    std::optional<std::string> localizedContainingName_;
    std::optional<qm::Dictionary> annotations_;
    std::optional<qm::Uuid> uuid_;
    std::optional<qm::Bytes> cdhash_;
    std::optional<std::string> requirement_;
    std::atomic<bool> onSystemVolume_{false};
    std::atomic<std::uint32_t> hubProtocolVersion_{0};
    std::atomic<std::int32_t> lastModified_{0};
};
