#include "platform/codesign/Entitlements.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <mutex>
#include <string>
#include <vector>

#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"
#include "support/LogCapture.h"
#include "support/TempDir.h"

namespace {

using qmtest::LogCapture;

constexpr uid_t kNobody = 65534;

const qm::Value kGranted(qm::Dictionary{{"ovaro.developer.replace-plugin", qm::Value(true)},
                                        {"ovaro.developer.quamber.allowedplugins",
                                         qm::Value(qm::Array{qm::Value("com.example.a")})}});

// A bundle whose info folder and Entitlements.plist have trustworthy modes.
class EntitlementsTest : public ::testing::Test {
protected:
    void makeBundle(bool desktopStyle) {
        bundlePath = dir.file(desktopStyle ? "Desk.app" : "Flat.app");
        infoFolder = desktopStyle ? bundlePath + "/Contents" : bundlePath;
        qmtest::writeFile(infoFolder + "/Info.plist", "");
        ASSERT_FALSE(qm::plist::writeFileAtomically(infoFolder + "/Info.plist",
                                                    qm::Value(qm::Dictionary{{"MRBundleIdentifier", qm::Value("x")}}),
                                                    qm::plist::Format::xml));
        entitlementsPath = infoFolder + "/Entitlements.plist";
        writeEntitlements(kGranted);
        ASSERT_EQ(::chmod(infoFolder.c_str(), 0755), 0);
        ASSERT_EQ(::chmod(entitlementsPath.c_str(), 0644), 0);
        auto directory = qm::BundleDirectory::atPath(bundlePath);
        ASSERT_TRUE(directory);
        bundle = *directory;
    }
    void SetUp() override { makeBundle(false); }

    void writeEntitlements(const qm::Value& value) {
        ASSERT_FALSE(qm::plist::writeFileAtomically(entitlementsPath, value, qm::plist::Format::xml));
        ASSERT_EQ(::chmod(entitlementsPath.c_str(), 0644), 0);
    }

    // Reads the entitlements and expects none, with exactly one log line naming the problem.
    void expectRefused(const std::string& expectedInLog) {
        LogCapture log;
        EXPECT_FALSE(qm::readEntitlements(*bundle));
        auto lines = log.lines();
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_NE(lines[0].find(expectedInLog), std::string::npos) << lines[0];
    }

    qmtest::TempDir dir;
    std::string bundlePath;
    std::string infoFolder;
    std::string entitlementsPath;
    std::optional<qm::BundleDirectory> bundle;
};

TEST_F(EntitlementsTest, TrustedFileIsHonoured) {
    LogCapture log;
    auto entitlements = qm::readEntitlements(*bundle);
    ASSERT_TRUE(entitlements);
    EXPECT_EQ(*entitlements, kGranted);
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(EntitlementsTest, DesktopStyleBundlesKeepThemInContents) {
    makeBundle(true);
    ASSERT_EQ(bundle->infoFolder(), bundlePath + "/Contents");
    auto entitlements = qm::readEntitlements(*bundle);
    ASSERT_TRUE(entitlements);
    EXPECT_EQ(*entitlements, kGranted);
}

TEST_F(EntitlementsTest, NoFileMeansNoEntitlementsSilently) {
    ASSERT_EQ(::unlink(entitlementsPath.c_str()), 0);
    LogCapture log;
    EXPECT_FALSE(qm::readEntitlements(*bundle));
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(EntitlementsTest, GroupWritableFolderIsNotHonoured) {
    ASSERT_EQ(::chmod(infoFolder.c_str(), 0775), 0);
    expectRefused("writable by group or others");
}

TEST_F(EntitlementsTest, WorldWritableFolderIsNotHonoured) {
    ASSERT_EQ(::chmod(infoFolder.c_str(), 0757), 0);
    expectRefused("writable by group or others");
}

TEST_F(EntitlementsTest, GroupOrWorldWritableFileIsNotHonoured) {
    ASSERT_EQ(::chmod(entitlementsPath.c_str(), 0664), 0);
    expectRefused("writable by group or others");
    ASSERT_EQ(::chmod(entitlementsPath.c_str(), 0646), 0);
    expectRefused("writable by group or others");
}

TEST_F(EntitlementsTest, SymbolicLinkIsNotFollowed) {
    std::string elsewhere = dir.file("trusted-elsewhere.plist");
    ASSERT_EQ(::rename(entitlementsPath.c_str(), elsewhere.c_str()), 0);
    ASSERT_EQ(::symlink(elsewhere.c_str(), entitlementsPath.c_str()), 0);
    expectRefused("symbolic link");
}

TEST_F(EntitlementsTest, AFolderInPlaceOfTheFileIsNotHonoured) {
    ASSERT_EQ(::unlink(entitlementsPath.c_str()), 0);
    ASSERT_EQ(::mkdir(entitlementsPath.c_str(), 0755), 0);
    expectRefused("not a regular file");
}

TEST_F(EntitlementsTest, FileOwnedByAnotherUserIsNotHonoured) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "changing a file's owner needs root";
    }
    ASSERT_EQ(::chown(entitlementsPath.c_str(), kNobody, kNobody), 0);
    expectRefused("owned by uid 65534");
}

TEST_F(EntitlementsTest, FolderOwnedByAnotherUserIsNotHonoured) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "changing a folder's owner needs root";
    }
    ASSERT_EQ(::chown(infoFolder.c_str(), kNobody, kNobody), 0);
    expectRefused("owned by uid 65534");
}

TEST_F(EntitlementsTest, ContentThatIsNotADictionaryIsRefusedWithALogLine) {
    writeEntitlements(qm::Value(qm::Array{qm::Value("ovaro.developer.replace-plugin")}));
    expectRefused("not a dictionary");
}

TEST_F(EntitlementsTest, BrokenFileIsRefusedWithALogLine) {
    qmtest::writeFile(entitlementsPath, "<plist version=\"1.0\"><dict><key>oops</key>");
    ASSERT_EQ(::chmod(entitlementsPath.c_str(), 0644), 0);
    expectRefused("entitlements unreadable");
}

}  // namespace
