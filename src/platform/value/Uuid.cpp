#include "platform/value/Uuid.h"

#include <uuid/uuid.h>

#include <cstring>

namespace qm {

Uuid Uuid::random() {
    Uuid uuid;
    uuid_generate_random(uuid.bytes.data());
    return uuid;
}

std::optional<Uuid> Uuid::parse(std::string_view text) {
    if (text.size() != 36) {
        return std::nullopt;
    }
    char buffer[37];
    std::memcpy(buffer, text.data(), 36);
    buffer[36] = '\0';
    Uuid uuid;
    if (uuid_parse(buffer, uuid.bytes.data()) != 0) {
        return std::nullopt;
    }
    return uuid;
}

Uuid Uuid::fromBytes(const std::uint8_t* sixteen) {
    Uuid uuid;
    std::memcpy(uuid.bytes.data(), sixteen, 16);
    return uuid;
}

std::string Uuid::text() const {
    char buffer[37];
    uuid_unparse_lower(bytes.data(), buffer);
    return std::string(buffer, 36);
}

bool Uuid::isNull() const noexcept {
    return uuid_is_null(bytes.data()) != 0;
}

std::size_t UuidHash::operator()(const Uuid& uuid) const noexcept {
    std::uint64_t a = 0;
    std::uint64_t b = 0;
    std::memcpy(&a, uuid.bytes.data(), 8);
    std::memcpy(&b, uuid.bytes.data() + 8, 8);
    return static_cast<std::size_t>(a ^ (b * 0x9e3779b97f4a7c15ULL));
}

}  // namespace qm
