#pragma once
// The Duct payload codec: one Value as one CBOR data item (RFC 8949).
//
// Value mapping: unsigned integers are major type 0; signed integers major
// type 1 when negative and 0 otherwise; doubles 64-bit floats; strings text;
// data byte strings; dates tag 1 on seconds since 1970; UUIDs tag 37 on 16
// bytes; arrays and dictionaries definite arrays and text-keyed maps; a packed
// property list tag 24 on a byte string holding the encoding of its content.
//
// The decoder refuses anything outside that mapping (indefinite lengths,
// non-text or duplicate map keys, invalid UTF-8, other tags or simple values,
// nesting deeper than kMaxNestingDepth, truncation, trailing bytes). It streams
// through the payload and keeps its own stack, so hostile input costs neither
// deep recursion nor allocations sized by untrusted length fields.

#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/error/Error.h"
#include "platform/value/Value.h"

namespace qm::cbor {

// Every array, map and tag is one level, the top item being level 1; the
// content of a tag 24 continues the count of the tag that holds it.
inline constexpr std::size_t kMaxNestingDepth = 512;

// Decodes one whole payload: exactly one CBOR data item, nothing after it.
// Errors are in the domain "cbor", code 0, with the reason as description.
qm::Result<qm::Value> decode(std::span<const std::uint8_t> payload);

// Appends the encoding of a value to out, integer heads in their shortest form.
void encode(const qm::Value& value, qm::Bytes& out);
qm::Bytes encode(const qm::Value& value);

}  // namespace qm::cbor
