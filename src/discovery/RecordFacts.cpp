#include "discovery/RecordFacts.h"

PlugInFacts factsOf(const QMDPlugIn& plugIn, QMDatabase& registry) {
    PlugInFacts facts;
    facts.identifier = plugIn.identifier();
    facts.uuid = plugIn.uuid();
    facts.attributes = plugIn.attributes();
    facts.bundleInfoDictionary = plugIn.bundleInfoDictionary();
    facts.entitlements = plugIn.entitlements().value_or(qm::Value());
    facts.election = [&registry, &plugIn]() -> std::optional<qm::Value> {
        auto annotation = registry.annotationForPlugIn(plugIn);
        const qm::Value* election = annotation ? annotation->get("election") : nullptr;
        return election ? std::optional<qm::Value>(*election) : std::nullopt;
    };
    return facts;
}
