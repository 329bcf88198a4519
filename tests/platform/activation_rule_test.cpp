// Activation rules: a plug-in's maximum counts per type against what a host offers.

#include "platform/types/ActivationRule.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <tuple>

#include "support/TempDir.h"

namespace {

using qm::Dictionary;
using qm::Value;

TEST(ActivationRule, MatchesWhenEveryOfferedTypeFitsSomeKey) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("mime/subclasses"), "image/png image/x-bitmap\n");
    auto types = qm::UniformTypes::fromMimeDirectories({dir.file("mime")});
    const std::uint64_t huge = std::numeric_limits<std::uint64_t>::max();
    const Value bitmaps(Dictionary{{"image/x-bitmap", Value(2)}});

    // {what, rule, offer, matches}
    const std::tuple<const char*, Value, Value, bool> cases[] = {
        {"parent key", bitmaps, Dictionary{{"image/png", Value(1)}}, true},
        {"count at the maximum", bitmaps, Dictionary{{"image/png", Value(2)}}, true},
        {"count over the maximum", bitmaps, Dictionary{{"image/png", Value(3)}}, false},
        {"lower-cased", bitmaps, Dictionary{{"IMAGE/PNG", Value(1)}}, true},
        {"no key for the type", bitmaps, Dictionary{{"text/plain", Value(1)}}, false},
        {"zero count needs no key", bitmaps, Dictionary{{"image/png", Value(1)}, {"text/plain", Value(0)}}, true},
        {"only zero counts", bitmaps, Dictionary{{"image/png", Value(0)}}, false},
        {"negative count offers nothing", bitmaps, Dictionary{{"image/png", Value(-1)}}, false},
        {"empty offer", bitmaps, Dictionary{}, false},
        {"another key is large enough",
         Dictionary{{"image/x-bitmap", Value(1)}, {"application/octet-stream", Value(5)}},
         Dictionary{{"image/png", Value(3)}}, true},
        {"each type its own key", Dictionary{{"image/x-bitmap", Value(1)}, {"text/plain", Value(1)}},
         Dictionary{{"image/png", Value(1)}, {"text/x-log", Value(1)}}, true},
        {"one type of two uncovered", bitmaps, Dictionary{{"image/png", Value(1)}, {"text/x-log", Value(1)}},
         false},
        {"unsigned counts", Dictionary{{"image/png", Value(huge)}}, Dictionary{{"image/png", Value(huge - 1)}},
         true},
        {"negative maximum", Dictionary{{"image/png", Value(-1)}}, Dictionary{{"image/png", Value(1)}}, false},
        {"real count", bitmaps, Dictionary{{"image/png", Value(1.0)}}, false},
        {"Boolean count", bitmaps, Dictionary{{"image/png", Value(true)}}, false},
        {"unusable count beside a good one", bitmaps,
         Dictionary{{"image/png", Value(1)}, {"text/plain", Value("0")}}, false},
        {"string maximum", Dictionary{{"image/png", Value("2")}}, Dictionary{{"image/png", Value(1)}}, false},
        {"rule not a dictionary", Value(qm::Array{Value("image/png")}), Dictionary{{"image/png", Value(1)}},
         false},
        {"offer not a dictionary", bitmaps, Value("image/png"), false},
    };
    for (const auto& [what, rule, offer, matches] : cases) {
        EXPECT_EQ(qm::activationRuleMatches(rule, offer, types), matches) << what;
    }
}

}  // namespace
