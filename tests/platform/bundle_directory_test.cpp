#include "platform/bundle/BundleDirectory.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include "support/LogCapture.h"
#include "support/TempDir.h"

namespace {

using qm::BundleDirectory;

using qmtest::writePlist;

// Foo.app/Info.plist beside Foo.app/Foo, or Foo.app/Contents/Info.plist and
// Foo.app/Contents/Exec/Foo.
std::string makeBundle(const qmtest::TempDir& dir, bool desktop = false) {
    std::string bundle = dir.file("Foo.app");
    std::string infoFolder = desktop ? bundle + "/Contents" : bundle;
    writePlist(infoFolder + "/Info.plist",
               qm::Dictionary{{"MRBundleExecutable", "Foo"}, {"MRBundleIdentifier", "com.example.foo"}});
    qmtest::writeFile(infoFolder + (desktop ? "/Exec/Foo" : "/Foo"), "#!/bin/sh\n");
    return bundle;
}

// A bundle is the same whether found from its path (as given, without
// trailing slashes, relative to the current directory) or its executable.
TEST(BundleDirectory, BothLayoutsAreFoundFromTheirPathOrTheirExecutable) {
    for (bool desktop : {false, true}) {
        SCOPED_TRACE(desktop ? "desktop style" : "flat");
        qmtest::TempDir dir;
        std::string path = makeBundle(dir, desktop);
        std::string infoFolder = desktop ? path + "/Contents" : path;
        std::string executable = infoFolder + (desktop ? "/Exec/Foo" : "/Foo");
        char previous[4096];
        ASSERT_TRUE(::getcwd(previous, sizeof previous));
        ASSERT_EQ(::chdir(dir.path().c_str()), 0);
        auto relative = BundleDirectory::atPath("Foo.app");
        ASSERT_EQ(::chdir(previous), 0);
        for (const auto& bundle : {BundleDirectory::atPath(path), BundleDirectory::atPath(path + "//"), relative,
                                   BundleDirectory::aroundExecutable(executable)}) {
            ASSERT_TRUE(bundle);
            EXPECT_EQ(bundle->path(), path);
            EXPECT_EQ(bundle->infoFolder(), infoFolder);
            EXPECT_EQ(bundle->infoPlistPath(), infoFolder + "/Info.plist");
            EXPECT_EQ(bundle->isDesktopStyle(), desktop);
            EXPECT_EQ(bundle->executablePath(), executable);
            auto info = bundle->infoDictionary();
            ASSERT_TRUE(info);
            EXPECT_EQ(*info->get("MRBundleIdentifier"), qm::Value("com.example.foo"));
            EXPECT_EQ(*info->get("MRBundleInfoPlistURL"), qm::Value(qm::fileURL(infoFolder + "/Info.plist")));
        }
    }
}

TEST(BundleDirectory, NoBundleWithoutAnInfoFileBesideTheRightFolders) {
    qmtest::TempDir dir;
    std::string flat = makeBundle(dir);
    qmtest::writeFile(dir.file("Empty.app/readme"), "x");
    qmtest::writeFile(dir.file("Odd.app/Info.plist/x"), "x");  // an Info.plist that is a folder
    qmtest::writeFile(dir.file("bin/tool"), "x");
    qmtest::writeFile(dir.file("Half.app/Contents/Exec/Foo"), "x");  // no Contents/Info.plist
    for (const std::string& path : {dir.file("Empty.app"), dir.file("Empty.app/readme"), dir.file("Missing.app"),
                                    std::string(), dir.file("Odd.app")}) {
        EXPECT_FALSE(BundleDirectory::atPath(path)) << path;
    }
    for (const std::string& executable : {dir.file("bin/tool"), dir.file("Half.app/Contents/Exec/Foo"), flat + "/Missing", flat}) {
        EXPECT_FALSE(BundleDirectory::aroundExecutable(executable)) << executable;
    }
    EXPECT_FALSE(BundleDirectory::ofRunningProcess()) << "the test program lies in no bundle";
}

TEST(BundleDirectory, ExecutableNamesThatAreNotPlainFileNamesAreIgnored) {
    qmtest::TempDir dir;
    const qm::Value names[] = {"../../etc/passwd", "a/b", "..", "", 3, qm::Value()};
    for (std::size_t i = 0; i < std::size(names); ++i) {
        std::string bundle = dir.file("B" + std::to_string(i) + ".app");
        writePlist(bundle + "/Info.plist",
                   names[i].isNull() ? qm::Dictionary{} : qm::Dictionary{{"MRBundleExecutable", names[i]}});
        auto directory = BundleDirectory::atPath(bundle);
        ASSERT_TRUE(directory);
        EXPECT_FALSE(directory->executablePath()) << names[i].description();
    }
}

TEST(BundleDirectory, AnUnusableInfoFileGivesNothingAndOneLogLine) {
    for (const auto& [content, logged] :
         {std::pair{"<plist version=\"1.0\"><dict><key>a</key>", "Broken.app"},
          std::pair{"<plist version=\"1.0\"><array><integer>1</integer></array></plist>", "not a dictionary"}}) {
        qmtest::TempDir dir;
        std::string bundle = dir.file("Broken.app");
        qmtest::writeFile(bundle + "/Info.plist", content);
        auto directory = BundleDirectory::atPath(bundle);
        ASSERT_TRUE(directory);
        qmtest::LogCapture log;
        EXPECT_FALSE(directory->infoDictionary());
        EXPECT_FALSE(directory->infoDictionary());
        EXPECT_FALSE(directory->executablePath());
        EXPECT_EQ(log.lines().size(), 1u) << log.text();
        EXPECT_TRUE(log.contains(logged)) << log.text();
    }
}

TEST(BundleDirectory, TheInfoDictionaryIsReadOnceAndSharedByCopiesAndThreads) {
    qmtest::TempDir dir;
    std::string path = makeBundle(dir);
    auto bundle = BundleDirectory::atPath(path);
    ASSERT_TRUE(bundle);
    BundleDirectory copy = *bundle;
    std::vector<std::optional<qm::Value>> seen(8);
    {
        std::vector<std::jthread> threads;
        for (std::size_t i = 0; i < seen.size(); ++i) {
            threads.emplace_back([&, i] { seen[i] = (i % 2 ? copy : *bundle).infoDictionary(); });
        }
    }
    for (const auto& info : seen) {
        ASSERT_TRUE(info);
        EXPECT_TRUE(info->isSameObject(*seen[0]));
    }
    writePlist(path + "/Info.plist", qm::Dictionary{{"MRBundleIdentifier", "changed"}});
    EXPECT_EQ(*copy.infoDictionary()->get("MRBundleIdentifier"), qm::Value("com.example.foo"));
    EXPECT_EQ(*BundleDirectory::atPath(path)->infoDictionary()->get("MRBundleIdentifier"), qm::Value("changed"))
        << "a new handle reads the file again";
}

TEST(FileURL, PercentEncodesAllButUnreservedCharactersAndSlashes) {
    EXPECT_EQ(qm::fileURL("/A/Foo.app"), "file:///A/Foo.app");
    EXPECT_EQ(qm::fileURL("/a b/caf\xc3\xa9/100%/x#y?z"), "file:///a%20b/caf%C3%A9/100%25/x%23y%3Fz");
    EXPECT_EQ(qm::fileURL("/-._~"), "file:///-._~");
}

}  // namespace
