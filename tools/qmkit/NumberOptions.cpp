#include "NumberOptions.h"

#include <charconv>
#include <cmath>
#include <limits>

namespace {

std::string tooLarge(std::string_view option, std::string_view text, const std::string& maximum) {
    return std::string(option) + " " + std::string(text) + " is too large (at most " + maximum + ")";
}

}  // namespace

qm::Result<std::uint64_t, std::string> parseUnsignedOption(std::string_view option, std::string_view text) {
    std::string_view digits = text;
    int base = 10;
    if (digits.size() > 2 && digits[0] == '0' && (digits[1] == 'x' || digits[1] == 'X')) {
        digits.remove_prefix(2);
        base = 16;
    }
    std::uint64_t value = 0;
    auto [end, error] = std::from_chars(digits.data(), digits.data() + digits.size(), value, base);
    if (digits.empty() || end != digits.data() + digits.size() ||
        (error != std::errc() && error != std::errc::result_out_of_range)) {
        return std::string(option) + " must be a number (decimal or 0x-hex), not \"" + std::string(text) + "\"";
    }
    if (error == std::errc::result_out_of_range) {
        return tooLarge(option, text, std::to_string(std::numeric_limits<std::uint64_t>::max()));
    }
    return value;
}

qm::Result<std::chrono::milliseconds, std::string> parseSecondsOption(std::string_view option, std::string_view text) {
    double seconds = 0;
    // from_chars would take a sign, "inf" and "nan" too.
    bool startsWell = !text.empty() && (text[0] == '.' || (text[0] >= '0' && text[0] <= '9'));
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), seconds, std::chars_format::fixed);
    if (!startsWell || end != text.data() + text.size() ||
        (error != std::errc() && error != std::errc::result_out_of_range) || (error == std::errc() && seconds <= 0)) {
        return std::string(option) + " must be a positive number of seconds, not \"" + std::string(text) + "\"";
    }
    if (error == std::errc::result_out_of_range) {
        // Beyond a double: too large, or so small that it rounds up to the least timeout.
        bool whole = text.substr(0, text.find('.')).find_first_not_of('0') != std::string_view::npos;
        seconds = whole ? std::numeric_limits<double>::infinity() : 0.001;
    }
    if (seconds > kMaxOptionSeconds) {
        return tooLarge(option, text, std::to_string(static_cast<long long>(kMaxOptionSeconds)));
    }
    return std::chrono::milliseconds(static_cast<std::int64_t>(std::ceil(seconds * 1000)));
}
