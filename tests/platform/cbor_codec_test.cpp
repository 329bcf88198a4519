// The Duct payload codec against hand-written CBOR: what it accepts, what it
// refuses and why, the exact bytes it writes, and that decoding cannot
// amplify: a payload whose tree would take more than sixteen times its size
// (64 KiB at least) is refused before the tree is built.

#include <gtest/gtest.h>

#include <atomic>
#include <cmath>
#include <cstdlib>
#include <limits>
#include <new>
#include <string>
#include <tuple>
#include <vector>

#include "platform/duct/CborCodec.h"

// Every allocation of the test program goes through here, so a test can ask
// how much was allocated, and the largest single allocation, while the
// decoder ran.
namespace {
std::atomic<std::size_t> gLargestAllocation{0};
std::atomic<std::size_t> gAllocatedBytes{0};

void* allocate(std::size_t size) {
    gAllocatedBytes.fetch_add(size, std::memory_order_relaxed);
    std::size_t largest = gLargestAllocation.load(std::memory_order_relaxed);
    while (size > largest && !gLargestAllocation.compare_exchange_weak(largest, size, std::memory_order_relaxed)) {
    }
    if (void* p = std::malloc(size ? size : 1)) {
        return p;
    }
    throw std::bad_alloc();
}
}  // namespace

void* operator new(std::size_t size) { return allocate(size); }
void* operator new[](std::size_t size) { return allocate(size); }
void operator delete(void* p) noexcept { std::free(p); }
void operator delete[](void* p) noexcept { std::free(p); }
void operator delete(void* p, std::size_t) noexcept { std::free(p); }
void operator delete[](void* p, std::size_t) noexcept { std::free(p); }

namespace qm {
namespace {

// Bytes from hex digits; spaces (between bytes) are for the reader.
Bytes hexBytes(std::string_view text) {
    Bytes out;
    for (std::size_t i = 0; i < text.size(); i += text[i] == ' ' ? 1 : 2) {
        if (text[i] != ' ') {
            out.push_back(static_cast<std::uint8_t>(std::stoi(std::string(text.substr(i, 2)), nullptr, 16)));
        }
    }
    return out;
}

std::string hex(const Bytes& data) {
    std::string out;
    for (auto b : data) {
        out += {"0123456789abcdef"[b >> 4], "0123456789abcdef"[b & 0xF]};
    }
    return out;
}

std::string repeated(std::string_view hexByte, std::size_t count) {
    std::string out;
    while (count-- > 0) {
        out += hexByte;
    }
    return out;
}

// Why the decoder refused the payload; "read whole" when it read all of it,
// every level included: written again, it is the payload itself.
std::string refusal(const std::string& hexText) {
    auto result = cbor::decode(hexBytes(hexText));
    if (!result.ok()) {
        return result.error().domain == "cbor" ? result.error().text() : "in domain " + result.error().domain;
    }
    return hex(cbor::encode(*result)) == hexText ? "read whole" : "accepted: " + result->description();
}

// n nested arrays, the innermost empty; tag 24 around content.
std::string nestedArrays(std::size_t n) {
    return repeated("81", n - 1) + "80";
}
std::string packedTag(const std::string& contentHex) {
    std::size_t size = contentHex.size() / 2;
    std::string head = size < 24 ? hex({static_cast<std::uint8_t>(0x40 + size)})
                       : size <= 0xFF ? "58" + hex({static_cast<std::uint8_t>(size)})
                                      : "59" + hex({static_cast<std::uint8_t>(size >> 8), static_cast<std::uint8_t>(size)});
    return "d818" + head + contentHex;
}

const std::string kUuidHex = "50 00112233445566778899aabbccddeeff";
const Uuid kUuid = Uuid::fromBytes(hexBytes(kUuidHex).data() + 1);
const std::string tooDeep = "nesting deeper than 512 levels";

// Each case decodes to its value (of that very type), encodes to its bytes,
// or both; a value without bytes survives the round trip.
TEST(CborCodec, ValuesAndTheirEncodings) {
    enum Way { both, decodes, encodes };
    Dictionary inner{{"when", Date{978307200.25}}, {"id", kUuid}, {"blob", Value(Bytes{0, 255, 7})}};
    struct Case {
        std::string hex;
        Value value;
        Way way = both;
    };
    const Case cases[] = {
        // Integers take the shortest head, at every boundary; non-negative
        // signed ones travel as major type 0.
        {"00", 0u}, {"17", 23u}, {"1818", 24u}, {"18ff", 255u}, {"190100", 256u}, {"19ffff", 65535u},
        {"1a00010000", 65536u}, {"1affffffff", 4294967295u}, {"1b0000000100000000", std::uint64_t{4294967296u}},
        {"1bffffffffffffffff", std::numeric_limits<std::uint64_t>::max()},
        {"05", std::int64_t{5}, encodes}, {"1903e8", std::int64_t{1000}, encodes},
        {"20", -1}, {"37", -24}, {"3818", -25}, {"390100", -257}, {"3a00010000", -65537},
        {"3b0000000100000000", std::int64_t{-4294967297}}, {"3b7fffffffffffffff", std::numeric_limits<std::int64_t>::min()},
        // Floats of every width are doubles; doubles go out 64-bit.
        {"f93c00", 1.0, decodes}, {"f9c400", -4.0, decodes}, {"f97bff", 65504.0, decodes},
        {"f90001", std::ldexp(1.0, -24), decodes},  // smallest subnormal half
        {"f97c00", std::numeric_limits<double>::infinity(), decodes}, {"fa47c35000", 100000.0, decodes},
        {"faff800000", -std::numeric_limits<double>::infinity(), decodes},
        {"fb3ff199999999999a", 1.1}, {"fb3ff8000000000000", 1.5}, {"fb4000000000000000", 2.0},
        {"f4", false}, {"f5", true}, {"f6", Value()},
        {"63616263", "abc"}, {"60", ""}, {"64f09f9880", "\xF0\x9F\x98\x80"},
        {"780378797a", "xyz", decodes},  // not the shortest head: still fine
        {"7818" + repeated("78", 24), std::string(24, 'x')},
        {"79012c" + repeated("78", 300), std::string(300, 'x')},
        {"43010203", Bytes{1, 2, 3}}, {"40", Bytes{}},
        {"830161 61f6", Value(Array{Value(1u), Value("a"), Value()})},
        {"80", Value(Array{})}, {"a0", Value(Dictionary{})},
        {"a2616202616182 01 a16163f5", Value(Dictionary{{"a", Value(Array{Value(1u), Value(Dictionary{{"c", true}})})}, {"b", 2u}}),
         decodes},  // keys in any order
        {"a2616180616201", Value(Dictionary{{"b", 1u}, {"a", Value(Array{})}})},
        // Dates: an integer when whole, else a double; any number decodes.
        {"c11a514b67b0", Date{1363896240}}, {"c1fb41d452d9ec200000", Date{1363896240.5}}, {"c13863", Date{-100}},
        {"c1fb7e37e43c8800759c", Date{1e300}},  // beyond int64
        {"c1f93e00", Date{1.5}, decodes},
        {"d80100", Date{0}, decodes},  // tag number in a one-byte head
        {"d825" + kUuidHex, kUuid},
        {"d81844a1616101", Value::packed(Value(Dictionary{{"a", 1u}}))},
        {"82" + packedTag("01") + "02", Value(Array{Value::packed(Value(1u)), Value(2u)})},
        {packedTag(packedTag("617a")), Value::packed(Value::packed(Value("z")))},
        {packedTag("781e" + repeated("71", 30)), Value::packed(Value(std::string(30, 'q')))},
        {packedTag("79012c" + repeated("71", 300)), Value::packed(Value(std::string(300, 'q')))},
        // Packed values after and inside others close at the right place.
        {"82 d818 46 82 d818 41 02 03 04",
         Value(Array{Value::packed(Value(Array{Value::packed(Value(2u)), Value(3u)})), Value(4u)})},
        {"", Value(Dictionary{{"unsigned", Value(std::numeric_limits<std::uint64_t>::max())},
                              {"signed", Value(std::numeric_limits<std::int64_t>::min())},
                              {"flags", Value(Array{Value(true), Value(false), Value()})},
                              {"packed", Value::packed(Value(inner))},
                              {"nested", Value(Array{Value(inner), Value(Array{}), Value(Dictionary{})})}})},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.hex.substr(0, 40) + " " + c.value.description().substr(0, 40));
        Bytes bytes = c.hex.empty() ? cbor::encode(c.value) : hexBytes(c.hex);
        if (c.way != encodes) {
            auto decoded = cbor::decode(bytes);
            ASSERT_TRUE(decoded.ok()) << decoded.error().text();
            EXPECT_EQ(*decoded, c.value);
            EXPECT_EQ(decoded->type(), c.value.type());
        }
        if (c.way != decodes) {
            EXPECT_EQ(hex(cbor::encode(c.value)), hex(bytes));
        }
    }
    Value nan = cbor::decode(hexBytes("f97e00")).value();
    EXPECT_TRUE(std::isnan(*nan.asDouble()));
    EXPECT_TRUE(std::signbit(*cbor::decode(hexBytes("f98000")).value().asDouble()));
    Bytes appended{0xAB};
    cbor::encode(Value(7u), appended);
    EXPECT_EQ(hex(appended), "ab07");
}

// Lengths beyond the payload are refused without allocating for them.
TEST(CborDecode, InvalidPayloadsAreRefusedWithTheirReason) {
    const std::string zeros64 = repeated("00", 64);
    // {the reason, the payloads refused for it}
    const std::pair<std::string, std::vector<std::string>> cases[] = {
        {"empty payload", {""}},
        {"negative integer below -2^63", {"3b8000000000000000", "3bffffffffffffffff"}},
        // indefinite lengths, and a break with nothing to end
        {"indefinite length", {"9fff", "bfff", "5f4100ff", "7f6161ff", "819fff", packedTag("9fff")}},
        {"unexpected break", {"ff"}},
        {"map key is not text", {"a10102", "a1416102", "a18002", "a1f602", "a16161a10102", "81a1c10002", packedTag("a10102")}},
        {"duplicate map key \"x\"", {"a2617801617802"}}, {"duplicate map key \"y\"", {"a3617901617802617903"}},
        {"duplicate map key \"\"", {"81a260016002"}},
        // a lone continuation byte, overlong NUL, overlong three- and four-byte
        // forms, the surrogate U+D800, U+110000, cut short, 0xff, in a key
        {"text is not UTF-8", {"6180", "62c080", "63e08080", "64f0808080", "63eda080", "64f4908080", "62e282", "61ff", "a161fe01"}},
        // simple values other than false, true and null; reserved additional information
        {"undefined is not supported", {"f7"}}, {"unsupported simple value (initial byte 0xe0)", {"e0"}},
        {"unsupported simple value (initial byte 0xf3)", {"f3"}}, {"unsupported simple value (initial byte 0xf8)", {"f820"}},
        {"reserved initial byte 0x1c", {"1c"}}, {"reserved initial byte 0x5d", {"5d"}},
        {"malformed item (initial byte 0x1f)", {"1f"}},
        // tags: only 1, 24 and 37, each on its own content
        {"unsupported tag 2", {"c24101", packedTag("c24100")}}, {"unsupported tag 0", {"c060"}}, {"unsupported tag 6", {"c600"}},
        {"unsupported tag 256", {"d9010000"}}, {"unsupported tag 18446744073709551615", {"dbffffffffffffffff00"}},
        {"tag 1 content is not a number", {"c16131", "c1f6", "c180", "c1c100"}},
        {"tag 1 content is not a finite number", {"c1f97e00"}},
        {"tag 37 content is not a 16-byte byte string",
         {"d8254f" + repeated("00", 15), "d82551" + repeated("00", 17), "d82570" + repeated("61", 16)}},
        {"tag 24 content is not a byte string", {"d818a0", "d8186161"}}, {"trailing bytes in tag 24 content", {"d818420101"}},
        // Cut short; the inner item of tag 24 may not reach past its byte
        // string into the outer payload; byte string, text, array and map of
        // 2^60, and counts just past what the bytes could hold.
        {"truncated item",
         {"1901", "6261", "8201", "a16161", "c1", "fb0000", "d81840", "82d818418101", "5b1000000000000000" + zeros64,
          "7b1000000000000000" + zeros64, "9b1000000000000000" + zeros64, "bb1000000000000000" + zeros64, "9a7fffffff01",
          "830102", "a2616101"}},
        {"trailing bytes", {"0102", "8000", "f6f6"}},
    };
    gLargestAllocation = 0;
    for (const auto& [reason, payloads] : cases) {
        for (const std::string& payload : payloads) {
            EXPECT_EQ(refusal(payload), reason) << payload;
        }
    }
    EXPECT_LT(gLargestAllocation.load(), 4096u);
}

// Every array, map and tag is a level, the content of tag 24 included;
// scalars are not. Hostile depths are refused without exhausting the stack.
TEST(CborDecode, NestingOf512LevelsIsAcceptedAnd513Refused) {
    const std::string whole = "read whole";
    const std::string mapsThenDate = repeated("81", 510) + "a1616bc100";
    const std::string inner = nestedArrays(509);  // packed inside packed keeps counting
    const std::pair<std::string, std::string> cases[] = {
        {nestedArrays(512), whole}, {nestedArrays(513), tooDeep}, {mapsThenDate, whole}, {"81" + mapsThenDate, tooDeep},
        {repeated("81", 512) + "d825" + kUuidHex, tooDeep},
        {repeated("81", 512) + "a0", tooDeep},  // even an empty one
        {repeated("81", 512) + "00", whole},
        // 255 arrays, the tag at level 256, then 256 more levels inside: 512.
        {repeated("81", 255) + packedTag(nestedArrays(256)), whole},
        {repeated("81", 255) + packedTag(nestedArrays(257)), tooDeep},
        {"81" + packedTag(packedTag(inner)), whole}, {"8181" + packedTag(packedTag(inner)), tooDeep},
        {repeated("81", 100000) + "80", tooDeep}, {repeated("a1616b", 100000) + "a0", tooDeep},
        {repeated("c1", 100000) + "00", "tag 1 content is not a number"}, {repeated("9f", 100000), "indefinite length"},
    };
    for (const auto& [payload, reason] : cases) {
        EXPECT_EQ(refusal(payload), reason) << payload.substr(0, 40) << "... of " << payload.size() / 2 << " bytes";
    }
    Value deep;  // encoding needs no recursion either
    for (int i = 0; i < 2000; ++i) {
        deep = Value(Array{deep});
    }
    Bytes encoded = cbor::encode(deep);
    EXPECT_EQ(encoded.size(), 2001u);
    EXPECT_EQ(refusal(hex(encoded)), tooDeep);
}

// One array head for `count` items followed by `count` copies of `item`.
Bytes arrayOf(const Bytes& item, std::size_t count) {
    Bytes out{0x9a};
    for (int shift : {24, 16, 8, 0}) {
        out.push_back(static_cast<std::uint8_t>(count >> shift));
    }
    out.reserve(out.size() + count * item.size());
    for (std::size_t i = 0; i < count; ++i) {
        out.insert(out.end(), item.begin(), item.end());
    }
    return out;
}

TEST(CborDecodedSize, APayloadIsRefusedWhenItsTreeWouldOutgrowItsBytes) {
    constexpr std::size_t kFourMebibytes = 4 * 1024 * 1024;
    const std::size_t fill = kFourMebibytes - 5;
    Bytes hundredByteText{0x78, 98};  // a 2-byte head and 98 letters
    hundredByteText.resize(100, 'x');
    const std::tuple<const char*, Bytes, bool> cases[] = {
        {"4 MiB: one array of empty arrays", arrayOf({0x80}, fill), false},
        {"4 MiB: one array of empty maps", arrayOf({0xa0}, fill), false},
        {"4 MiB: one array of empty strings", arrayOf({0x60}, fill), false},
        {"4 MiB: one array of small integers", arrayOf({0x01}, fill), false},
        {"4 MiB: a map holding one byte string",
         cbor::encode(Value(Dictionary{{"blob", Value(Bytes(kFourMebibytes - 12, 0x5a))}})), true},
        {"4 MiB: an array of 100-byte texts", arrayOf(hundredByteText, kFourMebibytes / 100), true},
        {"2 KiB of empty arrays: within the 64 KiB floor", arrayOf({0x80}, 2048), true},
    };
    for (const auto& [what, payload, accepted] : cases) {
        SCOPED_TRACE(what);
        std::size_t before = gAllocatedBytes.load();
        auto decoded = cbor::decodeMeasured(payload);
        std::size_t allocated = gAllocatedBytes.load() - before;
        ASSERT_EQ(decoded.ok(), accepted) << (decoded.ok() ? "" : decoded.error().text());
        if (!decoded) {
            EXPECT_NE(decoded.error().text().find("decoded size"), std::string::npos);
            EXPECT_LT(allocated, payload.size());  // refused before the tree was built
            continue;
        }
        // What the decoder reports is what the tree took, give or take its
        // own working memory.
        EXPECT_LE(decoded->allocatedBytes, allocated);
        EXPECT_LE(allocated, decoded->allocatedBytes + 4096);
        EXPECT_LE(decoded->allocatedBytes, cbor::decodedSizeBound(payload.size()));
    }
}

TEST(CborDecodedSize, EmptyValuesShareOneObject) {
    auto decoded = cbor::decode(Bytes{0x88, 0x80, 0x80, 0xa0, 0xa0, 0x60, 0x60, 0x40, 0x40});
    ASSERT_TRUE(decoded);
    const Array& items = *decoded->asArray();
    const Value empties[] = {Value(Array()), Value(Dictionary()), Value(""), Value(Bytes())};
    for (std::size_t i = 0; i < items.size(); i += 2) {
        EXPECT_TRUE(items[i].isSameObject(items[i + 1])) << items[i].description();
        EXPECT_TRUE(items[i].isSameObject(empties[i / 2])) << items[i].description();
    }
    EXPECT_FALSE(Value(Array{Value(1)}).isSameObject(Value(Array{Value(1)})));
}

}  // namespace
}  // namespace qm
