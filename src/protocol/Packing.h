#pragma once
// The packed property-list value that carries "matches": a whole property
// list as one message value, used only at protocol version 3 (a version-2
// reply has no "matches" at all).

#include <cstdint>
#include <optional>

#include "platform/value/Value.h"
#include "protocol/WireKeys.h"

namespace wire {

// The property list packed into one message value at version 3; nothing at
// any other version.
inline std::optional<qm::Value> convertToDuct(const qm::Value& propertyList, std::uint64_t version) {
    if (version != kCurrentVersion) {
        return std::nullopt;
    }
    return qm::Value::packed(propertyList);
}

// The property list a packed value holds, at version 3; nothing for another
// version or a value that is not packed.
inline std::optional<qm::Value> convertFromDuct(const qm::Value& packed, std::uint64_t version) {
    const qm::Value* content = version == kCurrentVersion ? packed.packedContent() : nullptr;
    if (content == nullptr) {
        return std::nullopt;
    }
    return *content;
}

}  // namespace wire
