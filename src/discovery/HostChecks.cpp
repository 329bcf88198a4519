#include "discovery/HostChecks.h"

#include "platform/text/Format.h"

std::optional<std::string> allowForClient(const MatchRules& rules, const PlugInFacts& plugIn,
                                          const qm::Value& plugInDictionary, const ClientIdentity& client) {
    if (auto restriction = client.entitlementValueForKey("ovaro.developer.quamber.allowedplugins")) {
        const qm::Dictionary* allowed = restriction->asDictionary();
        if (allowed == nullptr) {
            return "invalid host restriction entitlement";
        }
        if (!rules.match(plugIn, allowed)) {
            return "the host's plug-in entitlement does not allow this plug-in";
        }
    }
    if (const qm::Value* required = plugInDictionary.get("VTExtensionHostEntitlement")) {
        // A name that is not a string names no entitlement the host can hold.
        const std::string* name = required->asString();
        if (name == nullptr || !client.hasEntitlement(*name)) {
            return qm::format("the host does not have the \"%@\" entitlement", *required);
        }
    }
    return std::nullopt;
}
