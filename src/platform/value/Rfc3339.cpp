#include "platform/value/Rfc3339.h"

#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstdio>

namespace qm::rfc3339 {

namespace {

constexpr std::int64_t kSecondsPerDay = 86400;
constexpr std::int64_t kMicrosPerSecond = 1000000;
// 0000-01-01T00:00:00Z and 10000-01-01T00:00:00Z.
constexpr double kEarliestSeconds = -62167219200.0;
constexpr double kEndSeconds = 253402300800.0;

std::int64_t floorDivide(std::int64_t a, std::int64_t b) {
    std::int64_t quotient = a / b;
    return (a % b != 0 && (a < 0) != (b < 0)) ? quotient - 1 : quotient;
}

struct CivilDate {
    std::int64_t year;
    unsigned month;
    unsigned day;
};

// Days since 1970-01-01 in the proleptic Gregorian calendar (H. Hinnant's
// algorithms, by 400-year eras).
std::int64_t daysFromCivil(std::int64_t year, unsigned month, unsigned day) {
    year -= month <= 2 ? 1 : 0;
    std::int64_t era = floorDivide(year, 400);
    auto yearOfEra = static_cast<unsigned>(year - era * 400);
    unsigned dayOfYear = (153 * (month > 2 ? month - 3 : month + 9) + 2) / 5 + day - 1;
    unsigned dayOfEra = yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear;
    return era * 146097 + static_cast<std::int64_t>(dayOfEra) - 719468;
}

CivilDate civilFromDays(std::int64_t days) {
    days += 719468;
    std::int64_t era = floorDivide(days, 146097);
    auto dayOfEra = static_cast<unsigned>(days - era * 146097);
    unsigned yearOfEra = (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
    unsigned dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
    unsigned monthIndex = (5 * dayOfYear + 2) / 153;
    unsigned day = dayOfYear - (153 * monthIndex + 2) / 5 + 1;
    unsigned month = monthIndex < 10 ? monthIndex + 3 : monthIndex - 9;
    std::int64_t year = static_cast<std::int64_t>(yearOfEra) + era * 400 + (month <= 2 ? 1 : 0);
    return CivilDate{year, month, day};
}

bool isLeapYear(std::int64_t year) {
    return year % 4 == 0 && (year % 100 != 0 || year % 400 == 0);
}

unsigned daysInMonth(std::int64_t year, unsigned month) {
    static constexpr unsigned kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    return month == 2 && isLeapYear(year) ? 29 : kDays[month - 1];
}

// Reads exactly `digits` decimal digits at position, advancing it.
std::optional<unsigned> readDigits(std::string_view text, std::size_t& position, std::size_t digits) {
    if (text.size() - position < digits) {
        return std::nullopt;
    }
    unsigned value = 0;
    for (std::size_t i = 0; i < digits; ++i) {
        char c = text[position + i];
        if (c < '0' || c > '9') {
            return std::nullopt;
        }
        value = value * 10 + static_cast<unsigned>(c - '0');
    }
    position += digits;
    return value;
}

bool expect(std::string_view text, std::size_t& position, char lower, char upper) {
    if (position < text.size() && (text[position] == lower || text[position] == upper)) {
        ++position;
        return true;
    }
    return false;
}

}  // namespace

std::optional<std::string> format(Date date) {
    double seconds = date.secondsSince1970;
    if (!std::isfinite(seconds) || seconds < kEarliestSeconds || seconds >= kEndSeconds) {
        return std::nullopt;
    }
    auto micros = static_cast<std::int64_t>(std::llround(seconds * static_cast<double>(kMicrosPerSecond)));
    std::int64_t wholeSeconds = floorDivide(micros, kMicrosPerSecond);
    std::int64_t fraction = micros - wholeSeconds * kMicrosPerSecond;
    std::int64_t days = floorDivide(wholeSeconds, kSecondsPerDay);
    std::int64_t secondOfDay = wholeSeconds - days * kSecondsPerDay;
    CivilDate civil = civilFromDays(days);
    if (civil.year > 9999) {
        return std::nullopt;  // rounding carried it past the last representable second
    }
    char buffer[48];
    int length = std::snprintf(buffer, sizeof buffer, "%04d-%02u-%02uT%02d:%02d:%02d", static_cast<int>(civil.year),
                               civil.month, civil.day, static_cast<int>(secondOfDay / 3600),
                               static_cast<int>(secondOfDay / 60 % 60), static_cast<int>(secondOfDay % 60));
    std::string text(buffer, static_cast<std::size_t>(length));
    if (fraction != 0) {
        std::snprintf(buffer, sizeof buffer, ".%06d", static_cast<int>(fraction));
        std::string digits(buffer);
        digits.erase(digits.find_last_not_of('0') + 1);
        text += digits;
    }
    text += 'Z';
    return text;
}

std::optional<Date> parse(std::string_view text) {
    std::size_t position = 0;
    auto year = readDigits(text, position, 4);
    if (!year || !expect(text, position, '-', '-')) {
        return std::nullopt;
    }
    auto month = readDigits(text, position, 2);
    if (!month || *month < 1 || *month > 12 || !expect(text, position, '-', '-')) {
        return std::nullopt;
    }
    auto day = readDigits(text, position, 2);
    if (!day || *day < 1 || *day > daysInMonth(*year, *month) || !expect(text, position, 't', 'T')) {
        return std::nullopt;
    }
    auto hour = readDigits(text, position, 2);
    if (!hour || *hour > 23 || !expect(text, position, ':', ':')) {
        return std::nullopt;
    }
    auto minute = readDigits(text, position, 2);
    if (!minute || *minute > 59 || !expect(text, position, ':', ':')) {
        return std::nullopt;
    }
    auto second = readDigits(text, position, 2);
    if (!second || *second > 60) {  // 60: a leap second
        return std::nullopt;
    }
    double fraction = 0;
    if (position < text.size() && text[position] == '.') {
        std::size_t start = position;
        ++position;
        while (position < text.size() && text[position] >= '0' && text[position] <= '9') {
            ++position;
        }
        if (position == start + 1) {
            return std::nullopt;
        }
        std::string digits = "0" + std::string(text.substr(start, position - start));
        auto [end, error] = std::from_chars(digits.data(), digits.data() + digits.size(), fraction);
        if (error != std::errc() || end != digits.data() + digits.size()) {
            return std::nullopt;
        }
    }
    std::int64_t offsetSeconds = 0;
    if (!expect(text, position, 'z', 'Z')) {
        if (position >= text.size() || (text[position] != '+' && text[position] != '-')) {
            return std::nullopt;
        }
        int sign = text[position] == '-' ? -1 : 1;
        ++position;
        auto offsetHour = readDigits(text, position, 2);
        if (!offsetHour || *offsetHour > 23 || !expect(text, position, ':', ':')) {
            return std::nullopt;
        }
        auto offsetMinute = readDigits(text, position, 2);
        if (!offsetMinute || *offsetMinute > 59) {
            return std::nullopt;
        }
        offsetSeconds = sign * static_cast<std::int64_t>(*offsetHour * 3600 + *offsetMinute * 60);
    }
    if (position != text.size()) {
        return std::nullopt;
    }
    std::int64_t whole = daysFromCivil(*year, *month, *day) * kSecondsPerDay + *hour * 3600 + *minute * 60 + *second -
                         offsetSeconds;
    return Date{static_cast<double>(whole) + fraction};
}

}  // namespace qm::rfc3339
