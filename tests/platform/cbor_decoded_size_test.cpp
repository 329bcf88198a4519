// Decoding cannot amplify: a payload whose tree would take more than sixteen
// times its size (64 KiB at least) is refused before the tree is built, and
// the size the decoder reports is what the tree really allocates.

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <new>

#include "platform/duct/CborCodec.h"

// Every allocation of the test program is counted here.
namespace {
std::atomic<std::size_t> gAllocatedBytes{0};

void* allocate(std::size_t size) {
    gAllocatedBytes.fetch_add(size, std::memory_order_relaxed);
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

constexpr std::size_t kFourMebibytes = 4 * 1024 * 1024;

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

// A 100-byte text item: a 2-byte head and 98 letters.
Bytes hundredByteText() {
    Bytes text{0x78, 98};
    text.resize(100, 'x');
    return text;
}

TEST(CborDecodedSize, APayloadIsRefusedWhenItsTreeWouldOutgrowItsBytes) {
    struct Case {
        const char* what;
        Bytes payload;
        bool accepted;
    };
    const std::size_t fill = kFourMebibytes - 5;
    const Case cases[] = {
        {"4 MiB: one array of empty arrays", arrayOf({0x80}, fill), false},
        {"4 MiB: one array of empty maps", arrayOf({0xa0}, fill), false},
        {"4 MiB: one array of empty strings", arrayOf({0x60}, fill), false},
        {"4 MiB: one array of small integers", arrayOf({0x01}, fill), false},
        {"4 MiB: a map holding one byte string",
         cbor::encode(Value(Dictionary{{"blob", Value(Bytes(kFourMebibytes - 12, 0x5a))}})), true},
        {"4 MiB: an array of 100-byte texts", arrayOf(hundredByteText(), kFourMebibytes / 100), true},
        {"2 KiB of empty arrays: within the 64 KiB floor", arrayOf({0x80}, 2048), true},
    };
    for (const auto& c : cases) {
        std::size_t before = gAllocatedBytes.load();
        auto decoded = cbor::decodeMeasured(c.payload);
        std::size_t allocated = gAllocatedBytes.load() - before;
        std::size_t bound = cbor::decodedSizeBound(c.payload.size());
        ASSERT_EQ(decoded.ok(), c.accepted) << c.what << ": " << (decoded.ok() ? "" : decoded.error().text());
        if (!decoded) {
            EXPECT_NE(decoded.error().text().find("decoded size"), std::string::npos) << c.what;
            EXPECT_LT(allocated, c.payload.size()) << c.what;  // refused before the tree was built
            continue;
        }
        // What the decoder reports is what the tree took, give or take its
        // own working memory.
        EXPECT_LE(decoded->allocatedBytes, allocated) << c.what;
        EXPECT_LE(allocated, decoded->allocatedBytes + 4096) << c.what;
        EXPECT_LE(decoded->allocatedBytes, bound) << c.what;
    }
}

TEST(CborDecodedSize, EmptyValuesShareOneObject) {
    auto decoded = cbor::decode(Bytes{0x88, 0x80, 0x80, 0xa0, 0xa0, 0x60, 0x60, 0x40, 0x40});
    ASSERT_TRUE(decoded);
    const Array& items = *decoded->asArray();
    for (std::size_t i = 0; i < items.size(); i += 2) {
        EXPECT_TRUE(items[i].isSameObject(items[i + 1])) << items[i].description();
    }
    EXPECT_TRUE(items[0].isSameObject(Value(Array())));
    EXPECT_TRUE(items[2].isSameObject(Value(Dictionary())));
    EXPECT_TRUE(items[4].isSameObject(Value("")));
    EXPECT_TRUE(items[6].isSameObject(Value(Bytes())));
    EXPECT_FALSE(Value(Array{Value(1)}).isSameObject(Value(Array{Value(1)})));
}

}  // namespace
}  // namespace qm
