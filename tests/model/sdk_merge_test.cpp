// SDK resolution: where SDK dictionaries are found, and how their defaults
// merge under a bundle's Info dictionary.

#include <gtest/gtest.h>

#include <algorithm>

#include "ModelTestSupport.h"
#include "model/QMPlugInCore.h"
#include "model/SdkRegistry.h"
#include "platform/plist/PropertyList.h"
#include "support/TempDir.h"

namespace {

using modeltest::array;
using modeltest::at;
using modeltest::dict;
using modeltest::LogCapture;
using modeltest::ScopedEnvironment;
using qm::Value;

qm::Dictionary merged(const Value& sdk, const Value& bundle) {
    return QMPlugInCore::mergeDictionaryInto(*sdk.asDictionary(), *bundle.asDictionary());
}

std::vector<std::string> sortedStrings(const Value& value) {
    std::vector<std::string> strings;
    for (const Value& element : *value.asArray()) {
        strings.push_back(*element.asString());
    }
    std::sort(strings.begin(), strings.end());
    return strings;
}

void writePlist(const std::string& path, const Value& value) {
    qmtest::writeFile(path, "");
    ASSERT_EQ(qm::plist::writeFileAtomically(path, value, qm::plist::Format::xml), std::nullopt);
}

Value sdkWithProtocol(const char* protocol) {
    return dict({{"VTExtension", dict({{"VTExtensionProtocol", protocol}})}});
}

// --- merging -----------------------------------------------------------------

TEST(SdkMerge, TheBundleWinsExceptCleanTimeoutAndDictionariesMergeKeyByKey) {
    Value bundle = dict({{"VTExtension", dict({{"CleanTimeout", 5}, {"VTExtensionAttributes", dict({{"a", 1}})}})}});
    Value sdk = dict({{"VTExtension", dict({{"CleanTimeout", 30},
                                           {"VTExtensionProtocol", "P"},
                                           {"VTExtensionAttributes", dict({{"a", 2}, {"b", 3}})}})}});
    EXPECT_EQ(Value(merged(sdk, bundle)),
              dict({{"VTExtension", dict({{"CleanTimeout", 30},
                                          {"VTExtensionProtocol", "P"},
                                          {"VTExtensionAttributes", dict({{"a", 1}, {"b", 3}})}})}}));
}

TEST(SdkMerge, SharedIsTheUnionOfBoth) {
    Value result(merged(dict({{"Shared", array({"y", "z"})}}), dict({{"Shared", array({"x", "y"})}})));
    EXPECT_EQ(sortedStrings(at(result, {"Shared"})), (std::vector<std::string>{"x", "y", "z"}));
}

TEST(SdkMerge, ASharedStringIsASetOfOnePath) {
    Value result(merged(dict({{"Shared", array({"y", "x"})}}), dict({{"Shared", "x"}})));
    EXPECT_EQ(sortedStrings(at(result, {"Shared"})), (std::vector<std::string>{"x", "y"}));
}

TEST(SdkMerge, SharedOfAnotherTypeKeepsTheBundlesValue) {
    LogCapture log;
    Value result(merged(dict({{"Shared", array({"y"})}}), dict({{"Shared", 4}})));
    EXPECT_EQ(at(result, {"Shared"}), Value(4));
    result = Value(merged(dict({{"Shared", dict({})}}), dict({{"Shared", array({"x"})}})));
    EXPECT_EQ(at(result, {"Shared"}), array({"x"}));
    EXPECT_TRUE(log.contains("keeping the bundle's \"Shared\""));
}

TEST(SdkMerge, TheRulesHoldAtEveryDepth) {
    Value bundle = dict({{"Shared", array({"top"})},
                         {"VTExtension", dict({{"Nested", dict({{"CleanTimeout", 1},
                                                                {"Shared", array({"a"})},
                                                                {"Keep", "bundle"}})}})}});
    Value sdk = dict({{"Shared", array({"sdk-top"})},
                      {"VTExtension", dict({{"Nested", dict({{"CleanTimeout", 2},
                                                             {"Shared", array({"b"})},
                                                             {"Keep", "sdk"},
                                                             {"Added", true}})}})}});
    Value result(merged(sdk, bundle));
    EXPECT_EQ(sortedStrings(at(result, {"Shared"})), (std::vector<std::string>{"sdk-top", "top"}));
    EXPECT_EQ(at(result, {"VTExtension", "Nested", "CleanTimeout"}), Value(2));
    EXPECT_EQ(sortedStrings(at(result, {"VTExtension", "Nested", "Shared"})), (std::vector<std::string>{"a", "b"}));
    EXPECT_EQ(at(result, {"VTExtension", "Nested", "Keep"}), Value("bundle"));
    EXPECT_EQ(at(result, {"VTExtension", "Nested", "Added"}), Value(true));
}

TEST(SdkMerge, ScalarsAndOtherArraysOfTheBundleAreNeverReplaced) {
    Value result(merged(dict({{"Name", "sdk"}, {"List", array({"s"})}, {"Count", 2}}),
                        dict({{"Name", "bundle"}, {"List", array({"b"})}, {"Count", 1}})));
    EXPECT_EQ(result, dict({{"Name", "bundle"}, {"List", array({"b"})}, {"Count", 1}}));
}

TEST(SdkMerge, ADictionaryOverSomethingElseKeepsTheBundlesValueAndLogs) {
    LogCapture log;
    Value result(merged(dict({{"VTExtensionAttributes", dict({{"a", 1}})}}), dict({{"VTExtensionAttributes", "x"}})));
    EXPECT_EQ(at(result, {"VTExtensionAttributes"}), Value("x"));
    EXPECT_TRUE(log.contains("keeping the bundle's \"VTExtensionAttributes\" x"));
}

TEST(SdkMerge, OnlyCleanTimeoutIsOverriddenByTheSdk) {
    EXPECT_TRUE(QMPlugInCore::sdkOverridesKey("CleanTimeout"));
    EXPECT_FALSE(QMPlugInCore::sdkOverridesKey("Shared"));
    EXPECT_FALSE(QMPlugInCore::sdkOverridesKey("cleantimeout"));
}

TEST(SdkMerge, SharedResourcesKeepTheBundlesOrderFirst) {
    qm::Array result = QMPlugInCore::mergeSharedResourcesInto({"c", "a"}, {"b", "a", "b"});
    EXPECT_EQ(Value(result), array({"b", "a", "c"}));
}

// --- lookup --------------------------------------------------------------------

class SdkLookup : public ::testing::Test {
protected:
    qmtest::TempDir dir;
    std::string testSdks = dir.file("test-sdks");
    std::string first = dir.file("first");
    std::string second = dir.file("second");
    std::string extra = dir.file("extra");
    ScopedEnvironment testSdk{"QMTEST_SDK", std::nullopt};
    ScopedEnvironment sdkPath{"QM_SDK_PATH", first + ":" + second};
};

TEST_F(SdkLookup, TheTestDirectoryComesFirstThenExtraThenTheSdkPathInOrder) {
    writePlist(testSdks + "/ovaro.s", sdkWithProtocol("from-test"));
    writePlist(extra + "/ovaro.s.plist", sdkWithProtocol("from-extra"));
    writePlist(first + "/ovaro.s.plist", sdkWithProtocol("from-first"));
    writePlist(second + "/ovaro.s.plist", sdkWithProtocol("from-second"));

    EXPECT_EQ(at(Value(*SdkRegistry().readSDKDictionary("ovaro.s")), {"VTExtension", "VTExtensionProtocol"}),
              Value("from-first"));
    EXPECT_EQ(at(Value(*SdkRegistry({extra}).readSDKDictionary("ovaro.s")), {"VTExtension", "VTExtensionProtocol"}),
              Value("from-extra"));
    ScopedEnvironment withTest("QMTEST_SDK", testSdks);
    EXPECT_EQ(at(Value(*SdkRegistry({extra}).readSDKDictionary("ovaro.s")), {"VTExtension", "VTExtensionProtocol"}),
              Value("from-test"));
    EXPECT_EQ(at(Value(*QMPlugInCore::readSDKDictionary("ovaro.s")), {"VTExtension", "VTExtensionProtocol"}),
              Value("from-test"));
}

TEST_F(SdkLookup, ALaterDirectoryAnswersWhenTheEarlierOneLacksTheSdk) {
    writePlist(second + "/ovaro.s.plist", sdkWithProtocol("from-second"));
    auto sdk = SdkRegistry().readSDKDictionary("ovaro.s");
    ASSERT_TRUE(sdk);
    EXPECT_EQ(at(Value(*sdk), {"VTExtension", "VTExtensionProtocol"}), Value("from-second"));
}

TEST_F(SdkLookup, ATestFileThatIsNotADictionaryFallsThroughSilently) {
    writePlist(testSdks + "/ovaro.s", array({"not", "a", "dictionary"}));
    qmtest::writeFile(testSdks + "/ovaro.broken", "<plist><dict><key>x</key>");
    writePlist(first + "/ovaro.s.plist", sdkWithProtocol("from-first"));
    writePlist(first + "/ovaro.broken.plist", sdkWithProtocol("from-first"));
    ScopedEnvironment withTest("QMTEST_SDK", testSdks);
    LogCapture log;
    EXPECT_TRUE(SdkRegistry().readSDKDictionary("ovaro.s"));
    EXPECT_TRUE(SdkRegistry().readSDKDictionary("ovaro.broken"));
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(SdkLookup, TheTestDirectoryUsesTheNameWithoutExtension) {
    writePlist(testSdks + "/ovaro.s.plist", sdkWithProtocol("with-extension"));
    ScopedEnvironment withTest("QMTEST_SDK", testSdks);
    LogCapture log;
    EXPECT_FALSE(SdkRegistry().readSDKDictionary("ovaro.s"));
    EXPECT_TRUE(log.contains("plug-in sdk \"ovaro.s\" not registered"));
}

TEST_F(SdkLookup, NamesThatWouldLeaveTheDirectoryAreNeverRegistered) {
    writePlist(dir.file("secret"), sdkWithProtocol("escaped"));
    writePlist(dir.file("secret.plist"), sdkWithProtocol("escaped"));
    writePlist(first + "/..plist", sdkWithProtocol("dot"));
    ScopedEnvironment withTest("QMTEST_SDK", testSdks);
    LogCapture log;
    for (const char* name : {"../secret", "sub/../../secret", ".", "..", ""}) {
        EXPECT_FALSE(SdkRegistry().readSDKDictionary(name)) << name;
        EXPECT_TRUE(log.contains(std::string("plug-in sdk \"") + name + "\" not registered")) << name;
    }
    EXPECT_FALSE(SdkRegistry().readSDKDictionary(std::string_view("ovaro\0x", 7)));
}

// --- resolution ------------------------------------------------------------------

class SdkResolution : public SdkLookup {
protected:
    std::unique_ptr<QMPlugInCore> plugIn(const Value& top, const std::string& path = "/apps/A.app/PlugIns/P.bundle",
                                         const std::string& identifier = "com.example.p") {
        Value info = dict({{"MRBundleIdentifier", "com.example.p"}, {"VTExtension", top}});
        return QMPlugInCore::initWithName(identifier, path, info, Value(), std::nullopt);
    }
};

TEST_F(SdkResolution, SdkDefaultsShowAtEveryLevelAfterResolution) {
    writePlist(first + "/ovaro.s.plist",
               dict({{"OvaroPlatform", "linux"},
                     {"VTExtension", dict({{"CleanTimeout", 30},
                                          {"VTExtensionProtocol", "P"},
                                          {"Shared", array({"z"})},
                                          {"VTExtensionAttributes", dict({{"a", 2}, {"b", 3}})}})}}));
    auto p = plugIn(dict({{"VTExtensionPointIdentifier", "ovaro.s"},
                          {"CleanTimeout", 5},
                          {"Shared", array({"x"})},
                          {"VTExtensionAttributes", dict({{"a", 1}})}}));
    ASSERT_TRUE(p);
    LogCapture log;
    p->resolveSDK();
    EXPECT_TRUE(log.lines().empty());
    EXPECT_EQ(p->protocolSpec(), Value("P"));
    EXPECT_EQ(at(p->plugInDictionary(), {"CleanTimeout"}), Value(30));
    EXPECT_EQ(sortedStrings(at(p->plugInDictionary(), {"Shared"})), (std::vector<std::string>{"x", "z"}));
    EXPECT_EQ(p->attributes(), dict({{"a", 1},
                                     {"b", 3},
                                     {"ovaro.format", "standard"},
                                     {"VTExtensionPointVersion", "1"}}));
    EXPECT_EQ(at(p->bundleInfoDictionary(), {"OvaroPlatform"}), Value("linux"));
    EXPECT_EQ(at(p->bundleInfoDictionary(), {"VTExtension"}), p->plugInDictionary());
    EXPECT_EQ(p->diagnose(), std::nullopt);
}

TEST_F(SdkResolution, AnApplicationExtensionSharesOnlyItselfWhateverTheSdkSays) {
    writePlist(first + "/ovaro.w.plist", dict({{"VTExtension", dict({{"Shared", array({"Widgets"})}})}}));
    auto p = plugIn(dict({{"VTExtensionPointIdentifier", "ovaro.w"}, {"Shared", array({"Mine"})}}),
                    "/apps/A.app/PlugIns/W.xbun");
    ASSERT_TRUE(p);
    p->resolveSDK();
    EXPECT_EQ(at(p->plugInDictionary(), {"Shared"}), array({"."}));
}

TEST_F(SdkResolution, TheTestSdkIsUsedAndTheSdkDirectoriesAreNotAsked) {
    writePlist(testSdks + "/ovaro.s", sdkWithProtocol("from-test"));
    qmtest::writeFile(first + "/ovaro.s.plist", "garbage that would fail loudly if read as the SDK");
    ScopedEnvironment withTest("QMTEST_SDK", testSdks);
    auto p = plugIn(dict({{"VTExtensionPointIdentifier", "ovaro.s"}}));
    ASSERT_TRUE(p);
    p->resolveSDK();
    EXPECT_EQ(p->protocolSpec(), Value("from-test"));
}

TEST_F(SdkResolution, AnUnregisteredSdkLeavesTheBundleToValidationAlone) {
    LogCapture log;
    auto p = plugIn(dict({{"VTExtensionPointIdentifier", "ovaro.missing"}}));
    ASSERT_TRUE(p);
    p->resolveSDK();
    EXPECT_TRUE(log.contains("plug-in sdk \"ovaro.missing\" not registered"));
    EXPECT_EQ(p->version(), Value("1")) << "still canonicalized";
    ASSERT_TRUE(p->diagnose());
    EXPECT_EQ(p->diagnose()->text(), "missing \"VTExtensionProtocol\" key in Info.plist or SDK");

    auto extension = plugIn(dict({{"VTExtensionPointIdentifier", "ovaro.missing"}}), "/apps/A.app/PlugIns/W.xbun");
    ASSERT_TRUE(extension);
    extension->resolveSDK();
    EXPECT_EQ(extension->diagnose(), std::nullopt);
}

TEST_F(SdkResolution, AnSdkNameThatIsNotAStringStopsResolution) {
    LogCapture log;
    auto p = plugIn(dict({{"VTExtensionPointIdentifier", 12}, {"VTExtensionProtocol", "P"}}));
    ASSERT_TRUE(p);
    Value before = p->bundleInfoDictionary();
    p->resolveSDK();
    EXPECT_TRUE(log.contains("invalid SDK key:12"));
    EXPECT_EQ(p->bundleInfoDictionary(), before) << "neither merged nor canonicalized";
    EXPECT_TRUE(p->version().isNull());
}

TEST_F(SdkResolution, WithoutAnSdkNameThereIsNoLookupAndNoMessage) {
    LogCapture log;
    auto p = plugIn(dict({{"VTExtensionProtocol", "P"}}));
    ASSERT_TRUE(p);
    p->resolveSDK();
    EXPECT_TRUE(log.lines().empty());
    EXPECT_EQ(at(p->attributes(), {"ovaro.format"}), Value("standard"));
}

TEST_F(SdkResolution, TheSdkIsNamedBeforeMergingSoItCannotNameAnother) {
    writePlist(first + "/ovaro.a.plist",
               dict({{"VTExtension", dict({{"VTExtensionPointIdentifier", "ovaro.b"}, {"VTExtensionProtocol", "A"}})}}));
    writePlist(first + "/ovaro.b.plist", sdkWithProtocol("B"));
    auto p = plugIn(dict({{"VTExtensionPointIdentifier", "ovaro.a"}}));
    ASSERT_TRUE(p);
    p->resolveSDK();
    EXPECT_EQ(p->protocolSpec(), Value("A"));
    EXPECT_EQ(p->sdkSpec(), Value("ovaro.a"));
}

// The SDK's "VTExtension" is merged into the top dictionary: a multiplexed
// plug-in, whose dictionary is its "Multiple" entry alone, gets only what the
// SDK says under "Multiple" for that very entry.
TEST_F(SdkResolution, AMultiplexedPlugInGetsSdkDefaultsOnlyThroughItsEntry) {
    writePlist(first + "/ovaro.m.plist",
               dict({{"VTExtension", dict({{"VTExtensionProtocol", "TopDefault"},
                                          {"CleanTimeout", 20},
                                          {"Multiple", dict({{"com.example.b", dict({{"VTExtensionProtocol", "B"}})}})}})}}));
    Value top = dict({{"Multiple", dict({{"com.example.a", dict({{"VTExtensionPointIdentifier", "ovaro.m"}})},
                                         {"com.example.b", dict({{"VTExtensionPointIdentifier", "ovaro.m"}})}})}});
    auto a = plugIn(top, "/apps/A.app/PlugIns/M.bundle", "com.example.a");
    auto b = plugIn(top, "/apps/A.app/PlugIns/M.bundle", "com.example.b");
    ASSERT_TRUE(a && b);
    a->resolveSDK();
    b->resolveSDK();
    EXPECT_TRUE(a->protocolSpec().isNull());
    EXPECT_EQ(at(a->topDictionary(), {"VTExtensionProtocol"}), Value("TopDefault"));
    EXPECT_EQ(at(a->topDictionary(), {"CleanTimeout"}), Value(20));
    EXPECT_EQ(a->plugInDictionary().get("CleanTimeout"), nullptr);
    EXPECT_EQ(b->protocolSpec(), Value("B"));
    EXPECT_EQ(at(b->bundleInfoDictionary(), {"VTExtension", "Multiple", "com.example.b"}), b->plugInDictionary());
}

}  // namespace
