#pragma once
// Small helpers on values used throughout the daemon.

#include <compare>
#include <optional>
#include <string_view>

#include "platform/value/Value.h"

// A copy of the dictionary with key set to value, or removed when value is
// nothing; entries are shared, not copied. Nothing when dictionary is nothing
// or not a dictionary.
std::optional<qm::Value> dictionaryChanging(const std::optional<qm::Value>& dictionary, std::string_view key,
                                            std::optional<qm::Value> value);

// The order of two version strings: runs of decimal digits at the same place
// compare by numeric value (of any length), other bytes compare literally,
// and a string that is a prefix of the other orders first. So 2.9 < 2.10,
// 9 < 10, and 1.0 == 1.0.
//
// Leading zeros: runs equal in value ("01" and "1") are the same for the
// ordering, as the platform's numeric comparison treats them; only when two
// strings are the same in every other respect does the first run where they
// differ in zeros decide, the one with fewer leading zeros first
// (1.1 < 1.01 < 1.001, yet 1.01 < 1.2 and 1.01.9 > 1.1.8). That keeps the
// order total, so "equal" means "the same string", and never contradicts
// numeric order.
std::strong_ordering compareVersionString(std::string_view a, std::string_view b);

// The value under key in a message or other dictionary when it is an array
// (respectively a dictionary); nothing otherwise or when the key is absent.
// The pointer lives as long as message.
const qm::Array* QMGetDuctArray(const qm::Value& message, std::string_view key);
const qm::Dictionary* QMGetDuctDictionary(const qm::Value& message, std::string_view key);

// Whether an entitlement's value grants it: it exists and is neither the
// Boolean false nor a number equal to zero (any other value, the string "NO"
// included, grants).
bool entitlementGranted(const std::optional<qm::Value>& value);
