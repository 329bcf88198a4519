// The value type: typed reads, equality by value, sharing on change.

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <tuple>

#include "platform/value/Value.h"

using qm::Array;
using qm::Dictionary;
using qm::Value;

namespace {

TEST(Value, IntegersReadByValueAcrossSignedness) {
    const Value negative(std::int64_t{-1}), huge(std::numeric_limits<std::uint64_t>::max());
    EXPECT_EQ(Value(5u), Value(5));
    EXPECT_EQ(Value(5u), Value(5.0));
    EXPECT_EQ(Value(5).asUnsigned(), 5u);
    EXPECT_EQ(Value(5u).asSigned(), 5);
    EXPECT_FALSE(negative.asUnsigned());
    EXPECT_FALSE(huge.asSigned());
    EXPECT_EQ(Value(std::uint64_t{INT64_MAX}).asSigned(), INT64_MAX);
    EXPECT_NE(negative, huge);  // the same bits, not the same number
    EXPECT_FALSE(Value("5").asUnsigned());
    EXPECT_FALSE(Value(true).asUnsigned());
    EXPECT_NE(Value(true), Value(1));
}

TEST(Value, DictionariesKeepKeysSortedAndRefuseDuplicatesWhenBuilt) {
    auto built = Dictionary::fromEntries({{"b", 2}, {"a", 1}, {"c", 3}});
    ASSERT_TRUE(built);
    std::string order;
    for (const auto& [key, value] : *built) {
        order += key;
    }
    EXPECT_EQ(order, "abc");
    EXPECT_FALSE(Dictionary::fromEntries({{"a", 1}, {"b", 2}, {"a", 3}}));
    EXPECT_EQ(*built->find("b"), Value(2));
    EXPECT_EQ(built->find("d"), nullptr);
}

TEST(Value, ChangingADictionaryGivesACopySharingTheEntriesItLeaves) {
    Value list(Array{1, 2});
    const Dictionary original{{"a", 1}, {"list", list}};
    const std::tuple<const char*, std::optional<Value>, Dictionary> cases[] = {
        {"b", Value("two"), Dictionary{{"a", 1}, {"b", "two"}, {"list", list}}},
        {"a", Value(2), Dictionary{{"a", 2}, {"list", list}}},
        {"a", std::nullopt, Dictionary{{"list", list}}},
        {"zzz", std::nullopt, original},  // removing what is not there is a plain copy
    };
    for (const auto& [key, value, expected] : cases) {
        Dictionary changed = original.changing(key, value);
        EXPECT_EQ(changed, expected) << key;
        EXPECT_TRUE(changed.find("list")->isSameObject(list)) << key;
    }
    EXPECT_EQ(original, (Dictionary{{"a", 1}, {"list", list}})) << "the receiver keeps its entries";
}

TEST(Value, EqualityIsDeepAndTypeAware) {
    qm::Uuid id = qm::Uuid::random();
    auto tree = [&](std::uint8_t last) {
        return Value(Dictionary{{"list", Value(Array{"s", qm::Bytes{1, last}, id, qm::Date{3.5}})}});
    };
    Value a = tree(2), b = tree(2), c = tree(3);
    EXPECT_EQ(a, b);
    EXPECT_NE(a, c);
    EXPECT_NE(Value("1"), Value(1));
    EXPECT_NE(Value(qm::Date{1}), Value(1));
    EXPECT_EQ(Value::packed(a), Value::packed(b));
    EXPECT_NE(Value::packed(a), a);
    EXPECT_EQ(*Value::packed(a).packedContent(), a);
    EXPECT_EQ(Value(), Value());
}

TEST(Value, DescriptionsAreOneReadableLine) {
    Value v(Dictionary{{"request", "bulk"}, {"version", 3}, {"list", Value(Array{Value("a b"), Value(true)})}});
    EXPECT_EQ(v.description(), "{list = (\"a b\", true); request = bulk; version = 3}");
    EXPECT_EQ(Value("line\nbreak").description(), "\"line\\nbreak\"");
    EXPECT_EQ(Value(qm::Bytes{0xde, 0xad, 0xbe, 0xef, 0x01}).description(), "<deadbeef 01>");
}

TEST(Uuid, ParsesAndPrintsTheCanonicalForm) {
    auto parsed = qm::Uuid::parse("123E4567-E89B-12D3-A456-426614174000");
    ASSERT_TRUE(parsed);
    EXPECT_EQ(parsed->text(), "123e4567-e89b-12d3-a456-426614174000");
    EXPECT_FALSE(qm::Uuid::parse("123e4567e89b12d3a456426614174000"));
    EXPECT_FALSE(qm::Uuid::parse("123e4567-e89b-12d3-a456-42661417400g"));
    EXPECT_FALSE(qm::Uuid::parse(""));
    EXPECT_NE(qm::Uuid::random(), qm::Uuid::random());
}

}  // namespace
