#include "model/QMBundle.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/plist/PropertyList.h"
#include "support/TempDir.h"

namespace {

void writeInfo(const std::string& path, const qm::Dictionary& info) {
    qmtest::writeFile(path, "");
    ASSERT_FALSE(qm::plist::writeFileAtomically(path, qm::Value(info), qm::plist::Format::xml));
}

std::string makeDesktopApp(const qmtest::TempDir& dir) {
    std::string app = dir.file("A/Foo.app");
    writeInfo(app + "/Contents/Info.plist",
              {{"MRBundleExecutable", qm::Value("Foo")}, {"MRBundleIdentifier", qm::Value("com.example.foo")}});
    qmtest::writeFile(app + "/Contents/Exec/Foo", "x");
    return app;
}

std::string makeFlatApp(const qmtest::TempDir& dir) {
    std::string app = dir.file("A/Flat.app");
    writeInfo(app + "/Info.plist",
              {{"MRBundleExecutable", qm::Value("Flat")}, {"MRBundleIdentifier", qm::Value("com.example.flat")}});
    qmtest::writeFile(app + "/Flat", "x");
    return app;
}

TEST(QMBundle, DesktopStyleBundleKeepsItsPlugInsInContents) {
    qmtest::TempDir dir;
    std::string app = makeDesktopApp(dir);
    auto bundle = QMBundle::initWithPath(app);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), app);
    EXPECT_EQ(bundle->executablePath(), app + "/Contents/Exec/Foo");
    EXPECT_EQ(bundle->supportPath(), app + "/Contents");
    EXPECT_EQ(bundle->plugInsPath(), app + "/Contents/PlugIns");
    EXPECT_EQ(bundle->bundleDirectory("Resources"), app + "/Contents/Resources");
}

TEST(QMBundle, FlatBundleKeepsItsPlugInsAtItsTop) {
    qmtest::TempDir dir;
    std::string app = makeFlatApp(dir);
    auto bundle = QMBundle::initWithPath(app);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->executablePath(), app + "/Flat");
    EXPECT_EQ(bundle->supportPath(), app);
    EXPECT_EQ(bundle->plugInsPath(), app + "/PlugIns");
}

TEST(QMBundle, BundleWithoutAnExecutableAnswersItsPath) {
    qmtest::TempDir dir;
    std::string plugIn = dir.file("Data.xbun");
    writeInfo(plugIn + "/Info.plist", {{"MRBundleIdentifier", qm::Value("com.example.data")}});
    auto bundle = QMBundle::initWithPath(plugIn);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->executablePath(), plugIn);
    EXPECT_EQ(bundle->plugInsPath(), plugIn + "/PlugIns");
    // Desktop style without an executable: no "/Exec/" in the answer, so no Contents either.
    std::string desktop = dir.file("DeskData.xbun");
    writeInfo(desktop + "/Contents/Info.plist", {{"MRBundleIdentifier", qm::Value("com.example.deskdata")}});
    auto desktopBundle = QMBundle::initWithPath(desktop);
    ASSERT_TRUE(desktopBundle);
    EXPECT_EQ(desktopBundle->executablePath(), desktop);
    EXPECT_EQ(desktopBundle->supportPath(), desktop);
}

TEST(QMBundle, FromAnExecutable) {
    qmtest::TempDir dir;
    std::string app = makeDesktopApp(dir);
    auto bundle = QMBundle::initWithExecutablePath(app + "/Contents/Exec/Foo");
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), app);
    EXPECT_EQ(bundle->bundleIdentifier(), "com.example.foo");
    EXPECT_EQ(bundle->plugInsPath(), app + "/Contents/PlugIns");
}

TEST(QMBundle, FromABundleDirectoryGivenAsAnExecutable) {
    qmtest::TempDir dir;
    std::string app = makeFlatApp(dir);
    auto bundle = QMBundle::initWithExecutablePath(app);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), app);
    EXPECT_EQ(bundle->bundleIdentifier(), "com.example.flat");
}

TEST(QMBundle, NothingWhereThereIsNoBundle) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("bin/tool"), "x");
    EXPECT_FALSE(QMBundle::initWithExecutablePath(dir.file("bin/tool")));
    EXPECT_FALSE(QMBundle::initWithPath(dir.file("bin")));
    EXPECT_FALSE(QMBundle::initWithPath(dir.file("nowhere")));
    EXPECT_FALSE(QMBundle::initForMainBundle());  // the test program lies in no bundle
}

TEST(QMBundle, IdentifierOnlyWhenAString) {
    qmtest::TempDir dir;
    std::string numeric = dir.file("N.xbun");
    writeInfo(numeric + "/Info.plist", {{"MRBundleIdentifier", qm::Value(5)}});
    EXPECT_FALSE(QMBundle::initWithPath(numeric)->bundleIdentifier());
    std::string missing = dir.file("M.xbun");
    writeInfo(missing + "/Info.plist", {{"Other", qm::Value("x")}});
    EXPECT_FALSE(QMBundle::initWithPath(missing)->bundleIdentifier());
    std::string broken = dir.file("B.xbun");
    qmtest::writeFile(broken + "/Info.plist", "not a plist");
    auto brokenBundle = QMBundle::initWithPath(broken);
    ASSERT_TRUE(brokenBundle);
    EXPECT_FALSE(brokenBundle->infoDictionary());
    EXPECT_FALSE(brokenBundle->bundleIdentifier());
    EXPECT_EQ(brokenBundle->executablePath(), broken);
}

TEST(QMBundle, UrlIsTheFileUrlOfThePath) {
    qmtest::TempDir dir;
    std::string app = dir.file("With Space.app");
    writeInfo(app + "/Info.plist", {{"MRBundleIdentifier", qm::Value("x")}});
    auto bundle = QMBundle::initWithPath(app);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->url(), qm::fileURL(app));
    EXPECT_NE(bundle->url().find("With%20Space.app"), std::string::npos);
}

TEST(QMBundle, InfoDictionaryCarriesTheInfoFileUrl) {
    qmtest::TempDir dir;
    std::string app = makeDesktopApp(dir);
    auto info = QMBundle::initWithPath(app)->infoDictionary();
    ASSERT_TRUE(info);
    EXPECT_EQ(*info->get("MRBundleInfoPlistURL")->asString(), qm::fileURL(app + "/Contents/Info.plist"));
    EXPECT_EQ(*info->get("MRBundleIdentifier")->asString(), "com.example.foo");
}

}  // namespace
