// Match rules as hosts send them (one CBOR payload) against one plug-in: the
// ShareToNotes example bundle, read once per process with its attributes,
// Info dictionary, entitlements and a stored election.
//
// Checked beyond "no crash": match() and firstFailingKey() agree.

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>

#include "discovery/MatchRules.h"
#include "platform/duct/CborCodec.h"
#include "platform/plist/PropertyList.h"

namespace {

PlugInFacts exampleFacts() {
    const char* path = QM_SOURCE_DIR "/examples/Applications/Notes.app/PlugIns/ShareToNotes.bundle/Info.plist";
    auto info = qm::plist::readFile(path);
    if (!info) {
        std::fprintf(stderr, "rules_evaluator: %s: %s\n", path, info.error().text().c_str());
        std::abort();
    }
    const qm::Value* extension = info->get("VTExtension");
    const qm::Value* attributes = extension ? extension->get("VTExtensionAttributes") : nullptr;
    const qm::Value* identifier = info->get("MRBundleIdentifier");
    if (!attributes || !identifier || !identifier->asString()) {
        std::fprintf(stderr, "rules_evaluator: %s is not the expected plug-in\n", path);
        std::abort();
    }
    PlugInFacts facts;
    facts.identifier = *identifier->asString();
    facts.uuid = qm::Uuid::parse("5d6e7f80-91a2-43b4-85c6-d7e8f9a0b1c2");
    facts.attributes = *attributes;
    facts.bundleInfoDictionary = *info;
    facts.entitlements = qm::Value(qm::Dictionary{{"ovaro.notes.share", qm::Value(true)},
                                                  {"ovaro.sandbox", qm::Value("NO")},
                                                  {"ovaro.denied", qm::Value(false)}});
    facts.election = [] { return std::optional<qm::Value>(qm::Value(2)); };
    return facts;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const PlugInFacts facts = exampleFacts();
    static const MatchRules rules;

    auto decoded = qm::cbor::decode(std::span<const std::uint8_t>(data, size));
    if (!decoded) {
        return 0;
    }
    const qm::Dictionary* dictionary = decoded->asDictionary();
    bool matches = rules.match(facts, dictionary);
    if (matches == rules.firstFailingKey(facts, dictionary).has_value()) {
        std::abort();
    }
    return 0;
}
