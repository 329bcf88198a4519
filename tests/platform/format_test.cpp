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

TEST(Format, LogLinesBoundWhatAPeerMakesThemCarry) {
    std::string huge(3000, 'x');
    huge.replace(1023, 2, "é");  // a character across the cut stays whole
    std::string line = qm::boundedFormat("request %@ from %d", huge, 7);
    EXPECT_EQ(line, "request " + huge.substr(0, 1023) + "…[3000 bytes] from 7");
    EXPECT_EQ(qm::boundedFormat("%@", std::string("short")), "short");

    auto lines = qm::splitForLog(huge);
    ASSERT_EQ(lines.size(), 3u);
    std::string joined = lines[0];
    for (std::size_t i = 0; i < lines.size(); ++i) {
        EXPECT_LE(lines[i].size(), qm::kMaxLoggedArgument);
        if (i > 0) {
            ASSERT_EQ(lines[i].rfind("… ", 0), 0u) << "a continuation says so";
            joined += lines[i].substr(std::string("… ").size());
        }
    }
    EXPECT_EQ(joined, huge) << "nothing is lost between the pieces";
}

}  // namespace
