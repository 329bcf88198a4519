// Plug-ins read straight from the example bundles, with the registration
// facts taken from the disk.

#include <gtest/gtest.h>

#include <sys/stat.h>

#include <tuple>

#include "ModelTestSupport.h"
#include "model/OfflinePlugIns.h"
#include "support/TempDir.h"

namespace {

using modeltest::at;
using modeltest::dict;
using modeltest::ScopedEnvironment;
using qm::Value;

const std::string kExamples = std::string(QM_SOURCE_DIR) + "/examples";
const std::string kNotes = kExamples + "/Applications/Notes.app";
const std::string kStudio = kExamples + "/Applications/Studio.app";
const std::string kNotesPlugIns = kNotes + "/PlugIns/";
const std::string kStudioPlugIns = kStudio + "/Contents/PlugIns/";

class OfflineExamples : public ::testing::Test {
protected:
    qmtest::TempDir dir;
    ScopedEnvironment testSdk{"QMTEST_SDK", std::nullopt};
    ScopedEnvironment sdkPath{"QM_SDK_PATH", dir.file("no-sdks")};
    ScopedEnvironment dataHome{"XDG_DATA_HOME", dir.file("data")};
    ScopedEnvironment systemRoots{"QM_SYSTEM_ROOTS", std::nullopt};
    OfflinePlugIns inspector{SdkRegistry({kExamples + "/SDKs"})};

    std::vector<OfflinePlugIn> inspect(const std::string& bundle, std::optional<std::string> identifier = std::nullopt) {
        auto result = inspector.inspectBundle(bundle, identifier);
        EXPECT_TRUE(result.ok()) << (result.ok() ? "" : result.error().text());
        return result.ok() ? std::move(*result) : std::vector<OfflinePlugIn>{};
    }

    OfflinePlugIn inspectOne(const std::string& bundle) {
        auto plugIns = inspect(bundle);
        EXPECT_EQ(plugIns.size(), 1u);
        return plugIns.empty() ? OfflinePlugIn{} : std::move(plugIns.front());
    }
};

TEST_F(OfflineExamples, ANewStylePlugInIsMergedWithItsSdkAndValid) {
    OfflinePlugIn share = inspectOne(kNotesPlugIns + "ShareToNotes.bundle");
    ASSERT_TRUE(share.plugIn);
    EXPECT_EQ(share.error, std::nullopt);
    const QMPlugInCore& p = *share.plugIn;
    EXPECT_EQ(p.identifier(), "ovaro.example.notes.share");
    EXPECT_EQ(p.protocolSpec(), Value("ShareServiceProtocol"));
    // The example SDKs are merged in; how they merge is the SDK tests' business.
    EXPECT_EQ(at(p.plugInDictionary(), {"CleanTimeout"}), Value(30)) << "the SDK's CleanTimeout wins";
    EXPECT_EQ(p.version(), Value("3.1"));
    EXPECT_EQ(p.hubProtocolVersion(), 2u);
    EXPECT_EQ(p.containingPath(), kNotes);
    EXPECT_EQ(p.localizedName(), "Share to Notes");
    EXPECT_EQ(p.localizedShortName(), "Share");
    EXPECT_EQ(p.localizedContainingName(), "Example Notes");
    EXPECT_FALSE(p.onSystemVolume());
    EXPECT_EQ(share.dataContainerPath, dir.file("data") + "/ovaro/Containers/ovaro.example.notes.share");

    struct stat status {};
    ASSERT_EQ(::stat((kNotesPlugIns + "ShareToNotes.bundle/Info.plist").c_str(), &status), 0);
    EXPECT_EQ(p.lastModified(), static_cast<std::int32_t>(status.st_mtim.tv_sec));
}

// How old-style names translate and what an extension gets by default are
// the descriptor's tests; here the examples read from the disk are valid.
TEST_F(OfflineExamples, OldStyleExtensionAndDataPlugInsAreValid) {
    OfflinePlugIn legacy = inspectOne(kNotesPlugIns + "LegacyImport.bundle");
    OfflinePlugIn widget = inspectOne(kNotesPlugIns + "NotesWidget.xbun");
    OfflinePlugIn spelling = inspectOne(kNotesPlugIns + "Spelling.bundle");
    for (const OfflinePlugIn* inspected : {&legacy, &widget, &spelling}) {
        ASSERT_TRUE(inspected->plugIn);
        EXPECT_EQ(inspected->error, std::nullopt) << inspected->error->text();
    }
    EXPECT_TRUE(spelling.plugIn->isData());
    EXPECT_EQ(spelling.dataContainerPath, std::nullopt) << "a data plug-in needs no container";
}

TEST_F(OfflineExamples, AMultiplexedBundleYieldsEachOfItsPlugInsOrTheOneAskedFor) {
    auto plugIns = inspect(kStudioPlugIns + "Filters.bundle");
    ASSERT_EQ(plugIns.size(), 2u);
    EXPECT_EQ(plugIns[0].identifier, "ovaro.example.studio.blur");
    EXPECT_EQ(plugIns[1].identifier, "ovaro.example.studio.sharpen");
    for (const OfflinePlugIn& filter : plugIns) {
        ASSERT_TRUE(filter.plugIn);
        EXPECT_EQ(filter.error, std::nullopt);
        EXPECT_EQ(filter.plugIn->containingPath(), kStudio) << "desktop-style layout";
        EXPECT_EQ(filter.dataContainerPath, dir.file("data") + "/ovaro/Containers/ovaro.example.studio.filters");
    }
    EXPECT_EQ(plugIns[1].plugIn->version(), Value("1.1"));
    EXPECT_EQ(plugIns[0].plugIn->version(), Value("2.2"));

    auto blur = inspect(kStudioPlugIns + "Filters.bundle", "ovaro.example.studio.blur");
    ASSERT_EQ(blur.size(), 1u);
    EXPECT_EQ(at(blur[0].plugIn->attributes(), {"Radius"}), Value(4));
}

// Each way a path is no readable plug-in bundle, or lacks the one asked for.
TEST_F(OfflineExamples, ABundleThatCannotBeReadIsAnError) {
    const std::string plain = dir.file("Plain.bundle");
    qmtest::writePlist(plain + "/Info.plist", qm::Dictionary{{"MRBundleIdentifier", "x.plain"}});
    const std::string filters = kStudioPlugIns + "Filters.bundle";
    const std::tuple<std::string, std::optional<std::string>, int, std::string> cases[] = {
        {kStudioPlugIns + "Broken.bundle", std::nullopt, 12, "unreadable Info dictionary in plug-in bundle at " + kStudioPlugIns + "Broken.bundle: "},
        {dir.file("Nowhere.bundle"), std::nullopt, 9, "no plug-in bundle at " + dir.file("Nowhere.bundle") + ": no such path"},
        {plain + "/Info.plist", std::nullopt, 9, "no plug-in bundle at " + plain + "/Info.plist: not a directory"},
        {dir.path(), std::nullopt, 9, "no plug-in bundle at " + dir.path() + ": no Info.plist"},
        {kNotes, std::nullopt, 9, kNotes + " is an application, not a plug-in bundle; its plug-ins: " + kNotesPlugIns + "LegacyImport.bundle, "},
        {plain, std::nullopt, 12, "declares no plug-in: its Info dictionary has neither \"VTExtension\" nor \"Quamber\""},
        {kNotesPlugIns + "Spelling.bundle", "ovaro.other", 12, "no plug-in ovaro.other in the bundle at "},
        {filters, "ovaro.example.studio.none", 12, "no plug-in ovaro.example.studio.none in the bundle at " + filters +
                                                       "; it has ovaro.example.studio.blur, ovaro.example.studio.sharpen"},
    };
    for (const auto& [bundle, identifier, code, text] : cases) {
        auto inspected = inspector.inspectBundle(bundle, identifier);
        ASSERT_FALSE(inspected.ok()) << bundle;
        EXPECT_EQ(inspected.error().code, code) << bundle;
        EXPECT_NE(inspected.error().text().find(text), std::string::npos) << inspected.error().text();
    }
}

TEST_F(OfflineExamples, MisconfiguredPlugInsSayWhy) {
    // Each diagnosis of the descriptor is its own test; one stands for them here.
    const std::pair<const char*, const char*> cases[] = {
        {"Hybrid.bundle", "hybrid plug-ins are not supported on this platform"},
        {"NoExecutable.bundle", "this plug-in has no sandbox data container"},
    };
    for (const auto& [bundle, message] : cases) {
        OfflinePlugIn inspected = inspectOne(kStudioPlugIns + bundle);
        ASSERT_TRUE(inspected.error) << bundle;
        EXPECT_EQ(inspected.error->domain, "Quamber") << bundle;
        EXPECT_EQ(inspected.error->code, 12) << bundle;
        EXPECT_EQ(inspected.error->text(), message) << bundle;
    }
}

TEST_F(OfflineExamples, TheSystemVolumeIsDecidedByTheRootsThroughLinks) {
    {
        ScopedEnvironment roots("QM_SYSTEM_ROOTS", "/nonexistent:" + kExamples + "/Applications");
        EXPECT_TRUE(OfflinePlugIns::isOnSystemVolume(kNotesPlugIns + "Spelling.bundle"));
        EXPECT_TRUE(inspectOne(kNotesPlugIns + "Spelling.bundle").plugIn->onSystemVolume());
    }
    {
        // Through a symbolic link the bundle still lies under the root.
        std::string link = dir.file("linked-apps");
        ASSERT_EQ(::symlink((kExamples + "/Applications").c_str(), link.c_str()), 0);
        ScopedEnvironment roots("QM_SYSTEM_ROOTS", kExamples + "/Applications");
        EXPECT_TRUE(OfflinePlugIns::isOnSystemVolume(link + "/Notes.app/PlugIns/Spelling.bundle"));
    }
}

TEST(OfflineLayout, TheContainingApplicationComesFromThePlugInsFolder) {
    const std::pair<const char*, std::optional<std::string>> cases[] = {
        {"/a/Foo.app/PlugIns/X.bundle", "/a/Foo.app"}, {"/a/Foo.app/Contents/PlugIns/X.xbun", "/a/Foo.app"},
        {"/a/Foo/PlugIns/X.bundle", std::nullopt}, {"/a/Foo.app/Other/X.bundle", std::nullopt},
        {"/a/Foo.app/X.bundle", std::nullopt}, {"X.bundle", std::nullopt},
    };
    for (const auto& [path, application] : cases) {
        EXPECT_EQ(OfflinePlugIns::containingApplicationPath(path), application) << path;
    }
}

TEST(OfflineLayout, TheHubProtocolVersionFollowsTheDaemonsRule) {
    const std::tuple<Value, const char*, unsigned> cases[] = {
        {dict({{"Quamber", dict({})}, {"VTExtension", dict({{"HubProtocolVersion", 3}})}}), "/p.bundle", 3},  // declared
        {dict({{"Quamber", dict({})}}), "/p.xbun", 1},  // old style
        {dict({{"VTExtension", dict({})}}), "/p.xbun", 2},
        {dict({{"VTExtension", dict({{"HubProtocolVersion", Value(std::uint64_t{1} << 40)}})}}), "/p.bundle", 2},
    };
    for (const auto& [info, path, version] : cases) {
        auto plugIn = QMPlugInCore::initWithName("i", std::string(path), info, Value(), std::nullopt);
        ASSERT_TRUE(plugIn) << info.description();
        EXPECT_EQ(OfflinePlugIns::hubProtocolVersionOf(*plugIn), version) << info.description();
    }
}

}  // namespace
