#pragma once
// The text of a sandbox extension token:
//   qm1;<class>;<hex of the path's bytes>;<hex HMAC-SHA256>
// The HMAC is taken with the token key over everything before the last ';'.
// Hex is lower case, and a token is genuine only when its text is exactly
// the text this side would write, so each grant has one spelling. Pure
// functions; safe on any thread.

#include <optional>
#include <string>
#include <string_view>

#include "platform/sandbox/TokenKey.h"

namespace qm {

// The access class of read tokens.
inline constexpr const char* kReadTokenClass = "read";

// What a genuine token grants.
struct TokenGrant {
    std::string tokenClass;
    std::string path;
    bool operator==(const TokenGrant&) const = default;
};

// The token for the grant. The class must be non-empty and hold no ';'.
std::string signToken(const TokenGrant& grant, const TokenKeyBytes& key);

// The grant of a token signed with this key; nothing for any other text.
// The signature is compared in constant time.
std::optional<TokenGrant> openToken(std::string_view token, const TokenKeyBytes& key);

}  // namespace qm
