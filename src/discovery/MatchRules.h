#pragma once
// The rule language hosts select plug-ins by: a dictionary whose keys name
// facts about a plug-in and whose values are patterns those facts must
// satisfy, all of them (conjunction). Every unusable rule, key, value or
// pattern simply does not match; matching never fails and changes nothing
// but, for an unknown "?" operator, one log line.
//
// Keys: "ENTITLEMENT:<name>" (the plug-in's entitlement, nothing else),
// "VTExtensionIdentifier", "ovaro.uuid" (upper-case canonical text),
// "VTUserElection" (the election as decimal text, "0" when none), and any
// other key: the plug-in's attributes, else its bundle Info dictionary.
// Patterns: true, false, a dictionary (an activation-rule query), a string
// operator expression ("?TY-CONFORMS:", "?TY-IS:", "<>", "<=", ">=", "=",
// "<", ">", or none: equality under the numeric-aware version order), or an
// array of such strings (any of them).

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/types/UniformTypes.h"
#include "platform/value/Uuid.h"
#include "platform/value/Value.h"

// What the rules read of one plug-in. Values are shared handles: cheap to
// take. The election is read only when a rule asks for it.
struct PlugInFacts {
    std::optional<std::string> identifier;
    std::optional<qm::Uuid> uuid;
    qm::Value attributes;            // the plug-in dictionary's "VTExtensionAttributes"
    qm::Value bundleInfoDictionary;
    qm::Value entitlements;          // the plug-in's own; null when none
    std::function<std::optional<qm::Value>()> election;  // the stored "election", if any
};

class MatchRules {
public:
    explicit MatchRules(const qm::UniformTypes& types = qm::UniformTypes::shared()) : types_(types) {}

    // `match:` — true when every key matches; no rules (null, or not a
    // dictionary's worth of keys) match everything. Keys are tested in sorted
    // order and testing stops at the first that does not match.
    bool match(const PlugInFacts& plugIn, const qm::Dictionary* rules) const;
    // The first key of the rules that does not match, for explanations.
    std::optional<std::string> firstFailingKey(const PlugInFacts& plugIn, const qm::Dictionary* rules) const;

    bool matchKey(const PlugInFacts& plugIn, std::string_view key, const qm::Value& pattern) const;
    bool matchValuePatterns(const std::string& value, const qm::Value& patterns) const;
    bool matchValuePattern(const std::string& value, const std::string& pattern) const;

    // How a fact prints where the rules compare text ("%@"): Booleans "1"
    // and "0", a whole double as that integer, other doubles as their
    // shortest exact text.
    static std::string describeNumber(const qm::Value& number);
    // The "VTUserElection" fact of a stored election, as "%@" prints it.
    static std::string describeElection(const qm::Value& election);

private:
    std::optional<qm::Value> resolveKey(const PlugInFacts& plugIn, std::string_view key) const;

    const qm::UniformTypes& types_;
};
