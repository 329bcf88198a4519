#pragma once
// Dates as RFC 3339 text in UTC: "2001-01-01T00:00:00Z", with fractional
// seconds (to the microsecond) only when the date is not a whole second.

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace qm::rfc3339 {

// Nothing for a date that is not finite or falls outside the years 0000-9999,
// which the format cannot spell.
std::optional<std::string> format(Date date);

// Full date-time with "T" and an offset ("Z" or +hh:mm / -hh:mm, either case
// for the letters); nothing for anything else or an impossible date or time.
std::optional<Date> parse(std::string_view text);

}  // namespace qm::rfc3339
