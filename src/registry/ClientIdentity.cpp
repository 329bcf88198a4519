#include "registry/ClientIdentity.h"

#include "model/ValueHelpers.h"

std::optional<qm::Value> ClientIdentity::entitlementValueForKey(std::string_view key) const {
    const qm::Value* value = entitlements ? entitlements->get(key) : nullptr;
    if (value == nullptr) {
        return std::nullopt;
    }
    return *value;
}

bool ClientIdentity::hasEntitlement(std::string_view key) const {
    return entitlementGranted(entitlementValueForKey(key));
}
