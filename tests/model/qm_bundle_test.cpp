// The model's view of a bundle: where its support files and plug-ins lie.
// Finding bundles on disk is the bundle directory's test.

#include "model/QMBundle.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>

#include "support/TempDir.h"

namespace {

using qmtest::writePlist;

// Without an executable (a data bundle) there is no "/Exec/" to tell a
// desktop-style bundle by, so its support folder is the bundle itself.
TEST(QMBundle, SupportAndPlugInFoldersFollowTheLayout) {
    qmtest::TempDir dir;
    // {what, info folder relative to the bundle, executable, support folder}
    const std::tuple<const char*, std::string, bool, std::string> cases[] = {
        {"desktop style", "/Contents", true, "/Contents"},
        {"flat", "", true, ""},
        {"flat data bundle", "", false, ""},
        {"desktop-style data bundle", "/Contents", false, ""},
    };
    int n = 0;
    for (const auto& [what, infoFolder, hasExecutable, support] : cases) {
        SCOPED_TRACE(what);
        std::string path = dir.file("B" + std::to_string(n++) + ".app");
        std::string executable = path + infoFolder + (infoFolder.empty() ? "/Foo" : "/Exec/Foo");
        writePlist(path + infoFolder + "/Info.plist",
                  hasExecutable ? qm::Dictionary{{"MRBundleExecutable", "Foo"}, {"MRBundleIdentifier", "com.example.foo"}}
                               : qm::Dictionary{{"MRBundleIdentifier", "com.example.foo"}});
        if (hasExecutable) {
            qmtest::writeFile(executable, "x");
        }
        auto bundle = QMBundle::initWithPath(path);
        ASSERT_TRUE(bundle);
        EXPECT_EQ(bundle->path(), path);
        EXPECT_EQ(bundle->executablePath(), hasExecutable ? executable : path);
        EXPECT_EQ(bundle->supportPath(), path + support);
        EXPECT_EQ(bundle->plugInsPath(), path + support + "/PlugIns");
        EXPECT_EQ(bundle->bundleDirectory("Resources"), path + support + "/Resources");
        EXPECT_EQ(bundle->bundleIdentifier(), "com.example.foo");
        EXPECT_EQ(*bundle->infoDictionary()->get("MRBundleInfoPlistURL"), qm::Value(qm::fileURL(path + infoFolder + "/Info.plist")));
        // From its executable, or from the bundle folder given as if it were one.
        for (const std::string& from : {executable, path}) {
            auto found = QMBundle::initWithExecutablePath(from);
            ASSERT_EQ(found.has_value(), hasExecutable || from == path) << from;
            if (found) {
                EXPECT_EQ(found->path(), path);
            }
        }
    }
}

TEST(QMBundle, TheIdentifierIsAStringOrNothingAndTheUrlIsTheFileUrl) {
    qmtest::TempDir dir;
    writePlist(dir.file("N.xbun/Info.plist"), qm::Dictionary{{"MRBundleIdentifier", 5}});
    writePlist(dir.file("M.xbun/Info.plist"), qm::Dictionary{{"Other", "x"}});
    qmtest::writeFile(dir.file("B.xbun/Info.plist"), "not a plist");
    for (const char* name : {"N.xbun", "M.xbun", "B.xbun"}) {
        auto bundle = QMBundle::initWithPath(dir.file(name));
        ASSERT_TRUE(bundle) << name;
        EXPECT_FALSE(bundle->bundleIdentifier()) << name;
    }
    EXPECT_FALSE(QMBundle::initWithPath(dir.file("B.xbun"))->infoDictionary());
    EXPECT_FALSE(QMBundle::initWithPath(dir.file("nowhere")));
    EXPECT_FALSE(QMBundle::initForMainBundle()) << "the test program lies in no bundle";
    EXPECT_EQ(QMBundle::initWithPath(dir.file("N.xbun"))->url(), qm::fileURL(dir.file("N.xbun")));
}

}  // namespace
