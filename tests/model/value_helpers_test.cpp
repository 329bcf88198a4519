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
    // Each pair in order, the first before the second. Digit runs compare by
    // value, even past any integer type; leading zeros only break ties, fewer
    // first, and the first run that differs in zeros decides; other bytes
    // compare literally, unsigned; a prefix comes first.
    const std::pair<const char*, const char*> ordered[] = {
        {"2.9", "2.10"}, {"9", "10"}, {"1.2.3", "1.2.10"},
        {"1.123456789012345678901234567889", "1.123456789012345678901234567890"},
        {"99999999999999999999999", "100000000000000000000000"},
        {"1.1", "1.01"}, {"1.01", "1.001"}, {"0", "00"}, {"1.01", "1.2"}, {"1.1.8", "1.01.9"}, {"01.1", "1.2"},
        {"1.1.001", "1.01.1"},
        {"1.0a", "1.0b"}, {"1.0B", "1.0a"}, {"1.0", "1.0.1"}, {"1.0", "1.0a"}, {"1-beta", "1.beta"}, {"1.5", "1.x"},
        {"beta2", "beta10"}, {"z", "\xc3\xa9"},
    };
    for (const auto& [a, b] : ordered) {
        EXPECT_EQ(compareVersionString(a, b), std::strong_ordering::less) << a << " vs " << b;
        EXPECT_EQ(compareVersionString(b, a), std::strong_ordering::greater) << b << " vs " << a;
    }
}

TEST(CompareVersionString, IsAStrictTotalOrder) {
    std::vector<std::string> versions{"", "0", "00", "1", "01", "1.0", "1.00", "1.0.0", "1.0a", "1.0b", "1.1",
                                      "1.01", "1.10", "1.9", "2", "2.0", "10", "9", "a", "a1", "a01", "a10",
                                      "1.01.9", "1.1.8", "1-1", "1..1", "\xc3\xa9", "1.2.3b4", "18446744073709551616"};
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
