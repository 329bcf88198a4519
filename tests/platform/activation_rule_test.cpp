// Activation rules: a plug-in's maximum counts per type against what a host offers.

#include "platform/types/ActivationRule.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <tuple>

#include "support/TempDir.h"

namespace {

using qm::Value;
using D = qm::Dictionary;

TEST(ActivationRule, MatchesWhenEveryOfferedTypeFitsSomeKey) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("mime/subclasses"), "image/png image/x-bitmap\n");
    auto types = qm::UniformTypes::fromMimeDirectories({dir.file("mime")});
    const std::uint64_t huge = std::numeric_limits<std::uint64_t>::max();
    const D bitmaps{{"image/x-bitmap", 2}};

    // {what, rule, offer, matches}; how types compare (case, aliases) is UniformTypes' to show.
    const std::tuple<const char*, Value, Value, bool> cases[] = {
        {"parent key", bitmaps, D{{"image/png", 1}}, true},
        {"count at the maximum", bitmaps, D{{"image/png", 2}}, true},
        {"count over the maximum", bitmaps, D{{"image/png", 3}}, false},
        {"no key for the type", bitmaps, D{{"text/plain", 1}}, false},
        {"zero count needs no key", bitmaps, D{{"image/png", 1}, {"text/plain", 0}}, true},
        {"only zero counts", bitmaps, D{{"image/png", 0}}, false},
        {"negative count offers nothing", bitmaps, D{{"image/png", -1}}, false},
        {"empty offer", bitmaps, D{}, false},
        {"another key is large enough", D{{"image/x-bitmap", 1}, {"application/octet-stream", 5}}, D{{"image/png", 3}}, true},
        {"each type its own key", D{{"image/x-bitmap", 1}, {"text/plain", 1}}, D{{"image/png", 1}, {"text/x-log", 1}}, true},
        {"one type of two uncovered", bitmaps, D{{"image/png", 1}, {"text/x-log", 1}}, false},
        {"unsigned counts", D{{"image/png", huge}}, D{{"image/png", huge - 1}}, true},
        {"negative maximum", D{{"image/png", -1}}, D{{"image/png", 1}}, false},
        {"real count", bitmaps, D{{"image/png", 1.0}}, false},
        {"Boolean count", bitmaps, D{{"image/png", true}}, false},
        {"unusable count beside a good one", bitmaps, D{{"image/png", 1}, {"text/plain", "0"}}, false},
        {"string maximum", D{{"image/png", "2"}}, D{{"image/png", 1}}, false},
        {"rule not a dictionary", qm::Array{"image/png"}, D{{"image/png", 1}}, false},
        {"offer not a dictionary", bitmaps, "image/png", false},
    };
    for (const auto& [what, rule, offer, matches] : cases) {
        EXPECT_EQ(qm::activationRuleMatches(rule, offer, types), matches) << what;
    }
}

}  // namespace
