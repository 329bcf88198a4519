// The registry over a real catalog: the candidate search narrowed by
// extension point and election, auto-election, and the cache.

#include <gtest/gtest.h>

#include <sys/stat.h>

#include <filesystem>

#include "registry/QMDatabase.h"
#include "support/LogCapture.h"
#include "support/TempDir.h"
#include "support/TestRegistry.h"

namespace {

namespace fs = std::filesystem;
using qm::Array;
using qm::Dictionary;
using qm::Value;

class Registry : public ::testing::Test {
protected:
    // One application; each plug-in "p<N>" of extension point "point", with
    // the entitlements given.
    void addPlugIn(const std::string& name, const Dictionary& entitlements = {}) {
        std::string bundle = dir.file("root/Host.app/PlugIns/" + name + ".bundle");
        Dictionary info{{"MRBundleIdentifier", Value(name)},
                        {"MRBundleExecutable", Value("run")},
                        {"VTExtension", Value(Dictionary{{"VTExtensionAttributes", Value(Dictionary{{"VTExtensionPointName", Value("point")}})},
                                                         {"VTExtensionProtocol", Value("Protocol")}})}};
        qmtest::writePlist(bundle + "/Info.plist", Value(info));
        if (!entitlements.empty()) {
            qmtest::writePlist(bundle + "/Entitlements.plist", Value(entitlements));
            ::chmod((bundle + "/Entitlements.plist").c_str(), 0644);
        }
    }
    void open() {
        fs::create_directories(dir.file("root/Host.app"));
        registry = qmtest::openTestRegistry(dir, {dir.file("root")});
        ASSERT_TRUE(registry);
        registry->start();
        registry->workspace().waitUntilReady();
    }
    std::vector<std::string> candidates(const Dictionary& rules) {
        std::vector<std::string> names;
        for (const auto& plugIn : registry->findPlugIns(&rules)) {
            names.push_back(*plugIn->identifier());
        }
        return names;
    }
    void elect(const std::string& name, Value election) {
        auto plugIn = registry->findPlugInAtPath(dir.file("root/Host.app/PlugIns/" + name + ".bundle"));
        ASSERT_TRUE(plugIn) << name;
        registry->setAnnotationForPlugIn(Dictionary{{"election", election}}, *plugIn);
    }

    qmtest::TempDir dir;
    std::unique_ptr<QMDatabase> registry;
};

TEST_F(Registry, TheElectionFilterReadsStoredElectionsBeforeAnyRecordIsBuilt) {
    Dictionary autoElect{{"ovaro.developer.auto-elect-plugin", Value(1)}};
    addPlugIn("a");
    addPlugIn("b", autoElect);
    addPlugIn("c");
    addPlugIn("d");
    addPlugIn("e", Dictionary{{"ovaro.developer.replace-plugin", Value("c")}});
    open();
    elect("c", Value(2));
    elect("d", Value(257));
    // The filter reads the store and the entitlements, not the records: a
    // fresh registry over the same files has built none of them.
    registry.reset();
    open();

    struct Case {
        Value election;
        std::vector<std::string> expected;
    };
    const Case cases[] = {
        {Value("1"), {"b", "d"}},  // auto-elect without a stored election; 257's low eight bits
        {Value("0"), {"a"}},
        {Value("=2"), {"c", "e"}},  // e reads the election stored under the identifier it replaces
        {Value(Array{Value("0"), Value("2")}), {"a", "c", "e"}},
        {Value(1), {"a", "b", "c", "d", "e"}},  // a number is no literal: no filter at all
    };
    for (const Case& c : cases) {
        Dictionary rules{{"VTExtensionPointName", Value("point")}, {"VTUserElection", c.election}};
        EXPECT_EQ(candidates(rules), c.expected) << c.election.description();
    }
}

TEST_F(Registry, RecordsAreBuiltOnceAndAutoElectedWithoutANotification) {
    addPlugIn("a", Dictionary{{"ovaro.developer.auto-elect-plugin", Value(true)}});
    addPlugIn("b");
    open();
    int notifications = 0;
    registry->setAnnotationsChanged([&] { ++notifications; });
    auto first = registry->findPlugInAtPath(dir.file("root/Host.app/PlugIns/a.bundle"));
    ASSERT_TRUE(first);
    EXPECT_EQ(registry->findPlugIn(*first->uuid()), first) << "the cache answers the second lookup";
    EXPECT_EQ(registry->annotationForPlugIn(*first), Value(Dictionary{{"election", Value(1)}}));
    EXPECT_EQ(notifications, 0);
    auto other = registry->findPlugInAtPath(dir.file("root/Host.app/PlugIns/b.bundle"));
    registry->setAnnotationForPlugIn(Dictionary{{"extension", Value(Dictionary{})}}, *other);
    EXPECT_EQ(notifications, 1);

    qmtest::LogCapture log;
    EXPECT_FALSE(registry->findPlugIn(qm::Uuid::random()));
    EXPECT_TRUE(log.contains("AppCatalog cannot find plug-in with UUID:")) << log.text();
}

// Pages are cut from one order, refused bundles included, and the total
// counts every entry of the listing, not the page.
TEST_F(Registry, ListingsArePagedInPathOrder) {
    for (const char* name : {"a", "b", "c", "d"}) {
        addPlugIn(name);
    }
    qmtest::writeFile(dir.file("root/Host.app/PlugIns/bb.bundle/Info.plist"), "not a property list");
    open();
    auto names = [&](const std::optional<std::string>& point, std::size_t offset, std::size_t limit) {
        auto listing = registry->listPlugIns(point, offset, limit);
        std::string text = std::to_string(listing.total) + ":";
        for (const auto& listed : listing.page) {
            text += " " + fs::path(listed.path).stem().string() + (listed.invalidReason ? "!" : "");
        }
        return text;
    };
    EXPECT_EQ(names(std::nullopt, 0, 1000), "5: a b bb! c d");
    EXPECT_EQ(names(std::nullopt, 1, 2), "5: b bb!");
    EXPECT_EQ(names("point", 2, 5), "4: c d");
    EXPECT_EQ(names("point", 4, 5), "4:");
    EXPECT_EQ(names("other", 0, 5), "0:");
}

}  // namespace
