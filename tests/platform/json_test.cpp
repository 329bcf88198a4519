// The JSON spelling of Values: what is written for each type, what is read
// back, the "$uuid" / "$data" / "$date" forms (and through them base64 and
// RFC 3339), and the refusals with where they are.

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>
#include <tuple>
#include <vector>

#include "platform/value/Json.h"

namespace qm {
namespace {

const Uuid kUuid = *Uuid::parse("00112233-4455-6677-8899-aabbccddeeff");
constexpr auto kU64Max = std::numeric_limits<std::uint64_t>::max();
constexpr auto kI64Min = std::numeric_limits<std::int64_t>::min();

TEST(Json, WritesEachTypeInItsSpelling) {
    // A double takes the fewest digits that read back as it, and a whole
    // one stays a double when read back; a date without a calendar spelling
    // is the seconds themselves; bytes that are not UTF-8 cannot be written
    // as they are.
    const std::pair<Value, std::string> cases[] = {
        {Value(), "null"}, {false, "false"}, {kU64Max, "18446744073709551615"}, {kI64Min, "-9223372036854775808"},
        {0.1, "0.1"}, {0.30000000000000004, "0.30000000000000004"}, {5.0, "5.0"}, {1e14, "100000000000000.0"},
        {1e300, "1e+300"},
        {std::nan(""), "null"}, {-std::numeric_limits<double>::infinity(), "null"},
        {kUuid, R"("00112233-4455-6677-8899-aabbccddeeff")"},
        {Bytes{0, 1, 2, 3}, R"("AAECAw==")"}, {Bytes{0xFF, 0xEE}, R"("/+4=")"}, {Bytes{1, 2, 3}, R"("AQID")"}, {Bytes{}, R"("")"},
        {Date{978307200.25}, R"("2001-01-01T00:00:00.25Z")"}, {Date{-0.5}, R"("1969-12-31T23:59:59.5Z")"},
        {Date{951782400}, R"("2000-02-29T00:00:00Z")"}, {Date{253402300799}, R"("9999-12-31T23:59:59Z")"},
        {Date{-62167219200}, R"("0000-01-01T00:00:00Z")"}, {Date{1e15}, "1e+15"},
        {std::string("q\"\n\x01\0", 5), R"("q\"\n\u0001\u0000")"}, {"h\xC3\xA9", "\"h\xC3\xA9\""},
        {"a\xFF" "b\xED\xA0\x80", "\"a\xEF\xBF\xBD" "b\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD\""},
    };
    for (const auto& [value, compact] : cases) {
        EXPECT_EQ(json::write(value, false), compact) << value.description();
    }
}

TEST(Json, WritesContainersCompactAndPretty) {
    Value value(Dictionary{
        {"b", Value(Array{Value(1u), Value(Array{}), Value(Dictionary{})})},
        {"a", Value::packed(Value(Dictionary{{"x", Value("y")}}))},
    });
    EXPECT_EQ(json::write(value, false), R"({"a":{"x":"y"},"b":[1,[],{}]})");
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
}

TEST(Json, ParsesValuesWithTheirTypes) {
    // Each reads as a value of the expected one's very type. A byte-order
    // mark is skipped; a leap second is the next second; any other object is
    // a dictionary, even with such a key among others.
    const std::pair<std::string, Value> cases[] = {
        {" null ", Value()}, {"true", true}, {"0", 0u}, {"18446744073709551615", kU64Max}, {"-42", -42},
        {"-9223372036854775808", kI64Min}, {"-0", 0}, {"1.0", 1.0}, {"2.5E-3", 0.0025}, {"1e2", 100.0},
        {"\xEF\xBB\xBF" "7", 7u},
        {R"("a\"\/\t\u00e9\u0000\ud83d\ude00")", std::string("a\"/\t\xC3\xA9\0\xF0\x9F\x98\x80", 11)},
        {R"( { "b" : [1, -1, 1.5, "s", null], "a": {} } )",
         Dictionary{{"a", Value(Dictionary{})}, {"b", Value(Array{Value(1u), Value(-1), Value(1.5), Value("s"), Value()})}}},
        {R"({"$uuid": "00112233-4455-6677-8899-AABBCCDDEEFF"})", kUuid},
        {R"({"$data": "AAECAw=="})", Bytes{0, 1, 2, 3}}, {R"({"$data": "AQID"})", Bytes{1, 2, 3}}, {R"({"$data": ""})", Bytes{}},
        {R"({"$date": "2001-01-01t01:30:00.25+01:30"})", Date{978307200.25}},
        {R"({"$date": "1969-12-31T23:59:59-00:00"})", Date{-1}}, {R"({"$date": "2000-02-29T23:59:60Z"})", Date{951868800}},
        {R"({"$uuid": "x", "y": 1})", Dictionary{{"$uuid", Value("x")}, {"y", Value(1u)}}},
        {R"({"$other": 1})", Dictionary{{"$other", Value(1u)}}},
    };
    for (const auto& [text, expected] : cases) {
        auto parsed = json::parse(text);
        ASSERT_TRUE(parsed.ok()) << text << ": " << parsed.error().text();
        EXPECT_EQ(*parsed, expected) << text;
        EXPECT_EQ(parsed->type(), expected.type()) << text;
    }
}

TEST(Json, RefusalsSayWhatAndWhere) {
    std::string deepObjects;
    for (int i = 0; i < 513; ++i) {
        deepObjects += "{\"k\":";
    }
    deepObjects += "1" + std::string(513, '}');
    // {text, a part of the message, how the message ends}
    std::vector<std::tuple<std::string, std::string, std::string>> cases = {
        {"", "unexpected end of input", "line 1, column 1"},
        {"[1,\n 2]\n x", "invalid literal; expected end of input", "line 3, column 2"},
        {"{a:1}", "object key - invalid literal; expected string literal", "line 1, column 2"},
        {"\"a\nb\"", "control character U+000A", "line 1, column 3"},
        {"\"a\xFF\"", "ill-formed UTF-8", "line 1, column 3"},
        {"\"\xED\xA0\x80\"", "ill-formed UTF-8", "line 1, column 3"},  // an encoded surrogate
        {R"("\ud83d")", "surrogate U+D800..U+DBFF must be followed by U+DC00..U+DFFF", "line 1, column 8"},
        {R"("\ud83d\u0041")", "surrogate U+D800..U+DBFF must be followed", "line 1, column 13"},
        {R"("\ude00")", "surrogate U+DC00..U+DFFF must follow U+D800..U+DBFF", "line 1, column 7"},
        {R"({"a": 1, "a": 2})", "duplicate key \"a\" in object", "line 1, column 1"},
        {"[1,\n {\"k\":1, \"j\":2, \"k\":3}]", "duplicate key \"k\" in object", "line 2, column 2"},
        {"18446744073709551616", "integer does not fit in 64 bits", "line 1, column 1"},
        {"[-9223372036854775809]", "integer does not fit in 64 bits", "line 1, column 2"},
        {"[\n  1" + std::string(400, '0') + "]", "integer does not fit in 64 bits", "line 2, column 3"},
        {"1e400", "number out of range", "line 1, column 1"},
        {std::string(513, '['), "nesting deeper than 512 levels", "line 1, column 513"},
        {deepObjects, "nesting deeper than 512 levels", "line 1, column 2561"},
        {std::string(100000, '['), "nesting deeper than 512 levels", "line 1, column 513"},  // not the stack
        {R"({"$uuid": "0011"})", "\"$uuid\" needs a UUID in canonical text", "line 1, column 1"},
        {R"({"$uuid": 5})", "\"$uuid\" needs a UUID", "line 1, column 1"},
        {R"({"$date": "2001-02-29T00:00:00Z"})", "\"$date\" needs an RFC 3339 date-time", "line 1, column 1"},
    };
    // Data and dates take only their canonical spelling.
    for (const char* bad :
         {"AAECAw", "AAECAw=", "AA=CAw==", "AAECA*==", "AB==", "AAB=", "A===", "====", " AAA", "AAA=\\n", "AAECAw==="}) {
        cases.emplace_back(std::string(R"([{"$data": ")") + bad + "\"}]", "\"$data\" needs base64 text", "line 1, column 2");
    }
    for (const char* bad : {"2001-01-01", "2001-01-01T00:00:00", "2001-13-01T00:00:00Z", "2001-01-01T24:00:00Z",
                            "2001-01-01T00:60:00Z", "2001-01-01T00:00:00.Z", "2001-01-01T00:00:00+1:00",
                            "2001-01-01 00:00:00Z", "2001-01-01T00:00:00Zjunk"}) {
        cases.emplace_back(std::string(R"({"$date": ")") + bad + "\"}", "\"$date\" needs an RFC 3339 date-time",
                           "line 1, column 1");
    }
    for (const auto& [text, reason, where] : cases) {
        auto result = json::parse(text);
        ASSERT_FALSE(result.ok()) << text << " gave " << result.value().description();
        EXPECT_EQ(result.error().domain, "json");
        const std::string& message = result.error().text();
        EXPECT_NE(message.find(reason), std::string::npos) << message;
        EXPECT_TRUE(message.ends_with(" at " + where)) << message;
        EXPECT_EQ(message.find("last read"), std::string::npos) << message;
    }
    EXPECT_TRUE(json::parse(std::string(512, '[') + std::string(512, ']')).ok());
}

}  // namespace
}  // namespace qm
