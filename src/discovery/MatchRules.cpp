#include "discovery/MatchRules.h"

#include <charconv>
#include <cmath>

#include "model/ValueHelpers.h"
#include "platform/log/SystemLog.h"
#include "platform/types/ActivationRule.h"

namespace {

constexpr std::string_view kEntitlementPrefix = "ENTITLEMENT:";
constexpr std::string_view kConformsPrefix = "?TY-CONFORMS:";
constexpr std::string_view kIsPrefix = "?TY-IS:";

const qm::Value kFalse(false);

std::string upperCase(std::string text) {
    for (char& c : text) {
        if (c >= 'a' && c <= 'z') {
            c = static_cast<char>(c - 'a' + 'A');
        }
    }
    return text;
}

enum class Comparison { less, same, greater };

Comparison compare(std::string_view value, std::string_view operand) {
    auto order = compareVersionString(value, operand);
    if (order < 0) {
        return Comparison::less;
    }
    return order > 0 ? Comparison::greater : Comparison::same;
}

}  // namespace

std::string MatchRules::describeElection(const qm::Value& election) {
    if (election.isNumber() || election.asBool()) {
        return describeNumber(election);
    }
    const std::string* text = election.asString();
    return text ? *text : election.description();
}

std::string MatchRules::describeNumber(const qm::Value& number) {
    if (auto flag = number.asBool()) {
        return *flag ? "1" : "0";
    }
    if (auto u = number.asUnsigned()) {
        return std::to_string(*u);
    }
    if (auto i = number.asSigned()) {
        return std::to_string(*i);
    }
    double d = number.asDouble().value_or(0);
    if (std::isfinite(d) && d == std::trunc(d) && std::fabs(d) < 9.2e18) {
        return std::to_string(static_cast<std::int64_t>(d));
    }
    char text[32];
    auto end = std::to_chars(text, text + sizeof text, d).ptr;  // shortest text that reads back exactly
    return std::string(text, end);
}

std::optional<qm::Value> MatchRules::resolveKey(const PlugInFacts& plugIn, std::string_view key) const {
    if (key.starts_with(kEntitlementPrefix)) {
        const qm::Value* value = plugIn.entitlements.get(key.substr(kEntitlementPrefix.size()));
        return value ? std::optional<qm::Value>(*value) : std::nullopt;
    }
    if (key == "VTExtensionIdentifier" && plugIn.identifier) {
        return qm::Value(*plugIn.identifier);
    }
    if (key == "ovaro.uuid" && plugIn.uuid) {
        return qm::Value(upperCase(plugIn.uuid->text()));
    }
    if (key == "VTUserElection") {
        auto election = plugIn.election ? plugIn.election() : std::nullopt;
        return qm::Value(election ? describeElection(*election) : std::string("0"));
    }
    if (const qm::Value* attribute = plugIn.attributes.get(key)) {
        return *attribute;
    }
    if (const qm::Value* info = plugIn.bundleInfoDictionary.get(key)) {
        return *info;
    }
    return std::nullopt;
}

bool MatchRules::match(const PlugInFacts& plugIn, const qm::Dictionary* rules) const {
    return !firstFailingKey(plugIn, rules).has_value();
}

std::optional<std::string> MatchRules::firstFailingKey(const PlugInFacts& plugIn, const qm::Dictionary* rules) const {
    if (rules == nullptr) {
        return std::nullopt;
    }
    for (const auto& [key, pattern] : *rules) {
        if (!matchKey(plugIn, key, pattern)) {
            return key;
        }
    }
    return std::nullopt;
}

bool MatchRules::matchKey(const PlugInFacts& plugIn, std::string_view key, const qm::Value& pattern) const {
    std::optional<qm::Value> value = resolveKey(plugIn, key);
    // Only the Booleans themselves are the presence patterns; a number
    // pattern matches nothing.
    if (auto wanted = pattern.asBool()) {
        bool present = value && !(*value == kFalse);
        return *wanted == present;
    }
    if (!value) {
        return false;
    }
    if (pattern.isDictionary()) {
        return qm::activationRuleMatches(*value, pattern, types_);
    }
    if (const std::string* text = value->asString()) {
        return matchValuePatterns(*text, pattern);
    }
    if (const qm::Array* elements = value->asArray()) {
        for (const qm::Value& element : *elements) {
            // Operator expressions are defined for strings only.
            if (const std::string* text = element.asString(); text && matchValuePatterns(*text, pattern)) {
                return true;
            }
        }
    }
    return false;
}

bool MatchRules::matchValuePatterns(const std::string& value, const qm::Value& patterns) const {
    if (const std::string* pattern = patterns.asString()) {
        return matchValuePattern(value, *pattern);
    }
    if (const qm::Array* list = patterns.asArray()) {
        for (const qm::Value& element : *list) {
            if (const std::string* pattern = element.asString(); pattern && matchValuePattern(value, *pattern)) {
                return true;
            }
        }
    }
    return false;
}

bool MatchRules::matchValuePattern(const std::string& value, const std::string& pattern) const {
    std::string_view text = pattern;
    if (text.starts_with(kConformsPrefix)) {
        return types_.conforms(value, text.substr(kConformsPrefix.size()));
    }
    if (text.starts_with(kIsPrefix)) {
        return types_.conforms(text.substr(kIsPrefix.size()), value);
    }
    if (text.starts_with("?")) {
        qm::systemLogf(qm::kLogNotice, "unrecognized match operator:%@", pattern);
        return false;
    }
    struct Operator {
        std::string_view prefix;
        bool (*holds)(Comparison);
    };
    static constexpr Operator kOperators[] = {
        {"<>", [](Comparison c) { return c != Comparison::same; }},
        {"<=", [](Comparison c) { return c != Comparison::greater; }},
        {">=", [](Comparison c) { return c != Comparison::less; }},
        {"=", [](Comparison c) { return c == Comparison::same; }},
        {"<", [](Comparison c) { return c == Comparison::less; }},
        {">", [](Comparison c) { return c == Comparison::greater; }},
    };
    for (const Operator& op : kOperators) {
        if (text.starts_with(op.prefix)) {
            return op.holds(compare(value, text.substr(op.prefix.size())));
        }
    }
    return compare(value, text) == Comparison::same;
}
