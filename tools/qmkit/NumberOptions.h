#pragma once
// Numbers given to qmkit's options. A number that does not fit is refused
// with a message saying so, never wrapped or clamped; every message names the
// option, for a usage error.

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/error/Error.h"

// Decimal, or hexadecimal after "0x"; the whole text must be the number.
qm::Result<std::uint64_t, std::string> parseUnsignedOption(std::string_view option, std::string_view text);

// A positive decimal number of seconds ("30", "0.5"), at most
// kMaxOptionSeconds; rounded up to whole milliseconds.
inline constexpr double kMaxOptionSeconds = 1e6;
qm::Result<std::chrono::milliseconds, std::string> parseSecondsOption(std::string_view option, std::string_view text);
