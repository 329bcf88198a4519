#include "model/ValueHelpers.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

namespace {

TEST(DictionaryChanging, SetsAKeyInACopy) {
    qm::Value original(qm::Dictionary{{"a", qm::Value(1)}});
    auto changed = dictionaryChanging(original, "b", qm::Value("two"));
    ASSERT_TRUE(changed);
    EXPECT_EQ(*changed, qm::Value(qm::Dictionary{{"a", qm::Value(1)}, {"b", qm::Value("two")}}));
    EXPECT_EQ(original, qm::Value(qm::Dictionary{{"a", qm::Value(1)}}));
}

TEST(DictionaryChanging, ReplacesAnExistingKey) {
    qm::Value original(qm::Dictionary{{"a", qm::Value(1)}});
    auto changed = dictionaryChanging(original, "a", qm::Value(2));
    ASSERT_TRUE(changed);
    EXPECT_EQ(changed->get("a")->asSigned(), 2);
    EXPECT_EQ(original.get("a")->asSigned(), 1);
}

TEST(DictionaryChanging, NothingRemovesTheKeyButTheReceiverKeepsIt) {
    qm::Value original(qm::Dictionary{{"a", qm::Value(1)}, {"b", qm::Value(2)}});
    auto changed = dictionaryChanging(original, "a", std::nullopt);
    ASSERT_TRUE(changed);
    EXPECT_FALSE(changed->get("a"));
    EXPECT_TRUE(changed->get("b"));
    EXPECT_TRUE(original.get("a"));
    // Removing a key that is not there is a plain copy.
    EXPECT_EQ(dictionaryChanging(original, "zzz", std::nullopt), original);
}

TEST(DictionaryChanging, EntriesAreSharedNotCopied) {
    qm::Value list(qm::Array{qm::Value(1), qm::Value(2)});
    qm::Value original(qm::Dictionary{{"list", list}});
    auto changed = dictionaryChanging(original, "other", qm::Value(true));
    ASSERT_TRUE(changed);
    EXPECT_TRUE(changed->get("list")->isSameObject(list));
}

TEST(DictionaryChanging, NothingForNothingOrANonDictionary) {
    EXPECT_FALSE(dictionaryChanging(std::nullopt, "a", qm::Value(1)));
    EXPECT_FALSE(dictionaryChanging(qm::Value(qm::Array{}), "a", qm::Value(1)));
    EXPECT_FALSE(dictionaryChanging(qm::Value("text"), "a", std::nullopt));
}

TEST(CompareVersionString, DigitRunsCompareByValue) {
    EXPECT_EQ(compareVersionString("2.10", "2.9"), std::strong_ordering::greater);
    EXPECT_EQ(compareVersionString("2.9", "2.10"), std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("10", "9"), std::strong_ordering::greater);
    EXPECT_EQ(compareVersionString("1.0", "1.0"), std::strong_ordering::equal);
    EXPECT_EQ(compareVersionString("1.2.3", "1.2.10"), std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("", ""), std::strong_ordering::equal);
}

TEST(CompareVersionString, RunsLongerThanAnyIntegerType) {
    EXPECT_EQ(compareVersionString("1.123456789012345678901234567890", "1.123456789012345678901234567889"),
              std::strong_ordering::greater);
    EXPECT_EQ(compareVersionString("99999999999999999999999", "100000000000000000000000"),
              std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("18446744073709551616", "18446744073709551616"), std::strong_ordering::equal);
}

TEST(CompareVersionString, LeadingZerosOnlyBreakTies) {
    // Numerically the same: fewer leading zeros first, so equal still means identical.
    EXPECT_EQ(compareVersionString("1.1", "1.01"), std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("1.01", "1.001"), std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("0", "00"), std::strong_ordering::less);
    // Never against the numeric order.
    EXPECT_EQ(compareVersionString("1.01", "1.2"), std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("1.01.9", "1.1.8"), std::strong_ordering::greater);
    EXPECT_EQ(compareVersionString("01.1", "1.2"), std::strong_ordering::less);
    // The first run that differs in zeros decides.
    EXPECT_EQ(compareVersionString("1.01.1", "1.1.001"), std::strong_ordering::greater);
}

TEST(CompareVersionString, OtherCharactersCompareLiterally) {
    EXPECT_EQ(compareVersionString("1.0a", "1.0b"), std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("1.0B", "1.0a"), std::strong_ordering::less);  // by byte, not by case
    EXPECT_EQ(compareVersionString("1.0", "1.0.1"), std::strong_ordering::less);  // a prefix first
    EXPECT_EQ(compareVersionString("1.0", "1.0a"), std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("1-beta", "1.beta"), std::strong_ordering::less);  // '-' < '.'
    EXPECT_EQ(compareVersionString("1.x", "1.5"), std::strong_ordering::greater);      // 'x' > '5'
    EXPECT_EQ(compareVersionString("beta2", "beta10"), std::strong_ordering::less);
    EXPECT_EQ(compareVersionString("\xc3\xa9", "z"), std::strong_ordering::greater);   // bytes, unsigned
}

TEST(CompareVersionString, IsAStrictTotalOrder) {
    std::vector<std::string> versions{"", "0", "00", "1", "01", "1.0", "1.00", "1.0.0", "1.0a", "1.0b", "1.1",
                                      "1.01", "1.10", "1.9", "2", "2.0", "10", "9", "a", "a1", "a01", "a10",
                                      "1.01.9", "1.1.8", "1-1", "1..1", "\xc3\xa9", "1.2.3b4"};
    for (const auto& a : versions) {
        EXPECT_EQ(compareVersionString(a, a), std::strong_ordering::equal) << a;
        for (const auto& b : versions) {
            auto ab = compareVersionString(a, b);
            auto ba = compareVersionString(b, a);
            EXPECT_EQ(ab, 0 <=> (ba <=> 0)) << a << " vs " << b;
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
    qm::Value message(qm::Dictionary{{"list", qm::Value(qm::Array{qm::Value(1)})},
                                     {"rules", qm::Value(qm::Dictionary{{"k", qm::Value("v")}})},
                                     {"text", qm::Value("x")}});
    const qm::Array* list = QMGetDuctArray(message, "list");
    ASSERT_TRUE(list);
    EXPECT_EQ(list->size(), 1u);
    const qm::Dictionary* rules = QMGetDuctDictionary(message, "rules");
    ASSERT_TRUE(rules);
    EXPECT_TRUE(rules->contains("k"));

    EXPECT_FALSE(QMGetDuctArray(message, "rules"));
    EXPECT_FALSE(QMGetDuctDictionary(message, "list"));
    EXPECT_FALSE(QMGetDuctArray(message, "text"));
    EXPECT_FALSE(QMGetDuctDictionary(message, "missing"));
    EXPECT_FALSE(QMGetDuctArray(qm::Value(qm::Array{}), "list"));
    EXPECT_FALSE(QMGetDuctDictionary(qm::Value(), "rules"));
}

}  // namespace
