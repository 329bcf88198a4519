// The message and log formats: "%@" beside C conversions.

#include <gtest/gtest.h>

#include "platform/text/Format.h"

using qm::format;

namespace {

struct Described {
    std::string description() const { return "<described>"; }
};

TEST(Format, ObjectPlaceholdersTakeDescriptionsAndStringsAsThemselves) {
    EXPECT_EQ(format("at %@", qm::Value("/a b")), "at /a b");
    EXPECT_EQ(format("%@", qm::Value(qm::Array{1, 2})), "(1, 2)");
    EXPECT_EQ(format("%@ and %@", std::string("x"), Described{}), "x and <described>");
    EXPECT_EQ(format("%@", std::optional<std::string>()), "(null)");
}

TEST(Format, IntegerConversionsBehaveLikeC) {
    // Without a length modifier a conversion sees the low 32 bits.
    EXPECT_EQ(format("%d", std::uint64_t{0x100000003}), "3");
    EXPECT_EQ(format("%d", std::int64_t{-1}), "-1");
    EXPECT_EQ(format("%d", 0xffffffffu), "-1");
    EXPECT_EQ(format("%u", std::int64_t{-1}), "4294967295");
    EXPECT_EQ(format("0x%lx", std::uint64_t{0xabc}), "0xabc");
    EXPECT_EQ(format("%lu", std::uint64_t{1} << 40), "1099511627776");
    EXPECT_EQ(format("%05.1f|%3d|%-3d|", 2.25, 7, 7), "002.2|  7|7  |");
}

TEST(Format, NullCStringsAndMissingArgumentsPrintAsNull) {
    const char* none = nullptr;
    EXPECT_EQ(format("client %d request %s", 12, none), "client 12 request (null)");
    EXPECT_EQ(format("%s and %s", "one"), "one and (null)");
    EXPECT_EQ(format("100%% sure %"), "100% sure %");
}

}  // namespace
