// The Duct payload codec against hand-written CBOR: what it accepts, what it
// refuses and why, and the exact bytes it writes.

#include <gtest/gtest.h>

#include <atomic>
#include <cmath>
#include <cstdlib>
#include <initializer_list>
#include <limits>
#include <new>
#include <string>

#include "platform/duct/CborCodec.h"

// Every allocation of the test program goes through here, so a test can ask
// how large the largest allocation was while the decoder ran.
namespace {
std::atomic<std::size_t> gLargestAllocation{0};

void* allocate(std::size_t size) {
    std::size_t largest = gLargestAllocation.load(std::memory_order_relaxed);
    while (size > largest && !gLargestAllocation.compare_exchange_weak(largest, size, std::memory_order_relaxed)) {
    }
    if (void* p = std::malloc(size ? size : 1)) {
        return p;
    }
    throw std::bad_alloc();
}
}  // namespace

void* operator new(std::size_t size) {
    return allocate(size);
}
void* operator new[](std::size_t size) {
    return allocate(size);
}
void operator delete(void* p) noexcept {
    std::free(p);
}
void operator delete[](void* p) noexcept {
    std::free(p);
}
void operator delete(void* p, std::size_t) noexcept {
    std::free(p);
}
void operator delete[](void* p, std::size_t) noexcept {
    std::free(p);
}

namespace qm {
namespace {

Bytes bytes(std::initializer_list<int> list) {
    Bytes out;
    for (int b : list) {
        out.push_back(static_cast<std::uint8_t>(b));
    }
    return out;
}

Bytes operator+(Bytes a, const Bytes& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

Bytes repeated(std::uint8_t byte, std::size_t count) {
    return Bytes(count, byte);
}

Value decoded(const Bytes& payload) {
    auto result = cbor::decode(payload);
    EXPECT_TRUE(result.ok()) << (result.ok() ? "" : result.error().text());
    return result.ok() ? result.value() : Value();
}

std::string refusal(const Bytes& payload) {
    auto result = cbor::decode(payload);
    if (result.ok()) {
        return "accepted: " + result.value().description();
    }
    EXPECT_EQ(result.error().domain, "cbor");
    return result.error().text();
}

std::string hex(const Bytes& data) {
    static const char* digits = "0123456789abcdef";
    std::string out;
    for (auto b : data) {
        out += digits[b >> 4];
        out += digits[b & 0xF];
    }
    return out;
}

// The nesting depth of a decoded value: arrays, dictionaries and packed
// values are one level each.
std::size_t depthOf(const Value& value) {
    std::size_t depth = 0;
    const Value* current = &value;
    while (true) {
        if (const Array* array = current->asArray()) {
            ++depth;
            if (array->empty()) {
                return depth;
            }
            current = &array->front();
        } else if (const Value* content = current->packedContent()) {
            ++depth;
            current = content;
        } else {
            return depth;
        }
    }
}

// n nested arrays, the innermost empty: 0x81 ... 0x81 0x80.
Bytes nestedArrays(std::size_t n) {
    return repeated(0x81, n - 1) + bytes({0x80});
}

// Tag 24 on a byte string holding content.
Bytes packedTag(const Bytes& content) {
    Bytes out = bytes({0xD8, 0x18});
    if (content.size() < 24) {
        out.push_back(static_cast<std::uint8_t>(0x40 + content.size()));
    } else if (content.size() <= 0xFF) {
        out = out + bytes({0x58, static_cast<int>(content.size())});
    } else {
        out = out + bytes({0x59, static_cast<int>(content.size() >> 8), static_cast<int>(content.size() & 0xFF)});
    }
    return out + content;
}

const Uuid kUuid = Uuid::fromBytes(bytes({0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xAA, 0xBB, 0xCC,
                                          0xDD, 0xEE, 0xFF})
                                       .data());
const Bytes kUuidBytes = bytes({0x50, 0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xAA, 0xBB, 0xCC, 0xDD,
                                0xEE, 0xFF});

TEST(CborDecode, UnsignedIntegersOfEveryHeadWidthAreUnsigned) {
    struct Case {
        Bytes payload;
        std::uint64_t expected;
    };
    for (const auto& [payload, expected] : {
             Case{bytes({0x00}), 0},
             Case{bytes({0x17}), 23},
             Case{bytes({0x18, 0x18}), 24},
             Case{bytes({0x18, 0xFF}), 255},
             Case{bytes({0x19, 0x01, 0x00}), 256},
             Case{bytes({0x1A, 0x00, 0x01, 0x00, 0x00}), 65536},
             Case{bytes({0x1B, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x00, 0x00}), 4294967296ull},
             Case{bytes({0x1B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}), std::numeric_limits<std::uint64_t>::max()},
         }) {
        Value value = decoded(payload);
        EXPECT_EQ(value.type(), ValueType::unsignedInteger) << hex(payload);
        EXPECT_EQ(value.asUnsigned(), expected) << hex(payload);
    }
}

TEST(CborDecode, NegativeIntegersOfEveryHeadWidthAreSignedDownToInt64Min) {
    struct Case {
        Bytes payload;
        std::int64_t expected;
    };
    for (const auto& [payload, expected] : {
             Case{bytes({0x20}), -1},
             Case{bytes({0x37}), -24},
             Case{bytes({0x38, 0x18}), -25},
             Case{bytes({0x39, 0x01, 0x00}), -257},
             Case{bytes({0x3A, 0x00, 0x01, 0x00, 0x00}), -65537},
             Case{bytes({0x3B, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x00, 0x00}), -4294967297ll},
             Case{bytes({0x3B, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}), std::numeric_limits<std::int64_t>::min()},
         }) {
        Value value = decoded(payload);
        EXPECT_EQ(value.type(), ValueType::signedInteger) << hex(payload);
        EXPECT_EQ(value.asSigned(), expected) << hex(payload);
    }
    EXPECT_EQ(refusal(bytes({0x3B, 0x80, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00})), "negative integer below -2^63");
    EXPECT_EQ(refusal(bytes({0x3B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})), "negative integer below -2^63");
}

TEST(CborDecode, FloatsOfEveryWidthAreDoubles) {
    struct Case {
        Bytes payload;
        double expected;
    };
    for (const auto& [payload, expected] : {
             Case{bytes({0xF9, 0x3C, 0x00}), 1.0},
             Case{bytes({0xF9, 0xC4, 0x00}), -4.0},
             Case{bytes({0xF9, 0x7B, 0xFF}), 65504.0},
             Case{bytes({0xF9, 0x00, 0x01}), std::ldexp(1.0, -24)},  // smallest subnormal half
             Case{bytes({0xF9, 0x7C, 0x00}), std::numeric_limits<double>::infinity()},
             Case{bytes({0xFA, 0x47, 0xC3, 0x50, 0x00}), 100000.0},
             Case{bytes({0xFA, 0xFF, 0x80, 0x00, 0x00}), -std::numeric_limits<double>::infinity()},
             Case{bytes({0xFB, 0x3F, 0xF1, 0x99, 0x99, 0x99, 0x99, 0x99, 0x9A}), 1.1},
         }) {
        Value value = decoded(payload);
        EXPECT_EQ(value.type(), ValueType::real) << hex(payload);
        EXPECT_EQ(value.asDouble(), expected) << hex(payload);
    }
    Value nan = decoded(bytes({0xF9, 0x7E, 0x00}));
    ASSERT_EQ(nan.type(), ValueType::real);
    EXPECT_TRUE(std::isnan(*nan.asDouble()));
    Value negativeZero = decoded(bytes({0xF9, 0x80, 0x00}));
    EXPECT_TRUE(std::signbit(*negativeZero.asDouble()));
}

TEST(CborDecode, SimpleValuesAndStrings) {
    EXPECT_EQ(decoded(bytes({0xF4})).asBool(), false);
    EXPECT_EQ(decoded(bytes({0xF5})).asBool(), true);
    EXPECT_TRUE(decoded(bytes({0xF6})).isNull());
    EXPECT_EQ(decoded(bytes({0x63, 'a', 'b', 'c'})), Value("abc"));
    EXPECT_EQ(decoded(bytes({0x60})), Value(""));
    EXPECT_EQ(decoded(bytes({0x64, 0xF0, 0x9F, 0x98, 0x80})), Value("\xF0\x9F\x98\x80"));
    EXPECT_EQ(decoded(bytes({0x78, 0x03, 'x', 'y', 'z'})), Value("xyz"));  // not the shortest head: still fine
    Value data = decoded(bytes({0x43, 0x01, 0x02, 0x03}));
    ASSERT_NE(data.asData(), nullptr);
    EXPECT_EQ(*data.asData(), bytes({1, 2, 3}));
    EXPECT_EQ(decoded(bytes({0x40})).asData()->size(), 0u);
}

TEST(CborDecode, ArraysAndMapsWithKeysInAnyOrder) {
    EXPECT_EQ(decoded(bytes({0x83, 0x01, 0x61, 'a', 0xF6})), Value(Array{Value(1u), Value("a"), Value()}));
    EXPECT_EQ(decoded(bytes({0x80})), Value(Array{}));
    EXPECT_EQ(decoded(bytes({0xA0})), Value(Dictionary{}));
    Value map = decoded(bytes({0xA2, 0x61, 'b', 0x02, 0x61, 'a', 0x82, 0x01, 0xA1, 0x61, 'c', 0xF5}));
    EXPECT_EQ(map, Value(Dictionary{{"a", Value(Array{Value(1u), Value(Dictionary{{"c", true}})})}, {"b", 2u}}));
    ASSERT_NE(map.asDictionary(), nullptr);
    EXPECT_EQ(map.asDictionary()->begin()->first, "a");
}

TEST(CborDecode, DateTagOnIntegerOrFloat) {
    EXPECT_EQ(decoded(bytes({0xC1, 0x1A, 0x51, 0x4B, 0x67, 0xB0})).asDate(), Date{1363896240});
    EXPECT_EQ(decoded(bytes({0xC1, 0xFB, 0x41, 0xD4, 0x52, 0xD9, 0xEC, 0x20, 0x00, 0x00})).asDate(),
              Date{1363896240.5});
    EXPECT_EQ(decoded(bytes({0xC1, 0x38, 0x63})).asDate(), Date{-100});
    EXPECT_EQ(decoded(bytes({0xC1, 0xF9, 0x3E, 0x00})).asDate(), Date{1.5});
    EXPECT_EQ(decoded(bytes({0xD8, 0x01, 0x00})).asDate(), Date{0});  // tag number in a one-byte head

    EXPECT_EQ(refusal(bytes({0xC1, 0x61, '1'})), "tag 1 content is not a number");
    EXPECT_EQ(refusal(bytes({0xC1, 0xF6})), "tag 1 content is not a number");
    EXPECT_EQ(refusal(bytes({0xC1, 0x80})), "tag 1 content is not a number");
    EXPECT_EQ(refusal(bytes({0xC1, 0xC1, 0x00})), "tag 1 content is not a number");
    EXPECT_EQ(refusal(bytes({0xC1, 0xF9, 0x7E, 0x00})), "tag 1 content is not a finite number");
}

TEST(CborDecode, UuidTagOnSixteenBytes) {
    EXPECT_EQ(decoded(bytes({0xD8, 0x25}) + kUuidBytes).asUuid(), kUuid);

    Bytes fifteen = bytes({0xD8, 0x25, 0x4F}) + repeated(0x00, 15);
    Bytes seventeen = bytes({0xD8, 0x25, 0x51}) + repeated(0x00, 17);
    Bytes text = bytes({0xD8, 0x25, 0x70}) + repeated('a', 16);
    for (const Bytes& payload : {fifteen, seventeen, text}) {
        EXPECT_EQ(refusal(payload), "tag 37 content is not a 16-byte byte string") << hex(payload);
    }
}

TEST(CborDecode, PackedTagHoldsExactlyOneItemDecodedWithTheSameRules) {
    Value packed = decoded(bytes({0xD8, 0x18, 0x44, 0xA1, 0x61, 'a', 0x01}));
    ASSERT_EQ(packed.type(), ValueType::packed);
    EXPECT_EQ(*packed.packedContent(), Value(Dictionary{{"a", 1u}}));

    Value inArray = decoded(bytes({0x82}) + packedTag(bytes({0x01})) + bytes({0x02}));
    ASSERT_NE(inArray.asArray(), nullptr);
    EXPECT_EQ(*(*inArray.asArray())[0].packedContent(), Value(1u));
    EXPECT_EQ((*inArray.asArray())[1], Value(2u));

    Value twice = decoded(packedTag(packedTag(bytes({0x61, 'z'}))));
    ASSERT_NE(twice.packedContent(), nullptr);
    ASSERT_NE(twice.packedContent()->packedContent(), nullptr);
    EXPECT_EQ(*twice.packedContent()->packedContent(), Value("z"));

    EXPECT_EQ(refusal(bytes({0xD8, 0x18, 0xA0})), "tag 24 content is not a byte string");
    EXPECT_EQ(refusal(bytes({0xD8, 0x18, 0x61, 'a'})), "tag 24 content is not a byte string");
    EXPECT_EQ(refusal(bytes({0xD8, 0x18, 0x42, 0x01, 0x01})), "trailing bytes in tag 24 content");
    EXPECT_EQ(refusal(bytes({0xD8, 0x18, 0x40})), "truncated item");
    // The inner item may not reach past its byte string into the outer payload.
    EXPECT_EQ(refusal(bytes({0x82, 0xD8, 0x18, 0x41, 0x81, 0x01})), "truncated item");
    EXPECT_EQ(refusal(packedTag(bytes({0xA1, 0x01, 0x02}))), "map key is not text");
    EXPECT_EQ(refusal(packedTag(bytes({0x9F, 0xFF}))), "indefinite length");
    EXPECT_EQ(refusal(packedTag(bytes({0xC2, 0x41, 0x00}))), "unsupported tag 2");
}

TEST(CborDecode, OtherTagsAreRefusedByNumber) {
    EXPECT_EQ(refusal(bytes({0xC2, 0x41, 0x01})), "unsupported tag 2");
    EXPECT_EQ(refusal(bytes({0xC0, 0x60})), "unsupported tag 0");
    EXPECT_EQ(refusal(bytes({0xC6, 0x00})), "unsupported tag 6");
    EXPECT_EQ(refusal(bytes({0xD9, 0x01, 0x00, 0x00})), "unsupported tag 256");
    EXPECT_EQ(refusal(bytes({0xDB, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0x00})),
              "unsupported tag 18446744073709551615");
}

TEST(CborDecode, InvalidFramesAreRefusedWithTheirReason) {
    struct Case {
        Bytes payload;
        std::string reason;
    };
    for (const auto& [payload, reason] : {
             Case{Bytes{}, "empty payload"},
             // indefinite lengths, and a break with nothing to end
             Case{bytes({0x9F, 0xFF}), "indefinite length"},
             Case{bytes({0xBF, 0xFF}), "indefinite length"},
             Case{bytes({0x5F, 0x41, 0x00, 0xFF}), "indefinite length"},
             Case{bytes({0x7F, 0x61, 'a', 0xFF}), "indefinite length"},
             Case{bytes({0x81, 0x9F, 0xFF}), "indefinite length"},
             Case{bytes({0xFF}), "unexpected break"},
             // map keys
             Case{bytes({0xA1, 0x01, 0x02}), "map key is not text"},
             Case{bytes({0xA1, 0x41, 'a', 0x02}), "map key is not text"},
             Case{bytes({0xA1, 0x80, 0x02}), "map key is not text"},
             Case{bytes({0xA1, 0xF6, 0x02}), "map key is not text"},
             Case{bytes({0xA1, 0x61, 'a', 0xA1, 0x01, 0x02}), "map key is not text"},
             Case{bytes({0x81, 0xA1, 0xC1, 0x00, 0x02}), "map key is not text"},
             Case{bytes({0xA2, 0x61, 'x', 0x01, 0x61, 'x', 0x02}), "duplicate map key \"x\""},
             Case{bytes({0xA3, 0x61, 'y', 0x01, 0x61, 'x', 0x02, 0x61, 'y', 0x03}), "duplicate map key \"y\""},
             Case{bytes({0x81, 0xA2, 0x60, 0x01, 0x60, 0x02}), "duplicate map key \"\""},
             // UTF-8
             Case{bytes({0x61, 0x80}), "text is not UTF-8"},                    // lone continuation byte
             Case{bytes({0x62, 0xC0, 0x80}), "text is not UTF-8"},              // overlong NUL
             Case{bytes({0x63, 0xE0, 0x80, 0x80}), "text is not UTF-8"},        // overlong three-byte
             Case{bytes({0x64, 0xF0, 0x80, 0x80, 0x80}), "text is not UTF-8"},  // overlong four-byte
             Case{bytes({0x63, 0xED, 0xA0, 0x80}), "text is not UTF-8"},        // surrogate U+D800
             Case{bytes({0x64, 0xF4, 0x90, 0x80, 0x80}), "text is not UTF-8"},  // U+110000
             Case{bytes({0x62, 0xE2, 0x82}), "text is not UTF-8"},              // cut short
             Case{bytes({0x61, 0xFF}), "text is not UTF-8"},
             Case{bytes({0xA1, 0x61, 0xFE, 0x01}), "text is not UTF-8"},  // in a key
             // simple values other than false, true and null
             Case{bytes({0xF7}), "undefined is not supported"},
             Case{bytes({0xE0}), "unsupported simple value (initial byte 0xe0)"},
             Case{bytes({0xF3}), "unsupported simple value (initial byte 0xf3)"},
             Case{bytes({0xF8, 0x20}), "unsupported simple value (initial byte 0xf8)"},
             // reserved additional information
             Case{bytes({0x1C}), "reserved initial byte 0x1c"},
             Case{bytes({0x5D}), "reserved initial byte 0x5d"},
             Case{bytes({0x1F}), "malformed item (initial byte 0x1f)"},
             // truncation and trailing bytes
             Case{bytes({0x19, 0x01}), "truncated item"},
             Case{bytes({0x62, 'a'}), "truncated item"},
             Case{bytes({0x82, 0x01}), "truncated item"},
             Case{bytes({0xA1, 0x61, 'a'}), "truncated item"},
             Case{bytes({0xC1}), "truncated item"},
             Case{bytes({0xFB, 0x00, 0x00}), "truncated item"},
             Case{bytes({0x01, 0x02}), "trailing bytes"},
             Case{bytes({0x80, 0x00}), "trailing bytes"},
             Case{bytes({0xF6, 0xF6}), "trailing bytes"},
         }) {
        EXPECT_EQ(refusal(payload), reason) << hex(payload);
    }
}

TEST(CborDecode, LengthsBeyondThePayloadAreRefusedWithoutAllocatingForThem) {
    const Bytes huge = bytes({0x10, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00});  // 2^60
    gLargestAllocation = 0;
    for (int initial : {0x5B, 0x7B, 0x9B, 0xBB}) {  // byte string, text, array, map
        Bytes payload = bytes({initial}) + huge + repeated(0x00, 64);
        EXPECT_EQ(refusal(payload), "truncated item") << hex(payload);
    }
    // Counts just past what the bytes could hold.
    EXPECT_EQ(refusal(bytes({0x9A, 0x7F, 0xFF, 0xFF, 0xFF, 0x01})), "truncated item");
    EXPECT_EQ(refusal(bytes({0x83, 0x01, 0x02})), "truncated item");
    EXPECT_EQ(refusal(bytes({0xA2, 0x61, 'a', 0x01})), "truncated item");
    EXPECT_LT(gLargestAllocation.load(), 4096u);
}

TEST(CborDecode, NestingOf512LevelsIsAcceptedAnd513Refused) {
    const std::string tooDeep = "nesting deeper than 512 levels";
    EXPECT_EQ(depthOf(decoded(nestedArrays(512))), 512u);
    EXPECT_EQ(refusal(nestedArrays(513)), tooDeep);

    // Maps and tags count as levels too.
    Bytes mapsThenDate = repeated(0x81, 510) + bytes({0xA1, 0x61, 'k', 0xC1, 0x00});
    EXPECT_TRUE(cbor::decode(mapsThenDate).ok());
    Bytes oneMore = bytes({0x81}) + mapsThenDate;
    EXPECT_EQ(refusal(oneMore), tooDeep);
    EXPECT_EQ(refusal(repeated(0x81, 512) + bytes({0xD8, 0x25}) + kUuidBytes), tooDeep);
    EXPECT_EQ(refusal(repeated(0x81, 512) + bytes({0xA0})), tooDeep);  // even an empty one
    // Scalars are not levels.
    EXPECT_TRUE(cbor::decode(repeated(0x81, 512) + bytes({0x00})).ok());
}

TEST(CborDecode, NestingContinuesIntoPackedContent) {
    // 255 arrays, the tag at level 256, then 256 more levels inside: 512.
    Bytes fits = repeated(0x81, 255) + packedTag(nestedArrays(256));
    EXPECT_EQ(depthOf(decoded(fits)), 512u);
    Bytes deeper = repeated(0x81, 255) + packedTag(nestedArrays(257));
    EXPECT_EQ(refusal(deeper), "nesting deeper than 512 levels");

    // Packed inside packed keeps counting.
    Bytes inner = nestedArrays(509);
    EXPECT_EQ(depthOf(decoded(bytes({0x81}) + packedTag(packedTag(inner)))), 512u);
    EXPECT_EQ(refusal(bytes({0x81, 0x81}) + packedTag(packedTag(inner))), "nesting deeper than 512 levels");
}

TEST(CborDecode, HostileDepthIsRefusedWithoutExhaustingTheStack) {
    EXPECT_EQ(refusal(repeated(0x81, 100000) + bytes({0x80})), "nesting deeper than 512 levels");
    Bytes maps;
    for (int i = 0; i < 100000; ++i) {
        maps.insert(maps.end(), {0xA1, 0x61, 'k'});
    }
    EXPECT_EQ(refusal(maps + bytes({0xA0})), "nesting deeper than 512 levels");
    EXPECT_EQ(refusal(repeated(0xC1, 100000) + bytes({0x00})), "tag 1 content is not a number");
    EXPECT_EQ(refusal(repeated(0x9F, 100000)), "indefinite length");
}

TEST(CborEncode, ScalarsUseShortestHeads) {
    struct Case {
        Value value;
        Bytes expected;
    };
    for (const auto& [value, expected] : {
             Case{Value(std::uint64_t{0}), bytes({0x00})},
             Case{Value(std::uint64_t{23}), bytes({0x17})},
             Case{Value(std::uint64_t{24}), bytes({0x18, 0x18})},
             Case{Value(std::uint64_t{255}), bytes({0x18, 0xFF})},
             Case{Value(std::uint64_t{256}), bytes({0x19, 0x01, 0x00})},
             Case{Value(std::uint64_t{65535}), bytes({0x19, 0xFF, 0xFF})},
             Case{Value(std::uint64_t{65536}), bytes({0x1A, 0x00, 0x01, 0x00, 0x00})},
             Case{Value(std::uint64_t{4294967295u}), bytes({0x1A, 0xFF, 0xFF, 0xFF, 0xFF})},
             Case{Value(std::uint64_t{4294967296u}), bytes({0x1B, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x00, 0x00})},
             Case{Value(std::int64_t{5}), bytes({0x05})},
             Case{Value(std::int64_t{1000}), bytes({0x19, 0x03, 0xE8})},
             Case{Value(std::int64_t{-1}), bytes({0x20})},
             Case{Value(std::int64_t{-24}), bytes({0x37})},
             Case{Value(std::int64_t{-25}), bytes({0x38, 0x18})},
             Case{Value(std::int64_t{-257}), bytes({0x39, 0x01, 0x00})},
             Case{Value(std::numeric_limits<std::int64_t>::min()),
                  bytes({0x3B, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})},
             Case{Value(1.5), bytes({0xFB, 0x3F, 0xF8, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00})},
             Case{Value(2.0), bytes({0xFB, 0x40, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00})},
             Case{Value(false), bytes({0xF4})},
             Case{Value(true), bytes({0xF5})},
             Case{Value(), bytes({0xF6})},
             Case{Value("a"), bytes({0x61, 'a'})},
             Case{Value(""), bytes({0x60})},
             Case{Value(bytes({1, 2})), bytes({0x42, 0x01, 0x02})},
             Case{Value(kUuid), bytes({0xD8, 0x25}) + kUuidBytes},
         }) {
        EXPECT_EQ(hex(cbor::encode(value)), hex(expected)) << value.description();
    }
    EXPECT_EQ(hex(cbor::encode(Value(std::string(24, 'x')))), hex(bytes({0x78, 0x18}) + repeated('x', 24)));
    EXPECT_EQ(hex(cbor::encode(Value(std::string(300, 'x')))), hex(bytes({0x79, 0x01, 0x2C}) + repeated('x', 300)));
}

TEST(CborEncode, DatesAreIntegersWhenWholeElseDoubles) {
    EXPECT_EQ(hex(cbor::encode(Value(Date{1363896240}))), "c11a514b67b0");
    EXPECT_EQ(hex(cbor::encode(Value(Date{-100}))), "c13863");
    EXPECT_EQ(hex(cbor::encode(Value(Date{1363896240.5}))), "c1fb41d452d9ec200000");
    EXPECT_EQ(hex(cbor::encode(Value(Date{1e300}))), "c1fb7e37e43c8800759c");  // beyond int64
}

TEST(CborEncode, ContainersAndPackedValues) {
    EXPECT_EQ(hex(cbor::encode(Value(Array{Value(1u), Value("a")}))), "82016161");
    EXPECT_EQ(hex(cbor::encode(Value(Dictionary{{"b", 1u}, {"a", Value(Array{})}}))), "a2616180616201");
    EXPECT_EQ(hex(cbor::encode(Value::packed(Value(Dictionary{{"a", 1u}})))), "d81844a1616101");
    // Content long enough for a one- and a two-byte length head.
    Value thirty = Value(std::string(30, 'q'));
    EXPECT_EQ(hex(cbor::encode(Value::packed(thirty))), hex(bytes({0xD8, 0x18, 0x58, 0x20}) + cbor::encode(thirty)));
    Value threeHundred = Value(std::string(300, 'q'));
    EXPECT_EQ(hex(cbor::encode(Value::packed(threeHundred))),
              hex(bytes({0xD8, 0x18, 0x59, 0x01, 0x2F}) + cbor::encode(threeHundred)));
    // Packed values after and inside others close at the right place.
    Value mixed = Value(Array{Value::packed(Value(Array{Value::packed(Value(2u)), Value(3u)})), Value(4u)});
    EXPECT_EQ(hex(cbor::encode(mixed)), "82" "d818" "46" "82" "d818" "41" "02" "03" "04");

    Bytes appended = bytes({0xAB});
    cbor::encode(Value(7u), appended);
    EXPECT_EQ(hex(appended), "ab07");
}

TEST(CborCodec, RichValueSurvivesARoundTripWithItsTypes) {
    Dictionary inner{{"when", Date{978307200.25}}, {"id", kUuid}, {"blob", Value(bytes({0, 255, 7}))}};
    Value rich(Dictionary{
        {"unsigned", Value(std::numeric_limits<std::uint64_t>::max())},
        {"signed", Value(std::numeric_limits<std::int64_t>::min())},
        {"positiveSigned", Value(std::int64_t{7})},
        {"real", Value(-0.125)},
        {"flags", Value(Array{Value(true), Value(false), Value()})},
        {"text", Value("h\xC3\xA9llo")},
        {"packed", Value::packed(Value(inner))},
        {"nested", Value(Array{Value(inner), Value(Array{}), Value(Dictionary{})})},
    });
    Value back = decoded(cbor::encode(rich));
    EXPECT_EQ(back, rich);
    EXPECT_EQ(back.get("unsigned")->type(), ValueType::unsignedInteger);
    EXPECT_EQ(back.get("signed")->type(), ValueType::signedInteger);
    EXPECT_EQ(back.get("positiveSigned")->type(), ValueType::unsignedInteger);  // non-negative travels as major 0
    EXPECT_EQ(back.get("real")->type(), ValueType::real);
    ASSERT_EQ(back.get("packed")->type(), ValueType::packed);
    EXPECT_EQ(back.get("packed")->packedContent()->get("when")->asDate(), Date{978307200.25});
    EXPECT_EQ(cbor::encode(back), cbor::encode(rich));
}

TEST(CborEncode, DeepValuesEncodeWithoutRecursionAndDecodeRefusesThem) {
    Value deep;
    for (int i = 0; i < 2000; ++i) {
        deep = Value(Array{deep});
    }
    Bytes encoded = cbor::encode(deep);
    EXPECT_EQ(encoded.size(), 2001u);
    EXPECT_EQ(refusal(encoded), "nesting deeper than 512 levels");
}

}  // namespace
}  // namespace qm
