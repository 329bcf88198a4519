// Type conformance over shared-mime-info files: small databases in a temp
// dir, and the machine's own database under the user's.

#include "platform/types/UniformTypes.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>

#include "support/LogCapture.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

// Two mime directories, the first more important.
class UniformTypesTest : public ::testing::Test {
protected:
    UniformTypesTest() {
        qmtest::writeFile(dir_.file("home/mime/subclasses"),
                          "# comment\n"
                          "image/svg+xml application/xml\n"
                          "application/xml text/plain\n"
                          "application/x-loop-a application/x-loop-b\n"
                          "application/x-loop-b application/x-loop-a\n"
                          "  Application/X-Upper\tTEXT/X-Parent  \n"
                          "\n"
                          "three words here\n");
        qmtest::writeFile(dir_.file("home/mime/aliases"),
                          "text/xml application/xml\n"
                          "application/x-old application/x-older\n");
        qmtest::writeFile(dir_.file("data/mime/aliases"),
                          "text/xml application/overruled\n"
                          "application/x-older application/x-newest\n");
        qmtest::writeFile(dir_.file("data/mime/subclasses"), "image/svg+xml image/x-vector\n");
    }

    qm::UniformTypes load() {
        return qm::UniformTypes::fromMimeDirectories(
            {dir_.file("home/mime"), dir_.file("data/mime"), dir_.file("missing/mime")});
    }

    qmtest::TempDir dir_;
};

TEST_F(UniformTypesTest, TypesAreComparedAfterCaseAndAliasesAndConformUpwards) {
    qmtest::LogCapture log;
    auto types = load();
    // {type, to type, conforms}: through aliases, any steps up, parents from
    // every directory, text/* of an ancestor; never downwards, and a cycle
    // ends the search.
    const std::tuple<const char*, const char*, bool> cases[] = {
        {"image/svg+xml", "image/svg+xml", true}, {"IMAGE/SVG+XML", "image/Svg+Xml", true},
        {"image/svg+xml", "application/xml", true}, {"image/svg+xml", "text/xml", true},
        {"image/svg+xml", "text/plain", true}, {"image/svg+xml", "image/x-vector", true},
        {"application/xml", "image/svg+xml", false},
        {"text/x-anything", "text/plain", true}, {"text/x-anything", "text/html", false},
        {"application/x-upper", "text/x-parent", true}, {"application/x-upper", "text/plain", true},
        {"unknown/thing", "application/octet-stream", true}, {"unknown/thing", "text/plain", false},
        {"application/x-loop-a", "application/x-loop-b", true}, {"application/x-loop-a", "text/plain", false},
        {"application/x-old", "application/x-newest", true},
        {"", "application/octet-stream", false}, {"three", "words", false},
    };
    for (const auto& [type, toType, conforms] : cases) {
        EXPECT_EQ(types.conforms(type, toType), conforms) << type << " -> " << toType;
    }
    EXPECT_EQ(log.countContaining("1 malformed lines skipped"), 1u);

    EXPECT_EQ(types.canonicalType("Text/XML"), "application/xml");
    EXPECT_TRUE(types.isType("text/xml", "APPLICATION/XML"));
    EXPECT_TRUE(types.isType("application/x-old", "application/x-older"));
    EXPECT_FALSE(types.isType("image/svg+xml", "application/xml"));
    EXPECT_FALSE(types.isType("", ""));
}

// The only test that builds the process-wide relation, so it alone decides
// the environment it is read from. application/x-mine reaches text/xml only
// through the installed database: image/svg+xml is application/xml there,
// which text/xml is an alias of.
TEST(UniformTypes, TheSharedRelationReadsTheUserDatabaseAndTheSystemOnes) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("home/mime/subclasses"), "application/x-mine image/svg+xml\n");
    qmtest::ScopedEnvironment home("XDG_DATA_HOME", dir.file("home"));
    qmtest::ScopedEnvironment system("XDG_DATA_DIRS", dir.file("none") + "::/usr/share");
    const auto& types = qm::UniformTypes::shared();
    EXPECT_TRUE(types.conforms("application/x-mine", "text/xml"));
    EXPECT_FALSE(types.conforms("image/png", "application/xml"));
    EXPECT_EQ(&types, &qm::UniformTypes::shared());
}

}  // namespace
