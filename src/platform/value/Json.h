#pragma once
// The JSON spelling of Values, for people: qmkit prints replies with it and
// reads values typed on its command line.
//
// Writing: numbers exactly (doubles in a short form that reads back to the
// same double, always with a point or an exponent so they stay doubles; NaN
// and infinities as null), strings escaped with invalid UTF-8 replaced by
// U+FFFD, UUIDs as canonical text, dates as RFC 3339 UTC text, data as base64
// text, a packed property list as the value it holds, dictionaries as objects
// with sorted keys.
//
// Parsing is strict RFC 8259 (a leading byte-order mark is skipped). An
// integer without fraction or exponent becomes an unsigned integer, or a
// signed one when negative, and is refused when it does not fit in 64 bits;
// other numbers are doubles. Refused as well: duplicate keys, lone surrogates
// and text that is not UTF-8. An object whose one key is "$uuid", "$data" or
// "$date" spells a UUID (canonical text), data (base64) or a date (RFC 3339).

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
// ("... at line 3, column 7"; columns count bytes from 1).
qm::Result<qm::Value> parse(std::string_view text);

}  // namespace qm::json
