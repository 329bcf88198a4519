#include "platform/plist/PropertyList.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <limits>
#include <string>
#include <vector>

#include "support/TempDir.h"

namespace {

using qm::plist::Format;

qm::Bytes bytesOf(std::string_view text) {
    return qm::Bytes(text.begin(), text.end());
}

std::string textOf(const qm::Bytes& bytes) {
    return std::string(bytes.begin(), bytes.end());
}

qm::Result<qm::Value> parseText(std::string_view text) {
    return qm::plist::parse(bytesOf(text));
}

std::string xmlDocument(std::string_view body) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
           "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" "
           "\"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
           "<plist version=\"1.0\">\n" +
           std::string(body) + "\n</plist>\n";
}

qm::Value roundTrip(const qm::Value& value, Format format) {
    auto bytes = qm::plist::serialize(value, format);
    EXPECT_TRUE(bytes.ok()) << (bytes.ok() ? "" : bytes.error().text());
    if (!bytes.ok()) {
        return qm::Value();
    }
    auto back = qm::plist::parse(*bytes);
    EXPECT_TRUE(back.ok()) << (back.ok() ? "" : back.error().text());
    return back.ok() ? *back : qm::Value();
}

// A binary property list from encoded objects: 8-byte offsets, refSize-byte references.
qm::Bytes binaryList(const std::vector<qm::Bytes>& objects, unsigned refSize, std::uint64_t top = 0) {
    qm::Bytes out = bytesOf("bplist00");
    std::vector<std::uint64_t> offsets;
    for (const auto& object : objects) {
        offsets.push_back(out.size());
        out.insert(out.end(), object.begin(), object.end());
    }
    auto appendNumber = [&out](std::uint64_t value, unsigned size) {
        for (unsigned i = size; i > 0; --i) {
            out.push_back(static_cast<std::uint8_t>(value >> (8 * (i - 1))));
        }
    };
    std::uint64_t table = out.size();
    for (auto offset : offsets) {
        appendNumber(offset, 8);
    }
    out.insert(out.end(), 6, 0);
    out.push_back(8);
    out.push_back(static_cast<std::uint8_t>(refSize));
    appendNumber(objects.size(), 8);
    appendNumber(top, 8);
    appendNumber(table, 8);
    return out;
}

qm::Bytes arrayObject(const std::vector<std::uint64_t>& refs, unsigned refSize) {
    qm::Bytes object;
    if (refs.size() < 15) {
        object.push_back(static_cast<std::uint8_t>(0xA0 | refs.size()));
    } else {
        object.push_back(0xAF);
        object.push_back(0x12);
        for (int shift = 24; shift >= 0; shift -= 8) {
            object.push_back(static_cast<std::uint8_t>(refs.size() >> shift));
        }
    }
    for (auto ref : refs) {
        for (unsigned i = refSize; i > 0; --i) {
            object.push_back(static_cast<std::uint8_t>(ref >> (8 * (i - 1))));
        }
    }
    return object;
}

const qm::Bytes kTrueObject{0x09};

class PropertyListFormats : public ::testing::TestWithParam<Format> {};

TEST_P(PropertyListFormats, ScalarsAndContainersRoundTrip) {
    qm::Dictionary inner{{"empty array", qm::Value(qm::Array{})}, {"empty dict", qm::Value(qm::Dictionary{})}};
    qm::Dictionary top{
        {"yes", qm::Value(true)},
        {"no", qm::Value(false)},
        {"int", qm::Value(std::int64_t{42})},
        {"real", qm::Value(2.5)},
        {"tiny", qm::Value(1e-300)},
        {"text", qm::Value("caf\xc3\xa9 <&> \"quoted\" \xf0\x9f\x98\x80")},
        {"empty text", qm::Value("")},
        {"data", qm::Value(qm::Bytes{0, 1, 2, 0xff})},
        {"empty data", qm::Value(qm::Bytes{})},
        {"list", qm::Value(qm::Array{qm::Value(1), qm::Value("two"), qm::Value(qm::Array{qm::Value(3.0)})})},
        {"inner", qm::Value(inner)},
        {"key with spaces & marks", qm::Value(true)},
    };
    qm::Value value(top);
    qm::Value back = roundTrip(value, GetParam());
    EXPECT_EQ(back, value) << back.description();
    ASSERT_TRUE(back.get("data"));
    EXPECT_EQ(*back.get("data")->asData(), (qm::Bytes{0, 1, 2, 0xff}));
    EXPECT_EQ(back.get("empty data")->asData()->size(), 0u);
    EXPECT_EQ(*back.get("empty text")->asString(), "");
}

TEST_P(PropertyListFormats, NegativeIntegersReadBackAsSignedIntegers) {
    for (std::int64_t number : {std::int64_t{-1}, std::int64_t{-5}, std::numeric_limits<std::int64_t>::min(),
                                std::numeric_limits<std::int64_t>::max(), std::int64_t{0}}) {
        qm::Value back = roundTrip(qm::Value(qm::Array{qm::Value(number)}), GetParam());
        ASSERT_TRUE(back.asArray());
        const qm::Value& item = back.asArray()->at(0);
        EXPECT_EQ(item.type(), qm::ValueType::signedInteger);
        EXPECT_EQ(item.asSigned(), number);
    }
}

TEST_P(PropertyListFormats, UnsignedIntegersUpToInt64MaxRoundTripByValue) {
    std::uint64_t largest = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
    qm::Value back = roundTrip(qm::Value(largest), GetParam());
    EXPECT_EQ(back.asUnsigned(), largest);
    EXPECT_EQ(roundTrip(qm::Value(std::uint64_t{7}), GetParam()).asSigned(), 7);
}

TEST_P(PropertyListFormats, UnsignedIntegerAboveInt64MaxIsRefused) {
    auto bytes = qm::plist::serialize(qm::Value(std::uint64_t{1} << 63), GetParam());
    ASSERT_FALSE(bytes.ok());
    EXPECT_EQ(bytes.error().domain, qm::plist::kErrorDomain);
    EXPECT_EQ(bytes.error().code, qm::plist::kErrorUnsupported);
}

TEST_P(PropertyListFormats, WholeSecondDatesRoundTripAcrossTheReferenceDate) {
    for (double seconds : {0.0, 978307200.0, 978307199.0, 1700000000.0, -1000000.0}) {
        qm::Value back = roundTrip(qm::Value(qm::Date{seconds}), GetParam());
        ASSERT_EQ(back.type(), qm::ValueType::date) << seconds;
        EXPECT_EQ(back.asDate()->secondsSince1970, seconds);
    }
}

TEST_P(PropertyListFormats, DatesAtTheEdgesOfTheWritableRange) {
    const double earliest = qm::plist::kSecondsFrom1970To2001 + std::numeric_limits<std::int32_t>::min();
    const double latest = qm::plist::kSecondsFrom1970To2001 + std::numeric_limits<std::int32_t>::max();
    EXPECT_EQ(roundTrip(qm::Value(qm::Date{earliest}), GetParam()).asDate()->secondsSince1970, earliest);
    EXPECT_EQ(roundTrip(qm::Value(qm::Date{latest}), GetParam()).asDate()->secondsSince1970, latest);
    for (double outside : {earliest - 1, latest + 1, 4102444800.0 /* 2100 */, -2208988800.0 /* 1900 */}) {
        auto bytes = qm::plist::serialize(qm::Value(qm::Date{outside}), GetParam());
        ASSERT_FALSE(bytes.ok()) << outside;
        EXPECT_EQ(bytes.error().code, qm::plist::kErrorUnsupported);
        EXPECT_NE(bytes.error().text().find("date"), std::string::npos);
    }
}

TEST_P(PropertyListFormats, ValuesWithoutAPropertyListFormAreErrorsNamingWhere) {
    for (const qm::Value& bad : {qm::Value(), qm::Value(qm::Uuid::random()), qm::Value::packed(qm::Value(1))}) {
        qm::Value tree(qm::Dictionary{{"a", qm::Value(qm::Array{qm::Value(1), bad})}});
        auto bytes = qm::plist::serialize(tree, GetParam());
        ASSERT_FALSE(bytes.ok()) << bad.description();
        EXPECT_EQ(bytes.error().domain, qm::plist::kErrorDomain);
        EXPECT_EQ(bytes.error().code, qm::plist::kErrorUnsupported);
        EXPECT_NE(bytes.error().text().find("/a/1"), std::string::npos) << bytes.error().text();
    }
}

TEST_P(PropertyListFormats, TextThatCannotSurviveIsRefused) {
    for (const qm::Value& bad : {qm::Value(std::string("a\0b", 3)), qm::Value(std::string("\xff\xfe")),
                                 qm::Value(qm::Dictionary{{std::string("k\0", 2), qm::Value(1)}}),
                                 qm::Value(qm::Dictionary{{"\xc3", qm::Value(1)}})}) {
        auto bytes = qm::plist::serialize(bad, GetParam());
        ASSERT_FALSE(bytes.ok()) << bad.description();
        EXPECT_EQ(bytes.error().code, qm::plist::kErrorUnsupported);
    }
}

TEST_P(PropertyListFormats, ValuesNestedTooDeeplyAreRefused) {
    qm::Value deep(qm::Array{});
    for (unsigned i = 1; i < qm::plist::kMaxNesting; ++i) {
        deep = qm::Value(qm::Array{deep});
    }
    EXPECT_TRUE(qm::plist::serialize(deep, GetParam()).ok());
    auto tooDeep = qm::plist::serialize(qm::Value(qm::Array{deep}), GetParam());
    ASSERT_FALSE(tooDeep.ok());
    EXPECT_EQ(tooDeep.error().code, qm::plist::kErrorTooComplex);
}

INSTANTIATE_TEST_SUITE_P(BothFormats, PropertyListFormats, ::testing::Values(Format::xml, Format::binary),
                         [](const auto& param) { return param.param == Format::xml ? "xml" : "binary"; });

TEST(PropertyList, BinaryKeepsFractionsOfSecondsIncludingJustBefore2001) {
    // Just before the reference date, libplist's own getter would lose the sign.
    for (double seconds : {1234567890.5, 978307199.75, 978307200.25, -12.125}) {
        qm::Value back = roundTrip(qm::Value(qm::Date{seconds}), Format::binary);
        EXPECT_EQ(back.asDate()->secondsSince1970, seconds);
    }
}

TEST(PropertyList, XmlDatesAreWrittenInWholeSecondsAsIso8601) {
    auto bytes = qm::plist::serialize(qm::Value(qm::Date{978307200.0 + 100.75}), Format::xml);
    ASSERT_TRUE(bytes.ok());
    EXPECT_NE(textOf(*bytes).find("<date>2001-01-01T00:01:40Z</date>"), std::string::npos) << textOf(*bytes);
}

TEST(PropertyList, XmlDatesOutsideTheWritableRangeStillReadExactly) {
    auto value = parseText(
        xmlDocument("<array><date>9999-01-01T00:00:00Z</date><date>1900-01-01T00:00:00Z</date></array>"));
    ASSERT_TRUE(value.ok()) << value.error().text();
    EXPECT_EQ(value->asArray()->at(0).asDate()->secondsSince1970, 253370764800.0);
    EXPECT_EQ(value->asArray()->at(1).asDate()->secondsSince1970, -2208988800.0);
}

TEST(PropertyList, XmlWritesNegativeIntegersAsSuch) {
    auto bytes = qm::plist::serialize(qm::Value(qm::Array{qm::Value(std::int64_t{-5})}), Format::xml);
    ASSERT_TRUE(bytes.ok());
    EXPECT_NE(textOf(*bytes).find("<integer>-5</integer>"), std::string::npos);
}

TEST(PropertyList, XmlIntegersAboveInt64MaxReadBackNegative) {
    auto value = parseText(xmlDocument(
        "<array><integer>18446744073709551615</integer><integer>9223372036854775808</integer>"
        "<integer>9223372036854775807</integer><integer>-9223372036854775808</integer></array>"));
    ASSERT_TRUE(value.ok()) << value.error().text();
    const qm::Array& items = *value->asArray();
    EXPECT_EQ(items[0].asSigned(), -1);
    EXPECT_EQ(items[1].asSigned(), std::numeric_limits<std::int64_t>::min());
    EXPECT_EQ(items[2].asSigned(), std::numeric_limits<std::int64_t>::max());
    EXPECT_EQ(items[3].asSigned(), std::numeric_limits<std::int64_t>::min());
}

TEST(PropertyList, ReadsATypicalInfoFile) {
    auto value = parseText(xmlDocument(R"(<!-- a comment -->
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
</dict>)"));
    ASSERT_TRUE(value.ok()) << value.error().text();
    EXPECT_EQ(*value->get("MRBundleIdentifier")->asString(), "com.example.foo");
    EXPECT_EQ(*value->get("MRBundleVersion")->asString(), "1.0<beta>");
    EXPECT_EQ(value->get("Count")->asSigned(), 3);
    EXPECT_EQ(value->get("Flag")->asBool(), true);
    const qm::Array* list = value->get("Nested")->get("List")->asArray();
    ASSERT_TRUE(list);
    ASSERT_EQ(list->size(), 2u);
    EXPECT_EQ(*list->at(1).asString(), "b & c");
}

TEST(PropertyList, ScalarAndEmptyRoots) {
    auto text = parseText(xmlDocument("<string>alone</string>"));
    ASSERT_TRUE(text.ok());
    EXPECT_EQ(*text->asString(), "alone");
    auto empty = parseText(xmlDocument("<dict/>"));
    ASSERT_TRUE(empty.ok());
    EXPECT_TRUE(empty->asDictionary() && empty->asDictionary()->empty());
}

TEST(PropertyList, DuplicateKeysInXmlKeepOneValue) {
    auto value =
        parseText(xmlDocument("<dict><key>a</key><integer>1</integer><key>a</key><integer>2</integer></dict>"));
    ASSERT_TRUE(value.ok()) << value.error().text();
    EXPECT_EQ(value->asDictionary()->size(), 1u);
    auto kept = value->get("a")->asSigned();
    EXPECT_TRUE(kept == 1 || kept == 2);
}

TEST(PropertyList, MalformedDocumentsAreErrors) {
    for (std::string_view bad : {"", "garbage", "<plist version=\"1.0\"><dict><key>a</key>",
                                 "<plist version=\"1.0\"><array><string>x</array></plist>",
                                 "<plist version=\"1.0\"><dict><integer>1</integer></dict></plist>",
                                 "<plist version=\"1.0\"><array><bogus/></array></plist>",
                                 "<plist version=\"1.0\"><array></dict></plist>", "bplist00"}) {
        auto value = parseText(bad);
        ASSERT_FALSE(value.ok()) << bad;
        EXPECT_EQ(value.error().domain, qm::plist::kErrorDomain) << bad;
        EXPECT_EQ(value.error().code, qm::plist::kErrorMalformed) << bad;
    }
}

TEST(PropertyList, StringsThatAreNotUtf8AreRefusedWhenRead) {
    auto value = parseText(xmlDocument("<array><string>ok</string><string>\xff\xfe</string></array>"));
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().code, qm::plist::kErrorMalformed);
    EXPECT_NE(value.error().text().find("/1"), std::string::npos) << value.error().text();
}

TEST(PropertyList, EveryTruncationOfAValidDocumentIsHandled) {
    qm::Value value(qm::Dictionary{{"list", qm::Value(qm::Array{qm::Value(1), qm::Value("two"), qm::Value(2.5)})},
                                   {"when", qm::Value(qm::Date{1700000000})},
                                   {"blob", qm::Value(qm::Bytes(40, 7))}});
    for (Format format : {Format::xml, Format::binary}) {
        auto bytes = qm::plist::serialize(value, format);
        ASSERT_TRUE(bytes.ok());
        for (std::size_t length = 0; length < bytes->size(); ++length) {
            auto prefix = qm::plist::parse(std::span(bytes->data(), length));
            // Most prefixes are errors; none may crash, and what reads must be a value.
            if (prefix.ok()) {
                EXPECT_NE(prefix->type(), qm::ValueType::null);
            }
        }
        auto whole = qm::plist::parse(*bytes);
        ASSERT_TRUE(whole.ok());
        EXPECT_EQ(*whole, value);
    }
}

TEST(PropertyList, HandBuiltBinaryListIsRead) {
    // Sanity check of the builder used by the hostile cases below.
    auto value = qm::plist::parse(binaryList({arrayObject({1, 1}, 1), kTrueObject}, 1));
    ASSERT_TRUE(value.ok()) << value.error().text();
    EXPECT_EQ(*value, qm::Value(qm::Array{qm::Value(true), qm::Value(true)}));
}

TEST(PropertyList, BinaryUidsAreRefused) {
    auto value = qm::plist::parse(binaryList({arrayObject({1}, 1), qm::Bytes{0x80, 0x05}}, 1));
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().domain, qm::plist::kErrorDomain);
}

TEST(PropertyList, BinaryKeysWithNulAreRefusedBeforeLibplistAssertsOnThem) {
    qm::Bytes dictionary{0xD1, 1, 2};
    qm::Bytes key{0x53, 'a', 0, 'b'};
    auto value = qm::plist::parse(binaryList({dictionary, key, kTrueObject}, 1));
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().code, qm::plist::kErrorMalformed);
    auto utf16 = qm::plist::parse(binaryList({dictionary, qm::Bytes{0x62, 0, 'a', 0, 0}, kTrueObject}, 1));
    ASSERT_FALSE(utf16.ok());
    auto good = qm::plist::parse(binaryList({dictionary, qm::Bytes{0x52, 'a', 'b'}, kTrueObject}, 1));
    ASSERT_TRUE(good.ok()) << good.error().text();
    EXPECT_EQ(*good, qm::Value(qm::Dictionary{{"ab", qm::Value(true)}}));
}

TEST(PropertyList, DeeplyNestedXmlIsRefusedWithoutCrashing) {
    auto nested = [](std::size_t depth, std::string_view between = "") {
        std::string body;
        for (std::size_t i = 0; i < depth; ++i) {
            body += "<array>";
            body += between;
        }
        for (std::size_t i = 0; i < depth; ++i) {
            body += "</array>";
        }
        return xmlDocument(body);
    };
    EXPECT_TRUE(parseText(nested(qm::plist::kMaxNesting)).ok());
    for (std::size_t depth : {std::size_t{qm::plist::kMaxNesting + 1}, std::size_t{200000}}) {
        auto value = parseText(nested(depth));
        ASSERT_FALSE(value.ok());
        EXPECT_EQ(value.error().code, qm::plist::kErrorTooComplex);
    }
    // Closing tags hidden in comments do not make the nesting look shallower.
    auto hidden = parseText(nested(2000, "<!-- </array></array> -->"));
    ASSERT_FALSE(hidden.ok());
    EXPECT_EQ(hidden.error().code, qm::plist::kErrorTooComplex);
    // Nor does an unfinished document, which libplist frees after the error.
    std::string unfinished = "<plist version=\"1.0\">";
    for (int i = 0; i < 200000; ++i) {
        unfinished += "<array>";
    }
    auto value = parseText(unfinished);
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().code, qm::plist::kErrorTooComplex);
}

TEST(PropertyList, AmbiguousXmlConstructsAreRefused) {
    for (std::string_view bad :
         {"<!DOCTYPE plist [ <!ENTITY x \"y\"> ]><plist version=\"1.0\"><array/></plist>",
          "<plist version=\"1>\"><array/></plist>"}) {
        auto value = parseText(bad);
        ASSERT_FALSE(value.ok()) << bad;
        EXPECT_EQ(value.error().code, qm::plist::kErrorMalformed) << bad;
    }
}

TEST(PropertyList, DeeplyNestedBinaryIsRefusedWithoutCrashing) {
    const std::size_t depth = 200000;
    std::vector<qm::Bytes> objects;
    for (std::size_t i = 0; i + 1 < depth; ++i) {
        objects.push_back(arrayObject({i + 1}, 4));
    }
    objects.push_back(kTrueObject);
    auto value = qm::plist::parse(binaryList(objects, 4));
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().code, qm::plist::kErrorTooComplex);
}

TEST(PropertyList, BinaryObjectsSharedExponentiallyAreRefused) {
    // Each level refers twice to the next: 2^60 nodes once expanded.
    std::vector<qm::Bytes> objects;
    for (std::uint64_t i = 0; i < 60; ++i) {
        objects.push_back(arrayObject({i + 1, i + 1}, 1));
    }
    objects.push_back(kTrueObject);
    auto value = qm::plist::parse(binaryList(objects, 1));
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().code, qm::plist::kErrorTooComplex);
}

TEST(PropertyList, ModestSharingInBinaryIsFine) {
    // Writers share equal objects: a hundred references to one string.
    std::vector<std::uint64_t> refs(100, 1);
    auto value = qm::plist::parse(binaryList({arrayObject(refs, 1), qm::Bytes{0x51, 'x'}}, 1));
    ASSERT_TRUE(value.ok()) << value.error().text();
    EXPECT_EQ(value->asArray()->size(), 100u);
    EXPECT_EQ(*value->asArray()->at(99).asString(), "x");
}

TEST(PropertyList, BinaryCyclesAndBadReferencesAreRefused) {
    auto cycle = qm::plist::parse(binaryList({arrayObject({1}, 1), arrayObject({0}, 1)}, 1));
    ASSERT_FALSE(cycle.ok());
    EXPECT_EQ(cycle.error().code, qm::plist::kErrorMalformed);
    auto missing = qm::plist::parse(binaryList({arrayObject({7}, 1)}, 1));
    ASSERT_FALSE(missing.ok());
    EXPECT_EQ(missing.error().code, qm::plist::kErrorMalformed);
    auto badTop = qm::plist::parse(binaryList({kTrueObject}, 1, 3));
    ASSERT_FALSE(badTop.ok());
    EXPECT_EQ(badTop.error().code, qm::plist::kErrorMalformed);
}

TEST(PropertyList, InputOver64MiBIsRefusedUnread) {
    qm::Bytes huge(qm::plist::kMaxBytes + 1, ' ');
    auto value = qm::plist::parse(huge);
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().code, qm::plist::kErrorTooComplex);
}

// --- files ------------------------------------------------------------------

TEST(PropertyListFile, WritesAndReadsBack) {
    qmtest::TempDir dir;
    std::string path = dir.file("out.plist");
    qm::Value value(qm::Dictionary{{"a", qm::Value(1)}, {"b", qm::Value("text")}});
    for (Format format : {Format::xml, Format::binary}) {
        ASSERT_FALSE(qm::plist::writeFileAtomically(path, value, format));
        auto back = qm::plist::readFile(path);
        ASSERT_TRUE(back.ok()) << back.error().text();
        EXPECT_EQ(*back, value);
    }
    EXPECT_EQ(qmtest::readFile(path).rfind("bplist00", 0), 0u);
    // Nothing but the file itself is left in the folder.
    std::size_t entries = 0;
    for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(dir.path())) {
        ++entries;
    }
    EXPECT_EQ(entries, 1u);
}

TEST(PropertyListFile, NewFilesArePrivateAndReplacedFilesKeepTheirMode) {
    qmtest::TempDir dir;
    std::string fresh = dir.file("fresh.plist");
    ASSERT_FALSE(qm::plist::writeFileAtomically(fresh, qm::Value(qm::Array{}), Format::xml));
    struct stat status {};
    ASSERT_EQ(::stat(fresh.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0600u);

    std::string shared = dir.file("shared.plist");
    qmtest::writeFile(shared, "old");
    ASSERT_EQ(::chmod(shared.c_str(), 0644), 0);
    ASSERT_FALSE(qm::plist::writeFileAtomically(shared, qm::Value(qm::Array{}), Format::xml));
    ASSERT_EQ(::stat(shared.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0644u);
    EXPECT_TRUE(qm::plist::readFile(shared).ok());
}

TEST(PropertyListFile, AFailedSerializationLeavesTheOldFileAlone) {
    qmtest::TempDir dir;
    std::string path = dir.file("keep.plist");
    qmtest::writeFile(path, "previous content");
    auto error = qm::plist::writeFileAtomically(path, qm::Value(qm::Array{qm::Value()}), Format::xml);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, qm::plist::kErrorDomain);
    EXPECT_NE(error->text().find(path), std::string::npos);
    EXPECT_EQ(qmtest::readFile(path), "previous content");
}

TEST(PropertyListFile, WritingIntoAMissingFolderIsAPosixError) {
    qmtest::TempDir dir;
    auto error = qm::plist::writeFileAtomically(dir.file("missing/x.plist"), qm::Value(qm::Array{}), Format::xml);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, qm::kPosixErrorDomain);
    EXPECT_EQ(error->code, ENOENT);
}

TEST(PropertyListFile, ReadErrorsCarryErrnoOrSayWhatIsWrong) {
    qmtest::TempDir dir;
    auto missing = qm::plist::readFile(dir.file("absent.plist"));
    ASSERT_FALSE(missing.ok());
    EXPECT_EQ(missing.error().domain, qm::kPosixErrorDomain);
    EXPECT_EQ(missing.error().code, ENOENT);

    auto folder = qm::plist::readFile(dir.path());
    ASSERT_FALSE(folder.ok());
    EXPECT_EQ(folder.error().domain, qm::kPosixErrorDomain);
    EXPECT_EQ(folder.error().code, EISDIR);

    std::string junk = dir.file("junk.plist");
    qmtest::writeFile(junk, "this is not a property list");
    auto notPlist = qm::plist::readFile(junk);
    ASSERT_FALSE(notPlist.ok());
    EXPECT_EQ(notPlist.error().domain, qm::plist::kErrorDomain);
    EXPECT_NE(notPlist.error().text().find(junk), std::string::npos);
}

TEST(PropertyListFile, AFifoIsRefusedWithoutWaitingForAWriter) {
    qmtest::TempDir dir;
    std::string fifo = dir.file("fifo.plist");
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    auto value = qm::plist::readFile(fifo);
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().domain, qm::kPosixErrorDomain);
    EXPECT_EQ(value.error().code, EINVAL);
}

TEST(PropertyListFile, FilesOver64MiBAreRefusedBeforeReading) {
    qmtest::TempDir dir;
    std::string big = dir.file("big.plist");
    qmtest::writeFile(big, "");
    ASSERT_EQ(::truncate(big.c_str(), static_cast<off_t>(qm::plist::kMaxBytes) + 1), 0);  // sparse
    auto value = qm::plist::readFile(big);
    ASSERT_FALSE(value.ok());
    EXPECT_EQ(value.error().domain, qm::kPosixErrorDomain);
    EXPECT_EQ(value.error().code, EFBIG);
}

}  // namespace
