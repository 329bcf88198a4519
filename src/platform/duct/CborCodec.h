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
//
// Decoding cannot amplify: the decoder adds up what the tree will allocate as
// it goes, and refuses a payload whose tree would pass decodedSizeBound() of
// its size before building that part of it.

#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/error/Error.h"
#include "platform/value/Value.h"

namespace qm::cbor {

// Every array, map and tag is one level, the top item being level 1; the
// content of a tag 24 continues the count of the tag that holds it.
inline constexpr std::size_t kMaxNestingDepth = 512;

// The most a payload of this many bytes may allocate once decoded: 16 bytes
// for each of its bytes, and never less than 64 KiB.
inline constexpr std::size_t kMaxDecodedBytesPerByte = 16;
inline constexpr std::size_t kMinDecodedAllowance = 64 * 1024;
constexpr std::size_t decodedSizeBound(std::size_t payloadSize) {
    return payloadSize > kMinDecodedAllowance / kMaxDecodedBytesPerByte ? payloadSize * kMaxDecodedBytesPerByte
                                                                        : kMinDecodedAllowance;
}

struct Decoded {
    qm::Value value;
    std::size_t allocatedBytes = 0;  // heap bytes the tree takes, as the decoder counted them
};

// Decodes one whole payload: exactly one CBOR data item, nothing after it.
// Errors are in the domain "cbor", code 0, with the reason as description.
qm::Result<qm::Value> decode(std::span<const std::uint8_t> payload);
// The same, also telling what the tree allocated (for memory budgets).
qm::Result<Decoded> decodeMeasured(std::span<const std::uint8_t> payload);

// Appends the encoding of a value to out, integer heads in their shortest form.
void encode(const qm::Value& value, qm::Bytes& out);
qm::Bytes encode(const qm::Value& value);

}  // namespace qm::cbor
