#pragma once
// A 16-byte UUID (libuuid underneath), with its canonical 36-character text.

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace qm {

struct Uuid {
    std::array<std::uint8_t, 16> bytes{};

    static Uuid random();
    // Canonical text (8-4-4-4-12 hex digits, either case); nothing otherwise.
    static std::optional<Uuid> parse(std::string_view text);
    static Uuid fromBytes(const std::uint8_t* sixteen);

    std::string text() const;  // lower-case canonical form
    bool isNull() const noexcept;
    auto operator<=>(const Uuid&) const = default;
};

struct UuidHash {
    std::size_t operator()(const Uuid& uuid) const noexcept;
};

}  // namespace qm
