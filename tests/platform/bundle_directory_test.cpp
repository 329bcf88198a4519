#include "platform/bundle/BundleDirectory.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"
#include "support/LogCapture.h"
#include "support/TempDir.h"

namespace {

using qmtest::LogCapture;

void writeInfo(const std::string& path, const qm::Dictionary& info) {
    qmtest::writeFile(path, "");
    ASSERT_FALSE(qm::plist::writeFileAtomically(path, qm::Value(info), qm::plist::Format::xml));
}

// Foo.app/Info.plist and Foo.app/Foo.
std::string makeFlatBundle(const qmtest::TempDir& dir, const std::string& name = "Foo.app") {
    std::string bundle = dir.file(name);
    writeInfo(bundle + "/Info.plist", {{"MRBundleExecutable", qm::Value("Foo")},
                                       {"MRBundleIdentifier", qm::Value("com.example.flat")}});
    qmtest::writeFile(bundle + "/Foo", "#!/bin/sh\n");
    return bundle;
}

// Foo.app/Contents/Info.plist and Foo.app/Contents/Exec/Foo.
std::string makeDesktopBundle(const qmtest::TempDir& dir, const std::string& name = "Desk.app") {
    std::string bundle = dir.file(name);
    writeInfo(bundle + "/Contents/Info.plist", {{"MRBundleExecutable", qm::Value("Foo")},
                                                {"MRBundleIdentifier", qm::Value("com.example.desk")}});
    qmtest::writeFile(bundle + "/Contents/Exec/Foo", "#!/bin/sh\n");
    return bundle;
}

TEST(BundleDirectory, FlatBundle) {
    qmtest::TempDir dir;
    std::string path = makeFlatBundle(dir);
    auto bundle = qm::BundleDirectory::atPath(path);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), path);
    EXPECT_EQ(bundle->infoFolder(), path);
    EXPECT_EQ(bundle->infoPlistPath(), path + "/Info.plist");
    EXPECT_FALSE(bundle->isDesktopStyle());
    EXPECT_EQ(bundle->executablePath(), path + "/Foo");
    auto info = bundle->infoDictionary();
    ASSERT_TRUE(info);
    EXPECT_EQ(*info->get("MRBundleIdentifier")->asString(), "com.example.flat");
    EXPECT_EQ(*info->get("MRBundleInfoPlistURL")->asString(), qm::fileURL(path + "/Info.plist"));
}

TEST(BundleDirectory, DesktopStyleBundle) {
    qmtest::TempDir dir;
    std::string path = makeDesktopBundle(dir);
    auto bundle = qm::BundleDirectory::atPath(path);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), path);
    EXPECT_EQ(bundle->infoFolder(), path + "/Contents");
    EXPECT_TRUE(bundle->isDesktopStyle());
    EXPECT_EQ(bundle->executablePath(), path + "/Contents/Exec/Foo");
    auto info = bundle->infoDictionary();
    ASSERT_TRUE(info);
    EXPECT_EQ(*info->get("MRBundleInfoPlistURL")->asString(), qm::fileURL(path + "/Contents/Info.plist"));
}

TEST(BundleDirectory, PathIsKeptAsGivenWithoutTrailingSlashes) {
    qmtest::TempDir dir;
    std::string path = makeFlatBundle(dir);
    auto bundle = qm::BundleDirectory::atPath(path + "//");
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), path);
}

TEST(BundleDirectory, RelativePathsAreTakenFromTheCurrentDirectory) {
    qmtest::TempDir dir;
    std::string path = makeFlatBundle(dir);
    char previous[4096];
    ASSERT_TRUE(::getcwd(previous, sizeof previous));
    ASSERT_EQ(::chdir(dir.path().c_str()), 0);
    auto bundle = qm::BundleDirectory::atPath("Foo.app");
    ASSERT_EQ(::chdir(previous), 0);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), path);
}

TEST(BundleDirectory, NoBundleWithoutAnInfoFile) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("Empty.app/readme"), "x");
    EXPECT_FALSE(qm::BundleDirectory::atPath(dir.file("Empty.app")));
    EXPECT_FALSE(qm::BundleDirectory::atPath(dir.file("Empty.app/readme")));  // a file
    EXPECT_FALSE(qm::BundleDirectory::atPath(dir.file("Missing.app")));
    EXPECT_FALSE(qm::BundleDirectory::atPath(""));
    // An Info.plist that is a folder does not make a bundle either.
    qmtest::writeFile(dir.file("Odd.app/Info.plist/x"), "x");
    EXPECT_FALSE(qm::BundleDirectory::atPath(dir.file("Odd.app")));
}

TEST(BundleDirectory, AroundAFlatExecutable) {
    qmtest::TempDir dir;
    std::string path = makeFlatBundle(dir);
    auto bundle = qm::BundleDirectory::aroundExecutable(path + "/Foo");
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), path);
    EXPECT_EQ(bundle->infoFolder(), path);
}

TEST(BundleDirectory, AroundADesktopExecutable) {
    qmtest::TempDir dir;
    std::string path = makeDesktopBundle(dir);
    auto bundle = qm::BundleDirectory::aroundExecutable(path + "/Contents/Exec/Foo");
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->path(), path);
    EXPECT_EQ(bundle->infoFolder(), path + "/Contents");
    EXPECT_EQ(bundle->executablePath(), path + "/Contents/Exec/Foo");
}

TEST(BundleDirectory, NothingAroundExecutablesOutsideBundles) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("bin/tool"), "x");
    EXPECT_FALSE(qm::BundleDirectory::aroundExecutable(dir.file("bin/tool")));
    // Contents/Exec without Contents/Info.plist.
    qmtest::writeFile(dir.file("Half.app/Contents/Exec/Foo"), "x");
    EXPECT_FALSE(qm::BundleDirectory::aroundExecutable(dir.file("Half.app/Contents/Exec/Foo")));
    // A missing executable, and a bundle directory given as if it were one.
    std::string flat = makeFlatBundle(dir);
    EXPECT_FALSE(qm::BundleDirectory::aroundExecutable(flat + "/Missing"));
    EXPECT_FALSE(qm::BundleDirectory::aroundExecutable(flat));
}

TEST(BundleDirectory, TheTestProgramRunsFromNoBundle) {
    EXPECT_FALSE(qm::BundleDirectory::ofRunningProcess());
}

TEST(BundleDirectory, ExecutableNamesThatAreNotPlainFileNamesAreIgnored) {
    qmtest::TempDir dir;
    const std::vector<qm::Value> names{qm::Value("../../etc/passwd"), qm::Value("a/b"), qm::Value(".."),
                                       qm::Value(""), qm::Value(3)};
    for (std::size_t i = 0; i < names.size(); ++i) {
        std::string bundle = dir.file("B" + std::to_string(i) + ".app");
        writeInfo(bundle + "/Info.plist", {{"MRBundleExecutable", names[i]}});
        auto directory = qm::BundleDirectory::atPath(bundle);
        ASSERT_TRUE(directory);
        EXPECT_FALSE(directory->executablePath()) << names[i].description();
    }
    std::string none = dir.file("None.app");
    writeInfo(none + "/Info.plist", {{"MRBundleIdentifier", qm::Value("x")}});
    EXPECT_FALSE(qm::BundleDirectory::atPath(none)->executablePath());
}

TEST(BundleDirectory, BrokenInfoFileGivesNothingAndOneLogLine) {
    qmtest::TempDir dir;
    std::string bundle = dir.file("Broken.app");
    qmtest::writeFile(bundle + "/Info.plist", "<plist version=\"1.0\"><dict><key>a</key>");
    auto directory = qm::BundleDirectory::atPath(bundle);
    ASSERT_TRUE(directory);
    LogCapture log;
    EXPECT_FALSE(directory->infoDictionary());
    EXPECT_FALSE(directory->infoDictionary());
    EXPECT_FALSE(directory->executablePath());
    EXPECT_EQ(log.countContaining(bundle), 1u);
}

TEST(BundleDirectory, InfoFileThatIsNotADictionaryGivesNothingAndOneLogLine) {
    qmtest::TempDir dir;
    std::string bundle = dir.file("List.app");
    qmtest::writeFile(bundle + "/Info.plist", "");
    ASSERT_FALSE(qm::plist::writeFileAtomically(bundle + "/Info.plist", qm::Value(qm::Array{qm::Value(1)}),
                                                qm::plist::Format::binary));
    auto directory = qm::BundleDirectory::atPath(bundle);
    ASSERT_TRUE(directory);
    LogCapture log;
    EXPECT_FALSE(directory->infoDictionary());
    EXPECT_EQ(log.countContaining("not a dictionary"), 1u);
}

TEST(BundleDirectory, InfoDictionaryIsReadOnceAndSharedByCopies) {
    qmtest::TempDir dir;
    std::string path = makeFlatBundle(dir);
    auto bundle = qm::BundleDirectory::atPath(path);
    ASSERT_TRUE(bundle);
    qm::BundleDirectory copy = *bundle;
    ASSERT_TRUE(bundle->infoDictionary());
    writeInfo(path + "/Info.plist", {{"MRBundleIdentifier", qm::Value("changed")}});
    EXPECT_EQ(*copy.infoDictionary()->get("MRBundleIdentifier")->asString(), "com.example.flat");
    // A new handle reads the file again.
    EXPECT_EQ(*qm::BundleDirectory::atPath(path)->infoDictionary()->get("MRBundleIdentifier")->asString(),
              "changed");
}

TEST(BundleDirectory, ConcurrentFirstReadsAgree) {
    qmtest::TempDir dir;
    auto bundle = qm::BundleDirectory::atPath(makeFlatBundle(dir));
    ASSERT_TRUE(bundle);
    std::vector<std::optional<qm::Value>> seen(8);
    std::vector<std::thread> threads;
    for (std::size_t i = 0; i < seen.size(); ++i) {
        threads.emplace_back([&, i] { seen[i] = bundle->infoDictionary(); });
    }
    for (auto& thread : threads) {
        thread.join();
    }
    for (const auto& info : seen) {
        ASSERT_TRUE(info);
        EXPECT_TRUE(info->isSameObject(*seen[0]));
    }
}

TEST(FileURL, PercentEncodesAllButUnreservedCharactersAndSlashes) {
    EXPECT_EQ(qm::fileURL("/A/Foo.app"), "file:///A/Foo.app");
    EXPECT_EQ(qm::fileURL("/a b/caf\xc3\xa9/100%/x#y?z"), "file:///a%20b/caf%C3%A9/100%25/x%23y%3Fz");
    EXPECT_EQ(qm::fileURL("/-._~"), "file:///-._~");
}

}  // namespace
