#include "platform/plist/PropertyList.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <limits>
#include <string>
#include <tuple>
#include <vector>

#include "support/TempDir.h"

namespace {

using qm::Array;
using qm::Dictionary;
using qm::Value;
using qm::plist::Format;
using qm::plist::kErrorMalformed;
using qm::plist::kErrorTooComplex;
using qm::plist::kErrorUnsupported;

constexpr std::int64_t kInt64Min = std::numeric_limits<std::int64_t>::min();
constexpr std::int64_t kInt64Max = std::numeric_limits<std::int64_t>::max();

qm::Bytes bytesOf(std::string_view text) {
    return qm::Bytes(text.begin(), text.end());
}

std::string xmlDocument(std::string_view body) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
           "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" "
           "\"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
           "<plist version=\"1.0\">\n" +
           std::string(body) + "\n</plist>\n";
}

std::string nestedXml(std::size_t depth, std::string_view between = "") {
    std::string body;
    for (std::size_t i = 0; i < depth; ++i) {
        body.append("<array>").append(between);
    }
    for (std::size_t i = 0; i < depth; ++i) {
        body += "</array>";
    }
    return xmlDocument(body);
}

Value roundTrip(const Value& value, Format format) {
    auto bytes = qm::plist::serialize(value, format);
    EXPECT_TRUE(bytes.ok()) << (bytes.ok() ? "" : bytes.error().text());
    auto back = bytes.ok() ? qm::plist::parse(*bytes) : qm::Result<Value>(bytes.error());
    EXPECT_TRUE(back.ok()) << (back.ok() ? "" : back.error().text());
    return back.ok() ? *back : Value();
}

// Refused with that code (a property-list one unless the domain is given),
// and the message says where.
void expectRefused(const qm::MaybeError& error, std::int64_t code, const std::string& where = "",
                   const std::string& domain = qm::plist::kErrorDomain) {
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, domain);
    EXPECT_EQ(error->code, code) << error->text();
    EXPECT_NE(error->text().find(where), std::string::npos) << error->text();
}
template <typename T>
void expectRefused(const qm::Result<T>& result, auto... rest) {
    expectRefused(result.ok() ? qm::MaybeError() : result.error(), rest...);
}

// Appends the value big-endian in `size` bytes.
void append(qm::Bytes& out, std::uint64_t value, unsigned size) {
    for (unsigned i = size; i > 0; --i) {
        out.push_back(static_cast<std::uint8_t>(value >> (8 * (i - 1))));
    }
}

// A binary property list from encoded objects: 8-byte offsets, refSize-byte references.
qm::Bytes binaryList(const std::vector<qm::Bytes>& objects, unsigned refSize, std::uint64_t top = 0) {
    qm::Bytes out = bytesOf("bplist00");
    std::vector<std::uint64_t> offsets;
    for (const auto& object : objects) {
        offsets.push_back(out.size());
        out.insert(out.end(), object.begin(), object.end());
    }
    std::uint64_t table = out.size();
    for (auto offset : offsets) {
        append(out, offset, 8);
    }
    out.insert(out.end(), {0, 0, 0, 0, 0, 0, 8, static_cast<std::uint8_t>(refSize)});
    append(out, objects.size(), 8);
    append(out, top, 8);
    append(out, table, 8);
    return out;
}

// An array of fewer than 15 references.
qm::Bytes arrayObject(const std::vector<std::uint64_t>& refs, unsigned refSize) {
    qm::Bytes object{static_cast<std::uint8_t>(0xA0 | refs.size())};
    for (auto ref : refs) {
        append(object, ref, refSize);
    }
    return object;
}

const qm::Bytes kTrueObject{0x09};

// The dates a property list can hold: a signed 32-bit count of seconds from 2001.
const double kEarliest = qm::plist::kSecondsFrom1970To2001 + std::numeric_limits<std::int32_t>::min();
const double kLatest = qm::plist::kSecondsFrom1970To2001 + std::numeric_limits<std::int32_t>::max();

class PropertyListFormats : public ::testing::TestWithParam<Format> {};

TEST_P(PropertyListFormats, ScalarsAndContainersRoundTripWithTheirTypes) {
    Value value(Dictionary{
        {"yes", true}, {"no", false}, {"real", 2.5}, {"tiny", 1e-300}, {"key with spaces & marks", true},
        {"text", "caf\xc3\xa9 <&> \"quoted\" \xf0\x9f\x98\x80"}, {"empty text", ""},
        {"data", Value(qm::Bytes{0, 1, 2, 0xff})}, {"empty data", Value(qm::Bytes{})},
        {"list", Value(Array{Value(1), Value("two"), Value(Array{Value(3.0)})})},
        {"inner", Value(Dictionary{{"empty array", Value(Array{})}, {"empty dict", Value(Dictionary{})}})},
        {"integers", Value(Array{std::int64_t{-1}, std::int64_t{-5}, kInt64Min, kInt64Max, std::int64_t{0}})},
        {"unsigned", Value(static_cast<std::uint64_t>(kInt64Max))},
    });
    Value back = roundTrip(value, GetParam());
    EXPECT_EQ(back, value);
    ASSERT_TRUE(back.get("data"));
    EXPECT_EQ(back.get("data")->type(), qm::ValueType::data);
    EXPECT_EQ(back.get("empty text")->type(), qm::ValueType::string);
    for (const Value& number : *back.get("integers")->asArray()) {
        EXPECT_EQ(number.type(), qm::ValueType::signedInteger);
    }
}

TEST_P(PropertyListFormats, WholeSecondDatesRoundTripUpToTheEdgesOfTheWritableRange) {
    for (double seconds : {0.0, 978307200.0, 978307199.0, 1700000000.0, -1000000.0, kEarliest, kLatest}) {
        Value back = roundTrip(Value(qm::Date{seconds}), GetParam());
        ASSERT_EQ(back.type(), qm::ValueType::date) << seconds;
        EXPECT_EQ(back.asDate()->secondsSince1970, seconds);
    }
}

// What a property list cannot hold is an error naming where, never a silent change.
TEST_P(PropertyListFormats, ValuesWithoutAPropertyListFormAreRefused) {
    Value deep(Array{});
    for (unsigned i = 1; i < qm::plist::kMaxNesting; ++i) {
        deep = Value(Array{deep});
    }
    EXPECT_TRUE(qm::plist::serialize(deep, GetParam()).ok());
    auto second = [](const Value& value) { return Value(Dictionary{{"a", Value(Array{Value(1), value})}}); };
    // {value, error code, where the message says it is}; 2100 and 1900 lie far outside.
    const std::tuple<Value, int, const char*> cases[] = {
        {std::uint64_t{1} << 63, kErrorUnsupported, ""}, {Value(Array{deep}), kErrorTooComplex, ""},
        {qm::Date{kEarliest - 1}, kErrorUnsupported, "date"}, {qm::Date{kLatest + 1}, kErrorUnsupported, "date"},
        {qm::Date{4102444800.0}, kErrorUnsupported, "date"}, {qm::Date{-2208988800.0}, kErrorUnsupported, "date"},
        {second(Value()), kErrorUnsupported, "/a/1"}, {second(qm::Uuid::random()), kErrorUnsupported, "/a/1"},
        {second(Value::packed(1)), kErrorUnsupported, "/a/1"},
        {std::string("a\0b", 3), kErrorUnsupported, ""}, {"\xff\xfe", kErrorUnsupported, ""},
        {Dictionary{{std::string("k\0", 2), 1}}, kErrorUnsupported, ""}, {Dictionary{{"\xc3", 1}}, kErrorUnsupported, ""},
    };
    for (const auto& [value, code, where] : cases) {
        SCOPED_TRACE(value.description());
        expectRefused(qm::plist::serialize(value, GetParam()), code, where);
    }
}

TEST_P(PropertyListFormats, EveryTruncationOfAValidDocumentIsHandled) {
    Value value(Dictionary{{"list", Value(Array{Value(1), Value("two"), Value(2.5)})},
                           {"when", Value(qm::Date{1700000000})},
                           {"blob", Value(qm::Bytes(40, 7))}});
    auto bytes = qm::plist::serialize(value, GetParam());
    ASSERT_TRUE(bytes.ok());
    for (std::size_t length = 0; length < bytes->size(); ++length) {
        auto prefix = qm::plist::parse(std::span(bytes->data(), length));
        // Most prefixes are errors; none may crash, and what reads must be a value.
        if (prefix.ok()) {
            EXPECT_NE(prefix->type(), qm::ValueType::null);
        }
    }
}

INSTANTIATE_TEST_SUITE_P(BothFormats, PropertyListFormats, ::testing::Values(Format::xml, Format::binary),
                         [](const auto& param) { return param.param == Format::xml ? "xml" : "binary"; });

TEST(PropertyList, BinaryKeepsFractionsOfSecondsXmlWritesWholeOnes) {
    // Just before the reference date, libplist's own getter would lose the sign.
    for (double seconds : {1234567890.5, 978307199.75, 978307200.25, -12.125}) {
        EXPECT_EQ(roundTrip(Value(qm::Date{seconds}), Format::binary).asDate()->secondsSince1970, seconds);
    }
    for (const auto& [value, text] : {std::pair{Value(qm::Date{978307200.0 + 100.75}), "<date>2001-01-01T00:01:40Z</date>"},
                                      std::pair{Value(Array{std::int64_t{-5}}), "<integer>-5</integer>"}}) {
        auto bytes = qm::plist::serialize(value, Format::xml);
        ASSERT_TRUE(bytes.ok());
        std::string xml(bytes->begin(), bytes->end());
        EXPECT_NE(xml.find(text), std::string::npos) << xml;
    }
}

TEST(PropertyList, XmlDocumentsReadAsTheirValues) {
    const std::tuple<const char*, std::string, Value> cases[] = {
        {"a typical Info file", R"(<!-- a comment -->
<dict>
	<key>MRBundleIdentifier</key>
	<string>com.example.foo</string>
	<key>MRBundleVersion</key>
	<string><![CDATA[1.0<beta>]]></string>
	<key>Count</key>
	<integer>3</integer>
	<key>Flag</key>
	<true/>
	<key>Nested</key>
	<dict><key>List</key><array><string>a</string><!-- inside --><string>b &amp; c</string></array></dict>
</dict>)",
         Value(Dictionary{{"MRBundleIdentifier", "com.example.foo"}, {"MRBundleVersion", "1.0<beta>"}, {"Count", 3},
                          {"Flag", true}, {"Nested", Value(Dictionary{{"List", Value(Array{"a", "b & c"})}})}})},
        {"a scalar root", "<string>alone</string>", Value("alone")},
        {"an empty root", "<dict/>", Value(Dictionary{})},
        {"integers above INT64_MAX read back negative",
         "<array><integer>18446744073709551615</integer><integer>9223372036854775808</integer>"
         "<integer>9223372036854775807</integer><integer>-9223372036854775808</integer></array>",
         Value(Array{std::int64_t{-1}, kInt64Min, kInt64Max, kInt64Min})},
        {"dates outside the writable range", "<array><date>9999-01-01T00:00:00Z</date><date>1900-01-01T00:00:00Z</date></array>",
         Value(Array{qm::Date{253370764800.0}, qm::Date{-2208988800.0}})},
    };
    for (const auto& [what, body, expected] : cases) {
        SCOPED_TRACE(what);
        auto value = qm::plist::parse(bytesOf(xmlDocument(body)));
        ASSERT_TRUE(value.ok()) << value.error().text();
        EXPECT_EQ(*value, expected);
    }
    EXPECT_TRUE(qm::plist::parse(bytesOf(nestedXml(qm::plist::kMaxNesting))).ok());
}

TEST(PropertyList, BrokenOrHostileXmlIsRefusedWithoutCrashing) {
    std::string unfinished = "<plist version=\"1.0\">";  // libplist frees it after the error
    for (int i = 0; i < 200000; ++i) {
        unfinished += "<array>";
    }
    const std::pair<std::string, int> cases[] = {
        {"", kErrorMalformed}, {"garbage", kErrorMalformed}, {"bplist00", kErrorMalformed},
        {"<plist version=\"1.0\"><dict><key>a</key>", kErrorMalformed},
        {"<plist version=\"1.0\"><array><string>x</array></plist>", kErrorMalformed},
        {"<plist version=\"1.0\"><dict><integer>1</integer></dict></plist>", kErrorMalformed},
        {"<plist version=\"1.0\"><array><bogus/></array></plist>", kErrorMalformed},
        {"<plist version=\"1.0\"><array></dict></plist>", kErrorMalformed},
        {xmlDocument("<array><string>ok</string><string>\xff\xfe</string></array>"), kErrorMalformed},
        {"<!DOCTYPE plist [ <!ENTITY x \"y\"> ]><plist version=\"1.0\"><array/></plist>", kErrorMalformed},
        {"<plist version=\"1>\"><array/></plist>", kErrorMalformed},
        {nestedXml(qm::plist::kMaxNesting + 1), kErrorTooComplex}, {nestedXml(200000), kErrorTooComplex},
        // Closing tags hidden in comments do not make the nesting look shallower.
        {nestedXml(2000, "<!-- </array></array> -->"), kErrorTooComplex},
        {unfinished, kErrorTooComplex}, {std::string(qm::plist::kMaxBytes + 1, ' '), kErrorTooComplex},
    };
    for (const auto& [document, code] : cases) {
        SCOPED_TRACE(document.substr(0, 80));
        expectRefused(qm::plist::parse(bytesOf(document)), code);
    }
    expectRefused(qm::plist::parse(bytesOf(cases[8].first)), kErrorMalformed, "/1");  // names where
}

// libplist recurses once per level, copies shared objects and asserts on NUL
// in keys: such lists are refused before it sees them.
TEST(PropertyList, HostileBinaryListsAreRefusedAndHonestOnesRead) {
    std::vector<qm::Bytes> deep;
    for (std::uint64_t i = 0; i + 1 < 200000; ++i) {
        deep.push_back(arrayObject({i + 1}, 4));
    }
    deep.push_back(kTrueObject);
    std::vector<qm::Bytes> exponential;  // each level refers twice to the next: 2^60 nodes expanded
    for (std::uint64_t i = 0; i < 60; ++i) {
        exponential.push_back(arrayObject({i + 1, i + 1}, 1));
    }
    exponential.push_back(kTrueObject);
    // Levels of 14 references each to the next: 14^4 leaves stay within what
    // any list may expand to, 14^5 from a hundred bytes do not.
    auto fourteenWide = [](std::uint64_t levels) {
        std::vector<qm::Bytes> objects;
        for (std::uint64_t i = 0; i < levels; ++i) {
            objects.push_back(arrayObject(std::vector<std::uint64_t>(14, i + 1), 1));
        }
        objects.push_back(kTrueObject);
        return binaryList(objects, 1);
    };
    Value fourLevels(true);
    for (int i = 0; i < 4; ++i) {
        fourLevels = Value(Array(14, fourLevels));
    }
    const qm::Bytes twoKeys{0xD2, 1, 2, 3, 3};
    // {what, the list, the error code (0: read as the value)}
    const std::tuple<const char*, qm::Bytes, int, Value> cases[] = {
        {"two references to one object", binaryList({arrayObject({1, 1}, 1), kTrueObject}, 1), 0, Value(Array{true, true})},
        {"14 references to one string", binaryList({arrayObject(std::vector<std::uint64_t>(14, 1), 1), {0x51, 'x'}}, 1), 0,
         Value(Array(14, Value("x")))},
        {"a plain key", binaryList({{0xD1, 1, 2}, {0x52, 'a', 'b'}, kTrueObject}, 1), 0, Value(Dictionary{{"ab", true}})},
        {"a UID", binaryList({arrayObject({1}, 1), {0x80, 0x05}}, 1), kErrorUnsupported, {}},
        {"a key with NUL", binaryList({{0xD1, 1, 2}, {0x53, 'a', 0, 'b'}, kTrueObject}, 1), kErrorMalformed, {}},
        {"a UTF-16 key with NUL", binaryList({{0xD1, 1, 2}, {0x62, 0, 'a', 0, 0}, kTrueObject}, 1), kErrorMalformed, {}},
        {"a key twice", binaryList({twoKeys, {0x51, 'a'}, {0x51, 'a'}, kTrueObject}, 1), kErrorMalformed, {}},
        {"200000 levels", binaryList(deep, 4), kErrorTooComplex, {}},
        {"shared exponentially", binaryList(exponential, 1), kErrorTooComplex, {}},
        {"shared to 40 thousand nodes", fourteenWide(4), 0, fourLevels},
        {"shared to half a million nodes", fourteenWide(5), kErrorTooComplex, {}},
        {"a cycle", binaryList({arrayObject({1}, 1), arrayObject({0}, 1)}, 1), kErrorMalformed, {}},
        {"a reference past the end", binaryList({arrayObject({7}, 1)}, 1), kErrorMalformed, {}},
        {"a top object past the end", binaryList({kTrueObject}, 1, 3), kErrorMalformed, {}},
    };
    for (const auto& [what, list, code, expected] : cases) {
        SCOPED_TRACE(what);
        auto value = qm::plist::parse(list);
        if (code == 0) {
            ASSERT_TRUE(value.ok()) << value.error().text();
            EXPECT_EQ(*value, expected);
        } else {
            expectRefused(value, code);
        }
    }
}

// --- files ------------------------------------------------------------------

mode_t modeOf(const std::string& path) {
    struct stat status {};
    EXPECT_EQ(::stat(path.c_str(), &status), 0) << path;
    return status.st_mode & 07777;
}

TEST(PropertyListFile, WritesReplaceTheFileWholeAndKeepItsMode) {
    qmtest::TempDir dir;
    std::string path = dir.file("out.plist");
    Value value(Dictionary{{"a", 1}, {"b", "text"}});
    for (Format format : {Format::xml, Format::binary}) {
        ASSERT_FALSE(qm::plist::writeFileAtomically(path, value, format));
        auto back = qm::plist::readFile(path);
        ASSERT_TRUE(back.ok()) << back.error().text();
        EXPECT_EQ(*back, value);
    }
    EXPECT_EQ(qmtest::readFile(path).rfind("bplist00", 0), 0u);
    EXPECT_EQ(modeOf(path), 0600u) << "a new file is private";
    ASSERT_EQ(::chmod(path.c_str(), 0644), 0);
    ASSERT_FALSE(qm::plist::writeFileAtomically(path, Value(Array{}), Format::xml));
    EXPECT_EQ(modeOf(path), 0644u) << "a replaced file keeps its mode";
    // Nothing but the file itself is left in the folder.
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.path()), std::filesystem::directory_iterator()), 1);

    expectRefused(qm::plist::writeFileAtomically(path, Value(Array{Value()}), Format::xml), kErrorUnsupported, path);
    EXPECT_EQ(qm::plist::readFile(path).value(), Value(Array{})) << "a failed serialization leaves the old file";
    expectRefused(qm::plist::writeFileAtomically(dir.file("missing/x.plist"), Value(Array{}), Format::xml), ENOENT, "",
                  qm::kPosixErrorDomain);
}

TEST(PropertyListFile, ReadErrorsCarryErrnoOrSayWhatIsWrong) {
    qmtest::TempDir dir;
    std::string fifo = dir.file("fifo.plist");
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);  // refused without waiting for a writer
    std::string big = dir.file("big.plist");
    qmtest::writeFile(big, "");
    ASSERT_EQ(::truncate(big.c_str(), static_cast<off_t>(qm::plist::kMaxBytes) + 1), 0);  // sparse: refused unread
    std::string junk = dir.file("junk.plist");
    qmtest::writeFile(junk, "this is not a property list");
    for (const auto& [path, code] : {std::pair{dir.file("absent.plist"), ENOENT}, std::pair{dir.path(), EISDIR},
                                     std::pair{fifo, EINVAL}, std::pair{big, EFBIG}}) {
        expectRefused(qm::plist::readFile(path), code, path, qm::kPosixErrorDomain);
    }
    expectRefused(qm::plist::readFile(junk), kErrorMalformed, junk);
}

}  // namespace
