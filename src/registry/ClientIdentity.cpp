#include "registry/ClientIdentity.h"

std::optional<qm::Value> ClientIdentity::entitlementValueForKey(std::string_view key) const {
    const qm::Value* value = entitlements ? entitlements->get(key) : nullptr;
    if (value == nullptr) {
        return std::nullopt;
    }
    return *value;
}

bool ClientIdentity::hasEntitlement(std::string_view key) const {
    auto value = entitlementValueForKey(key);
    // Boolean false, and so a number equal to it (0), is the only refusal.
    return value && !(*value == qm::Value(false)) && !(value->isNumber() && *value == qm::Value(0));
}
