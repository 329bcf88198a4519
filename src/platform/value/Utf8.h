#pragma once
// Strict UTF-8 (RFC 3629): no overlong forms, no surrogates, nothing above
// U+10FFFF. Every text that crosses the wire or comes from the user is checked
// with these before it becomes a string Value.

#include <cstddef>
#include <string>
#include <string_view>

namespace qm::utf8 {

bool isValid(std::string_view text) noexcept;

// The length (1 to 4) of the well-formed sequence that starts text, or 0 when
// text is empty or does not start with one.
std::size_t sequenceLength(std::string_view text) noexcept;

// Appends the encoding of a scalar value (not a surrogate, at most U+10FFFF).
void appendCodePoint(std::string& out, char32_t codePoint);

}  // namespace qm::utf8
