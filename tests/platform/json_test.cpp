// The JSON spelling of Values: what is written for each type, what is read
// back, the "$uuid" / "$data" / "$date" forms, and the refusals.

#include <gtest/gtest.h>

#include <cmath>
#include <initializer_list>
#include <limits>
#include <string>
#include <utility>

#include "platform/value/Json.h"

namespace qm {
namespace {

Value parsed(std::string_view text) {
    auto result = json::parse(text);
    EXPECT_TRUE(result.ok()) << text << ": " << (result.ok() ? "" : result.error().text());
    return result.ok() ? result.value() : Value("<parse failed>");
}

std::string refusal(std::string_view text) {
    auto result = json::parse(text);
    if (result.ok()) {
        return "accepted: " + result.value().description();
    }
    EXPECT_EQ(result.error().domain, "json");
    return result.error().text();
}

std::string compact(const Value& value) {
    return json::write(value, false);
}

const Uuid kUuid = *Uuid::parse("00112233-4455-6677-8899-aabbccddeeff");

TEST(JsonWrite, Scalars) {
    EXPECT_EQ(compact(Value()), "null");
    EXPECT_EQ(compact(Value(true)), "true");
    EXPECT_EQ(compact(Value(false)), "false");
    EXPECT_EQ(compact(Value(std::numeric_limits<std::uint64_t>::max())), "18446744073709551615");
    EXPECT_EQ(compact(Value(std::numeric_limits<std::int64_t>::min())), "-9223372036854775808");
    EXPECT_EQ(compact(Value(0.1)), "0.1");
    EXPECT_EQ(compact(Value(-2.5)), "-2.5");
    EXPECT_EQ(compact(Value(5.0)), "5.0");
    EXPECT_EQ(compact(Value(1e300)), "1e+300");
    EXPECT_EQ(compact(Value(std::nan(""))), "null");
    EXPECT_EQ(compact(Value(-std::numeric_limits<double>::infinity())), "null");
    EXPECT_EQ(compact(Value(kUuid)), "\"00112233-4455-6677-8899-aabbccddeeff\"");
    EXPECT_EQ(compact(Value(Bytes{0, 1, 2, 3})), "\"AAECAw==\"");
    EXPECT_EQ(compact(Value(Bytes{0xFF, 0xEE})), "\"/+4=\"");
    EXPECT_EQ(compact(Value(Bytes{})), "\"\"");
}

TEST(JsonWrite, DatesAsRfc3339Utc) {
    EXPECT_EQ(compact(Value(Date{978307200})), "\"2001-01-01T00:00:00Z\"");
    EXPECT_EQ(compact(Value(Date{978307200.25})), "\"2001-01-01T00:00:00.25Z\"");
    EXPECT_EQ(compact(Value(Date{0})), "\"1970-01-01T00:00:00Z\"");
    EXPECT_EQ(compact(Value(Date{-1})), "\"1969-12-31T23:59:59Z\"");
    EXPECT_EQ(compact(Value(Date{-0.5})), "\"1969-12-31T23:59:59.5Z\"");
    EXPECT_EQ(compact(Value(Date{951782400})), "\"2000-02-29T00:00:00Z\"");
    EXPECT_EQ(compact(Value(Date{253402300799})), "\"9999-12-31T23:59:59Z\"");
    EXPECT_EQ(compact(Value(Date{-62167219200})), "\"0000-01-01T00:00:00Z\"");
    // Outside what the format can spell: the seconds themselves.
    EXPECT_EQ(compact(Value(Date{1e15})), "1e+15");
}

TEST(JsonWrite, StringsAreEscapedAndKeepTheirUtf8) {
    EXPECT_EQ(compact(Value("a\"b\\c/d")), R"("a\"b\\c/d")");
    EXPECT_EQ(compact(Value("\n\t\r\b\f")), R"("\n\t\r\b\f")");
    EXPECT_EQ(compact(Value(std::string("\x01\x1f\0z", 4))), R"("\u0001\u001f\u0000z")");
    EXPECT_EQ(compact(Value("h\xC3\xA9 \xF0\x9F\x98\x80")), "\"h\xC3\xA9 \xF0\x9F\x98\x80\"");
    // Bytes that are not UTF-8 cannot be written as they are.
    EXPECT_EQ(compact(Value("a\xFF" "b\xED\xA0\x80")), "\"a\xEF\xBF\xBD" "b\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD\"");
}

TEST(JsonWrite, ContainersCompactAndPretty) {
    Value value(Dictionary{
        {"b", Value(Array{Value(1u), Value(Array{}), Value(Dictionary{})})},
        {"a", Value::packed(Value(Dictionary{{"x", Value("y")}}))},
    });
    EXPECT_EQ(compact(value), R"({"a":{"x":"y"},"b":[1,[],{}]})");
    EXPECT_EQ(json::write(value, true),
              "{\n"
              "  \"a\": {\n"
              "    \"x\": \"y\"\n"
              "  },\n"
              "  \"b\": [\n"
              "    1,\n"
              "    [],\n"
              "    {}\n"
              "  ]\n"
              "}");
    EXPECT_EQ(json::write(Value(Array{}), true), "[]");
    EXPECT_EQ(json::write(Value(7u), true), "7");
}

TEST(JsonParse, ScalarsWithTheirTypes) {
    EXPECT_TRUE(parsed("null").isNull());
    EXPECT_EQ(parsed(" true ").asBool(), true);
    EXPECT_EQ(parsed("false").asBool(), false);

    Value zero = parsed("0");
    EXPECT_EQ(zero.type(), ValueType::unsignedInteger);
    Value max = parsed("18446744073709551615");
    EXPECT_EQ(max.type(), ValueType::unsignedInteger);
    EXPECT_EQ(max.asUnsigned(), std::numeric_limits<std::uint64_t>::max());
    Value negative = parsed("-42");
    EXPECT_EQ(negative.type(), ValueType::signedInteger);
    EXPECT_EQ(negative.asSigned(), -42);
    Value min = parsed("-9223372036854775808");
    EXPECT_EQ(min.type(), ValueType::signedInteger);
    EXPECT_EQ(min.asSigned(), std::numeric_limits<std::int64_t>::min());
    EXPECT_EQ(parsed("-0").type(), ValueType::signedInteger);

    using TextAndNumber = std::pair<const char*, double>;
    for (auto [text, expected] : std::initializer_list<TextAndNumber>{
             {"1.0", 1.0}, {"-0.5", -0.5}, {"1e2", 100.0}, {"2.5E-3", 0.0025}, {"1E+2", 100.0}, {"0.1", 0.1}}) {
        Value real = parsed(text);
        EXPECT_EQ(real.type(), ValueType::real) << text;
        EXPECT_EQ(real.asDouble(), expected) << text;
    }
}

TEST(JsonParse, StringsWithEscapesAndSurrogatePairs) {
    EXPECT_EQ(parsed(R"("a\"b\\c\/d\b\f\n\r\t")"), Value("a\"b\\c/d\b\f\n\r\t"));
    EXPECT_EQ(parsed(R"("\u00e9\u00E9")"), Value("\xC3\xA9\xC3\xA9"));
    EXPECT_EQ(parsed(R"("\u0000")"), Value(std::string("\0", 1)));
    EXPECT_EQ(parsed(R"("\ud83d\ude00")"), Value("\xF0\x9F\x98\x80"));
    EXPECT_EQ(parsed("\"h\xC3\xA9 \xF0\x9F\x98\x80\""), Value("h\xC3\xA9 \xF0\x9F\x98\x80"));
}

TEST(JsonParse, ContainersBecomeArraysAndSortedDictionaries) {
    Value value = parsed(R"( { "b" : [1, -1, 1.5, "s", null, true], "a": {}, "c": [] } )");
    EXPECT_EQ(value, Value(Dictionary{
                         {"a", Value(Dictionary{})},
                         {"b", Value(Array{Value(1u), Value(-1), Value(1.5), Value("s"), Value(), Value(true)})},
                         {"c", Value(Array{})},
                     }));
    ASSERT_NE(value.asDictionary(), nullptr);
    EXPECT_EQ(value.asDictionary()->begin()->first, "a");
}

TEST(JsonParse, DollarFormsSpellTheOtherTypes) {
    EXPECT_EQ(parsed(R"({"$uuid": "00112233-4455-6677-8899-AABBCCDDEEFF"})").asUuid(), kUuid);
    Value data = parsed(R"({"$data": "AAECAw=="})");
    ASSERT_NE(data.asData(), nullptr);
    EXPECT_EQ(*data.asData(), (Bytes{0, 1, 2, 3}));
    EXPECT_EQ(parsed(R"({"$data": ""})").asData()->size(), 0u);
    EXPECT_EQ(parsed(R"({"$date": "2001-01-01T00:00:00Z"})").asDate(), Date{978307200});
    EXPECT_EQ(parsed(R"({"$date": "2001-01-01t01:30:00.25+01:30"})").asDate(), Date{978307200.25});
    EXPECT_EQ(parsed(R"({"$date": "1969-12-31T23:59:59-00:00"})").asDate(), Date{-1});
    EXPECT_EQ(parsed(R"({"$date": "2000-02-29T23:59:60Z"})").asDate(), Date{951868800});  // leap second

    // Any other object is a dictionary, even with such a key among others.
    Value two = parsed(R"({"$uuid": "x", "other": 1})");
    EXPECT_EQ(two.get("$uuid")->asString() ? *two.get("$uuid")->asString() : "", "x");
    EXPECT_EQ(parsed(R"({"$other": 1})").get("$other")->asUnsigned(), 1u);

    EXPECT_EQ(refusal(R"({"$uuid": "0011"})"), "\"$uuid\" needs a UUID in canonical text at line 1, column 1");
    EXPECT_EQ(refusal(R"({"$uuid": 5})"), "\"$uuid\" needs a UUID in canonical text at line 1, column 1");
    for (auto bad : {R"("AAECAw")", R"("AAECAw=")", R"("AA=CAw==")", R"("AAECA*==")", R"("AB==")", R"(["AA=="])"}) {
        EXPECT_EQ(refusal(std::string(R"([{"$data": )") + bad + "}]"),
                  "\"$data\" needs base64 text at line 1, column 2")
            << bad;
    }
    for (auto bad : {"2001-01-01", "2001-01-01T00:00:00", "2001-13-01T00:00:00Z", "2001-02-29T00:00:00Z",
                     "2001-01-01T24:00:00Z", "2001-01-01T00:60:00Z", "2001-01-01T00:00:00.Z", "2001-01-01T00:00:00+1:00",
                     "2001-01-01 00:00:00Z", "2001-01-01T00:00:00Zjunk", "x"}) {
        EXPECT_EQ(refusal(std::string(R"({"$date": ")") + bad + "\"}"),
                  "\"$date\" needs an RFC 3339 date-time at line 1, column 1")
            << bad;
    }
}

TEST(JsonParse, RefusalsSayWhatAndWhere) {
    struct Case {
        std::string text;
        std::string reason;
    };
    for (const auto& [text, reason] : {
             Case{"", "unexpected end of text at line 1, column 1"},
             Case{"  ", "unexpected end of text at line 1, column 3"},
             Case{R"({"a": 1, "a": 2})", "duplicate key \"a\" in object at line 1, column 1"},
             Case{"[1,\n {\"k\":1, \"j\":2, \"k\":3}]", "duplicate key \"k\" in object at line 2, column 2"},
             Case{R"("\x")", "bad escape at line 1, column 2"},
             Case{R"("\u12G4")", "bad \\u escape at line 1, column 4"},
             Case{R"("\ud83d")", "lone surrogate in \\u escape at line 1, column 2"},
             Case{R"("\ud83d\u0041")", "lone surrogate in \\u escape at line 1, column 2"},
             Case{R"("\ude00")", "lone surrogate in \\u escape at line 1, column 2"},
             Case{"\"a\xFF\"", "text is not UTF-8 at line 1, column 3"},
             Case{"\"\xC0\x80\"", "text is not UTF-8 at line 1, column 2"},
             Case{"\"\xED\xA0\x80\"", "text is not UTF-8 at line 1, column 2"},
             Case{"\"a\nb\"", "control character in string at line 1, column 3"},
             Case{"\"abc", "unterminated string at line 1, column 5"},
             Case{"1 2", "unexpected characters after the value at line 1, column 3"},
             Case{"[1]x", "unexpected characters after the value at line 1, column 4"},
             Case{"{} {}", "unexpected characters after the value at line 1, column 4"},
             Case{"[1,]", "unexpected character at line 1, column 4"},
             Case{"[1 2]", "expected ',' or ']' at line 1, column 4"},
             Case{"{\"a\" 1}", "expected ':' at line 1, column 6"},
             Case{"{\"a\":1,}", "expected a string key at line 1, column 8"},
             Case{"{a:1}", "expected a string key at line 1, column 2"},
             Case{"{\"a\":1 \"b\":2}", "expected ',' or '}' at line 1, column 8"},
             Case{"[", "unexpected end of text at line 1, column 2"},
             Case{"tru", "unexpected character at line 1, column 1"},
             Case{"NaN", "unexpected character at line 1, column 1"},
             Case{"'a'", "unexpected character at line 1, column 1"},
             Case{"01", "bad number: leading zero at line 1, column 1"},
             Case{"-", "bad number at line 1, column 2"},
             Case{"1.", "bad number at line 1, column 3"},
             Case{".5", "unexpected character at line 1, column 1"},
             Case{"1e", "bad number at line 1, column 3"},
             Case{"+1", "unexpected character at line 1, column 1"},
             Case{"18446744073709551616", "integer out of 64-bit range at line 1, column 1"},
             Case{"-9223372036854775809", "integer out of 64-bit range at line 1, column 1"},
             Case{"1e400", "number out of range at line 1, column 1"},
         }) {
        EXPECT_EQ(refusal(text), reason) << text;
    }
}

TEST(JsonParse, NestingIsLimitedTo512Levels) {
    auto nested = [](std::size_t depth) { return std::string(depth, '[') + std::string(depth, ']'); };
    EXPECT_TRUE(json::parse(nested(512)).ok());
    EXPECT_EQ(refusal(nested(513)), "nesting deeper than 512 levels at line 1, column 513");
    std::string objects;
    for (int i = 0; i < 513; ++i) {
        objects += "{\"k\":";
    }
    EXPECT_EQ(refusal(objects + "1" + std::string(513, '}')), "nesting deeper than 512 levels at line 1, column 2561");
    // Hostile depth costs an error, not the stack.
    EXPECT_EQ(refusal(std::string(100000, '[')), "nesting deeper than 512 levels at line 1, column 513");
}

TEST(Json, WrittenTextParsesBackToTheSameValue) {
    Value value(Dictionary{
        {"n", Value(std::int64_t{-7})},
        {"u", Value(std::numeric_limits<std::uint64_t>::max())},
        {"d", Value(0.30000000000000004)},
        {"whole", Value(3.0)},
        {"s", Value("line\nbreak \"quoted\" \xE2\x82\xAC \x01")},
        {"list", Value(Array{Value(), Value(true), Value(Array{Value(Dictionary{})})})},
    });
    for (bool pretty : {false, true}) {
        Value back = parsed(json::write(value, pretty));
        EXPECT_EQ(back, value);
        EXPECT_EQ(back.get("whole")->type(), ValueType::real);
        EXPECT_EQ(back.get("n")->type(), ValueType::signedInteger);
    }
}

}  // namespace
}  // namespace qm
