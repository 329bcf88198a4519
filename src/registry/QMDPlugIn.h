#pragma once
// The daemon's record of one plug-in the catalog registered: a plug-in
// descriptor set up from the catalog's record, which it keeps (`acproxy`)
// for what the descriptor does not hold: localized names, entitlements, the
// data container and the containing application.
//
// Made only by the registry, on its queue, one per plug-in UUID; shared
// between the registry's cache and the requests that borrow it, so a request
// keeps its record even while the catalog reports its uninstallation.

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "model/QMPlugInCore.h"
#include "platform/catalog/CatalogRecords.h"

class QMDPlugIn final : public QMPlugInCore {
public:
    // The record, or null when the catalog's record lacks its bundle or Info
    // dictionary, the descriptor cannot be set up, or the plug-in is
    // mis-configured ("ignoring mis-configured plug-in at %@: %@" logged).
    static std::shared_ptr<QMDPlugIn> initWithACData(qm::PlugInRecordPtr record);
    // The same, handing back why there is no record instead of logging it.
    struct BuildFailure {
        std::string reason;          // empty: the catalog's record is incomplete
        bool loggedBySetup = false;  // the descriptor's setup logged it already
    };
    static qm::Result<std::shared_ptr<QMDPlugIn>, BuildFailure> build(qm::PlugInRecordPtr record);
    // The line initWithACData logs for a failure (none when setup logged it).
    static void logBuildFailure(const std::string& bundlePath, const BuildFailure& failure);

    const qm::PlugInRecord& acproxy() const noexcept { return *record_; }
    const qm::PlugInRecordPtr& record() const noexcept { return record_; }

    // Answered from the catalog's record.
    std::optional<std::string> localizedName() const override;
    std::optional<std::string> localizedShortName() const override;
    std::optional<std::string> localizedContainingName() const override;

    // The plug-in's own entitlements, as the catalog trusted them.
    std::optional<qm::Value> entitlements() const;
    std::optional<qm::Value> valueForEntitlement(std::string_view name) const;
    // True when the value exists and is not false (a Boolean false or a
    // numeric zero).
    bool hasEntitlement(std::string_view name) const;

    // Where the plug-in's annotations are kept: the identifier of the plug-in
    // it replaces (a string "ovaro.developer.replace-plugin"), else its own.
    std::string annotationKey() const;
    // The annotation key a catalog record would have, before any record is
    // built (the election filter of the candidate search).
    static std::string annotationKeyOf(const std::string& identifier, const std::optional<qm::Value>& entitlements);

    // The descriptor's own checks, then: a code plug-in needs a sandbox data
    // container (code 12).
    qm::MaybeError diagnose() const override;

    // The plug-in form, made once: nothing it holds changes after the record
    // is built (replies add the annotations to their own copy).
    const qm::Dictionary& form() const;

    // Use initWithACData.
    explicit QMDPlugIn(qm::PlugInRecordPtr record) : record_(std::move(record)) {}

private:
    const qm::PlugInRecordPtr record_;
    mutable std::once_flag formOnce_;
    mutable qm::Dictionary form_;
};
