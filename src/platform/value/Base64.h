#pragma once
// Base64 (RFC 4648, standard alphabet, padded): how data is spelt in text.

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace qm::base64 {

std::string encode(const Bytes& data);

// Canonical padded base64 only: any other character, a missing or misplaced
// "=", or stray bits in the last character give nothing.
std::optional<Bytes> decode(std::string_view text);

}  // namespace qm::base64
