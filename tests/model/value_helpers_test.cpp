#include "model/ValueHelpers.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <vector>

namespace {

using qm::Array;
using qm::Dictionary;
using qm::Value;

// How a dictionary changes is the value type's test.
TEST(DictionaryChanging, ChangesOnlyDictionaries) {
    EXPECT_EQ(dictionaryChanging(Value(Dictionary{{"a", 1}}), "b", Value(2)), Value(Dictionary{{"a", 1}, {"b", 2}}));
    EXPECT_FALSE(dictionaryChanging(std::nullopt, "a", Value(1)));
    EXPECT_FALSE(dictionaryChanging(Value(Array{}), "a", Value(1)));
    EXPECT_FALSE(dictionaryChanging(Value("text"), "a", std::nullopt));
}

TEST(CompareVersionString, DigitRunsByValueOtherBytesLiterallyLeadingZerosLast) {
    using std::strong_ordering;
    const std::tuple<const char*, const char*, strong_ordering> cases[] = {
        {"2.10", "2.9", strong_ordering::greater},
        {"10", "9", strong_ordering::greater},
        {"1.0", "1.0", strong_ordering::equal},
        {"1.2.3", "1.2.10", strong_ordering::less},
        {"", "", strong_ordering::equal},
        // Runs longer than any integer type.
        {"1.123456789012345678901234567890", "1.123456789012345678901234567889", strong_ordering::greater},
        {"99999999999999999999999", "100000000000000000000000", strong_ordering::less},
        {"18446744073709551616", "18446744073709551616", strong_ordering::equal},
        // Leading zeros only break ties: fewer first, never against the numeric order.
        {"1.1", "1.01", strong_ordering::less},
        {"1.01", "1.001", strong_ordering::less},
        {"0", "00", strong_ordering::less},
        {"1.01", "1.2", strong_ordering::less},
        {"1.01.9", "1.1.8", strong_ordering::greater},
        {"01.1", "1.2", strong_ordering::less},
        {"1.01.1", "1.1.001", strong_ordering::greater},  // the first run that differs in zeros decides
        // Other characters compare literally, as unsigned bytes; a prefix first.
        {"1.0a", "1.0b", strong_ordering::less},
        {"1.0B", "1.0a", strong_ordering::less},
        {"1.0", "1.0.1", strong_ordering::less},
        {"1.0", "1.0a", strong_ordering::less},
        {"1-beta", "1.beta", strong_ordering::less},
        {"1.x", "1.5", strong_ordering::greater},
        {"beta2", "beta10", strong_ordering::less},
        {"\xc3\xa9", "z", strong_ordering::greater},
    };
    for (const auto& [a, b, order] : cases) {
        EXPECT_EQ(compareVersionString(a, b), order) << a << " vs " << b;
        EXPECT_EQ(compareVersionString(b, a), 0 <=> order) << b << " vs " << a;
    }
}

TEST(CompareVersionString, IsAStrictTotalOrder) {
    std::vector<std::string> versions{"", "0", "00", "1", "01", "1.0", "1.00", "1.0.0", "1.0a", "1.0b", "1.1",
                                      "1.01", "1.10", "1.9", "2", "2.0", "10", "9", "a", "a1", "a01", "a10",
                                      "1.01.9", "1.1.8", "1-1", "1..1", "\xc3\xa9", "1.2.3b4"};
    for (const auto& a : versions) {
        for (const auto& b : versions) {
            auto ab = compareVersionString(a, b);
            EXPECT_EQ(ab, 0 <=> (compareVersionString(b, a) <=> 0)) << a << " vs " << b;
            EXPECT_EQ(ab == 0, a == b) << a << " vs " << b;
            for (const auto& c : versions) {
                if (ab < 0 && compareVersionString(b, c) < 0) {
                    EXPECT_TRUE(compareVersionString(a, c) < 0) << a << " < " << b << " < " << c;
                }
            }
        }
    }
}

TEST(QMGetDuct, TypedReadsGiveTheValueOnlyWhenItHasThatType) {
    Value message(Dictionary{{"list", Value(Array{1})}, {"rules", Value(Dictionary{{"k", "v"}})}, {"text", "x"}});
    ASSERT_TRUE(QMGetDuctArray(message, "list"));
    EXPECT_EQ(*QMGetDuctArray(message, "list"), Array{1});
    ASSERT_TRUE(QMGetDuctDictionary(message, "rules"));
    EXPECT_TRUE(QMGetDuctDictionary(message, "rules")->contains("k"));
    EXPECT_FALSE(QMGetDuctArray(message, "rules"));
    EXPECT_FALSE(QMGetDuctDictionary(message, "list"));
    EXPECT_FALSE(QMGetDuctArray(message, "text"));
    EXPECT_FALSE(QMGetDuctDictionary(message, "missing"));
    EXPECT_FALSE(QMGetDuctArray(Value(Array{}), "list"));
    EXPECT_FALSE(QMGetDuctDictionary(Value(), "rules"));
}

}  // namespace
