#pragma once
// The JSON spelling of Values, for people: qmkit prints replies with it and
// reads values typed on its command line.
//
// Writing: numbers exactly (doubles in their shortest round-trip form, a whole
// double with ".0", NaN and infinities as null), strings escaped with invalid
// UTF-8 replaced by U+FFFD, UUIDs as canonical text, dates as RFC 3339 UTC
// text, data as base64 text, a packed property list as the value it holds,
// dictionaries as objects with sorted keys.
//
// Parsing is strict RFC 8259. An integer without fraction or exponent becomes
// an unsigned integer, or a signed one when negative; other numbers are
// doubles. An object whose one key is "$uuid", "$data" or "$date" spells a
// UUID (canonical text), data (base64) or a date (RFC 3339).

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/error/Error.h"
#include "platform/value/Value.h"

namespace qm::json {

// Arrays and objects nested deeper than this are refused by parse.
inline constexpr std::size_t kMaxNestingDepth = 512;

// pretty: one item per line, indented by two spaces per level.
std::string write(const qm::Value& value, bool pretty);

// Errors are in the domain "json", code 0, and say what is wrong where
// ("... at line 3, column 7").
qm::Result<qm::Value> parse(std::string_view text);

}  // namespace qm::json
