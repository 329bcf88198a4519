#include "discovery/MatchRequest.h"

#include <algorithm>
#include <list>
#include <tuple>
#include <map>

#include "discovery/HostChecks.h"
#include "discovery/RecordFacts.h"
#include "discovery/MatchRules.h"
#include "discovery/QMDUserPrefs.h"
#include "discovery/ResourceExtensions.h"
#include "model/QMError.h"
#include "model/ValueHelpers.h"
#include "protocol/Packing.h"
#include "protocol/WireKeys.h"
#include "registry/HoldList.h"
#include "registry/Probes.h"
#include "registry/QMDatabase.h"

namespace {

constexpr const char* kManagerEntitlement = "ovaro.private.quamber.manager";
constexpr const char* kReplacePlugIn = "ovaro.developer.replace-plugin";

// One accepted plug-in: its form as the reply will carry it.
struct Result {
    qm::Dictionary form;
    std::string identifier;
    QMDPlugInPtr plugIn;
};

// What one "match" builds: the results, the replacement table and, when
// asked, why candidates were left out.
class Discovery {
public:
    Discovery(RequestContext& context, std::uint64_t flags, bool explain)
        : context_(context), flags_(flags), explain_(explain) {}

    void visit(const QMDPlugInPtr& plugIn, const qm::Dictionary* rules, const qm::Array* exclusions);
    void explain(const qm::PlugInRecordPtr& record, const char* step, const std::string& detail);
    void markReplacements();

    qm::Array forms() const;
    // In path, identifier, UUID order, like the candidates.
    qm::Array explanations() const;
    bool truncated() const { return truncated_; }

private:
    bool all() const { return (flags_ & QMDiscoverAll) != 0; }
    std::optional<std::string> visibilityRefusal(const QMDPlugIn& plugIn) const;
    // Duplicate resolution: true to accept the form (after removing an
    // earlier result, when that one lost).
    bool resolveDuplicates(const QMDPlugIn& plugIn, const qm::Dictionary& form);
    void explainPlugIn(const QMDPlugIn& plugIn, const char* step, const std::string& detail);
    void remove(std::list<Result>::iterator result);

    RequestContext& context_;
    const std::uint64_t flags_;
    const bool explain_;
    const MatchRules rules_;
    std::list<Result> results_;
    std::map<std::string, std::list<Result>::iterator> replacements_;  // replaced identifier -> replacing result
    qm::Array explanations_;
    bool truncated_ = false;
};

std::optional<std::string> Discovery::visibilityRefusal(const QMDPlugIn& plugIn) const {
    if (!plugIn.onSystemVolume()) {
        if (!plugIn.containingUrl()) {
            return std::string("not on the system volume and in no application");
        }
        if (flags_ & QMDiscoverSystemOnly) {
            return std::string("not on the system volume");
        }
    }
    if (plugIn.isDedicated()) {
        const auto& bundle = context_.client.bundle;
        auto hostPlugIns = bundle ? bundle->plugInsPath() : std::nullopt;
        if (!hostPlugIns || !plugIn.path() || !plugIn.path()->starts_with(*hostPlugIns)) {
            return std::string("dedicated to another application");
        }
    }
    return std::nullopt;
}

void Discovery::visit(const QMDPlugInPtr& plugIn, const qm::Dictionary* rules, const qm::Array* exclusions) {
    const std::string identifier = plugIn->identifier().value_or("");
    const pid_t pid = context_.client.pid;
    if (!all()) {
        if (auto refusal = visibilityRefusal(*plugIn)) {
            explainPlugIn(*plugIn, "visibility", *refusal);
            return;
        }
        if (context_.holds.holdOnPlugIn(*plugIn->uuid())) {
            explainPlugIn(*plugIn, "held", "a client holds it");
            return;
        }
    }
    PlugInFacts facts = factsOf(*plugIn, context_.registry);
    if (auto failing = rules_.firstFailingKey(facts, rules)) {
        explainPlugIn(*plugIn, "rules", *failing);
        return;
    }
    for (std::size_t i = 0; exclusions && i < exclusions->size(); ++i) {
        // An entry that is no rules dictionary excludes nothing (absent
        // rules would match every plug-in).
        const qm::Dictionary* exclusion = (*exclusions)[i].asDictionary();
        if (exclusion && rules_.match(facts, exclusion)) {
            context_.logger.debug("client %d plugin %@ excluded", pid, identifier);
            explainPlugIn(*plugIn, "excluded", std::to_string(i));
            return;
        }
    }
    if (!all()) {
        if (auto reason = allowForClient(rules_, facts, plugIn->plugInDictionary(), context_.client)) {
            context_.logger.debug("client %d cannot use plugin %@: %@", pid, identifier, *reason);
            explainPlugIn(*plugIn, "host", *reason);
            return;
        }
    }
    qm::Dictionary form = plugIn->form();
    if (!resolveDuplicates(*plugIn, form)) {
        return;
    }
    form.set("annotations", context_.registry.annotationForPlugIn(*plugIn).value_or(qm::Value(qm::Dictionary{})));
    augmentForm(*plugIn, form);
    results_.push_back(Result{std::move(form), identifier, plugIn});
    auto accepted = std::prev(results_.end());
    auto replaced = plugIn->valueForEntitlement(kReplacePlugIn);
    if (const std::string* one = replaced ? replaced->asString() : nullptr) {
        replacements_[*one] = accepted;
    } else if (const qm::Array* several = replaced ? replaced->asArray() : nullptr) {
        for (const qm::Value& element : *several) {
            if (const std::string* name = element.asString()) {
                replacements_[*name] = accepted;
            }
        }
    }
}

// An absent version orders lowest.
std::strong_ordering compareVersions(const qm::Value* a, const qm::Value* b) {
    const std::string* left = a ? a->asString() : nullptr;
    const std::string* right = b ? b->asString() : nullptr;
    if (!left || !right) {
        return !left && !right ? std::strong_ordering::equal
                               : (!left ? std::strong_ordering::less : std::strong_ordering::greater);
    }
    return compareVersionString(*left, *right);
}

bool Discovery::resolveDuplicates(const QMDPlugIn& plugIn, const qm::Dictionary& form) {
    const bool versions = (flags_ & QMDiscoverVersions) != 0;
    const bool duplicates = versions && (flags_ & QMDiscoverDuplicates) != 0;
    const std::string identifier = plugIn.identifier().value_or("");
    for (auto earlier = results_.begin(); earlier != results_.end(); ++earlier) {
        if (earlier->identifier != identifier) {
            continue;
        }
        auto order = compareVersions(form.find("version"), earlier->form.find("version"));
        if (versions && (order != 0 || duplicates)) {
            continue;  // both stay
        }
        bool newer = order > 0;
        if (order == 0) {
            const qm::Value* resident = earlier->form.find("systemResident");
            const qm::Value* modified = earlier->form.find("lastmodified");
            newer = (plugIn.onSystemVolume() && !(resident && resident->asBool().value_or(false))) ||
                    plugIn.lastModified() > (modified ? modified->asSigned().value_or(0) : 0);
        }
        if (!newer) {
            explainPlugIn(plugIn, "duplicate", earlier->plugIn->uuid()->text());
            return false;
        }
        explainPlugIn(*earlier->plugIn, "duplicate", plugIn.uuid()->text());
        remove(earlier);
        return true;
    }
    return true;
}

void Discovery::remove(std::list<Result>::iterator result) {
    // Its replacement marks go with it, so "overrider" never names a UUID
    // missing from the reply.
    std::erase_if(replacements_, [&](const auto& entry) { return entry.second == result; });
    results_.erase(result);
}

void Discovery::markReplacements() {
    for (Result& result : results_) {
        auto replacing = replacements_.find(result.identifier);
        if (replacing == replacements_.end()) {
            continue;
        }
        Result& by = *replacing->second;
        result.form.set("overrider", *by.form.find("uuid"));
        by.form.set("overriding", qm::Value(result.identifier));
    }
}

qm::Array Discovery::forms() const {
    qm::Array forms;
    forms.reserve(results_.size());
    for (const Result& result : results_) {
        forms.emplace_back(result.form);
    }
    return forms;
}

qm::Array Discovery::explanations() const {
    qm::Array sorted = explanations_;
    auto key = [](const qm::Value& entry) {
        return std::tie(*entry.get("path")->asString(), *entry.get("identifier")->asString(),
                        *entry.get("uuid")->asString());
    };
    std::stable_sort(sorted.begin(), sorted.end(), [&](const qm::Value& a, const qm::Value& b) { return key(a) < key(b); });
    return sorted;
}

void Discovery::explainPlugIn(const QMDPlugIn& plugIn, const char* step, const std::string& detail) {
    if (!explain_) {
        return;
    }
    explain(plugIn.record(), step, detail);
}

void Discovery::explain(const qm::PlugInRecordPtr& record, const char* step, const std::string& detail) {
    if (!explain_) {
        return;
    }
    if (explanations_.size() == kMaxExplanations) {
        truncated_ = true;
        return;
    }
    explanations_.emplace_back(qm::Dictionary{{"uuid", qm::Value(record->uuid.text())},
                                              {"identifier", qm::Value(record->identifier)},
                                              {"path", qm::Value(record->bundlePath)},
                                              {"step", qm::Value(step)},
                                              {"detail", qm::Value(detail)}});
}

}  // namespace

Reply matchPlugIns(RequestContext& context) {
    QM_PROBE_REQ_MATCH();
    const qm::Value* rulesValue = context.request.get(wire::kRules);
    if (rulesValue && !rulesValue->isDictionary()) {
        return Reply::fail(kQMErrorInvalidRequest, "invalid request format (bad rules dictionary)");
    }
    const qm::Dictionary* rules = rulesValue ? rulesValue->asDictionary() : nullptr;
    const qm::Value* flagsValue = context.request.get(wire::kFlags);
    std::uint64_t flags = flagsValue ? flagsValue->asUnsigned().value_or(0) : 0;
    if ((flags & QMDiscoverAll) &&
        (!context.client.hasEntitlement(kManagerEntitlement) || context.client.sandboxed)) {
        return Reply::fail(kQMErrorDenied, "unauthorized discovery flag (QMDiscoverAll)");
    }
    // Beyond the design: explanations, for clients that are not sandboxed.
    const qm::Value* explainValue = context.request.get("explain");
    bool explain = explainValue && explainValue->asBool().value_or(false) && !context.client.sandboxed &&
                   context.version == wire::kCurrentVersion;

    std::optional<qm::Value> exclusions = context.userPrefs.exclusions();
    auto candidates = context.registry.findCandidates(rules, explain);
    Discovery discovery(context, flags, explain);
    for (const auto& [record, reason] : candidates.misconfigured) {
        discovery.explain(record, "misconfigured", reason);
    }
    for (const auto& record : candidates.failedElection) {
        discovery.explain(record, "election", "VTUserElection");
    }
    for (const QMDPlugInPtr& plugIn : candidates.plugIns) {
        discovery.visit(plugIn, rules, exclusions ? exclusions->asArray() : nullptr);
    }
    discovery.markReplacements();

    qm::Dictionary reply;
    if (auto matches = wire::convertToDuct(qm::Value(discovery.forms()), context.version)) {
        reply.set(wire::kMatches, std::move(*matches));
    }
    if (explain) {
        reply.set("explanations", *wire::convertToDuct(qm::Value(discovery.explanations()), context.version));
        if (discovery.truncated()) {
            reply.set("explanationsTruncated", qm::Value(true));
        }
    }
    return Reply::success(std::move(reply));
}
