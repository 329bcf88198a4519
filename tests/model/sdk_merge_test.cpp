// SDK resolution: where SDK dictionaries are found, and how their defaults
// merge under a bundle's Info dictionary.

#include <gtest/gtest.h>

#include <tuple>

#include "ModelTestSupport.h"
#include "model/QMPlugInCore.h"
#include "model/SdkRegistry.h"
#include "support/TempDir.h"

namespace {

using modeltest::array;
using modeltest::at;
using modeltest::dict;
using modeltest::LogCapture;
using modeltest::ScopedEnvironment;
using qm::Value;

using qmtest::writePlist;

Value sdkWithProtocol(const char* protocol) {
    return dict({{"VTExtension", dict({{"VTExtensionProtocol", protocol}})}});
}

// The bundle wins, except for CleanTimeout; dictionaries merge key by key and
// "Shared" is the union, the bundle's paths first. The rules hold at every depth.
TEST(SdkMerge, TheBundleWinsExceptWhereTheSdkMustSpeak) {
    // {what, SDK, bundle, merged, what the one line logged says (empty: no line)}
    const std::tuple<const char*, Value, Value, Value, std::string> cases[] = {
        {"CleanTimeout and dictionaries",
         dict({{"VTExtension", dict({{"CleanTimeout", 30}, {"VTExtensionProtocol", "P"},
                                     {"VTExtensionAttributes", dict({{"a", 2}, {"b", 3}})}})}}),
         dict({{"VTExtension", dict({{"CleanTimeout", 5}, {"VTExtensionAttributes", dict({{"a", 1}})}})}}),
         dict({{"VTExtension", dict({{"CleanTimeout", 30}, {"VTExtensionProtocol", "P"},
                                     {"VTExtensionAttributes", dict({{"a", 1}, {"b", 3}})}})}}),
         ""},
        {"only CleanTimeout, by its exact name", dict({{"cleantimeout", 2}}), dict({{"cleantimeout", 1}}),
         dict({{"cleantimeout", 1}}), ""},
        {"Shared is the union", dict({{"Shared", array({"y", "z"})}}), dict({{"Shared", array({"x", "y"})}}),
         dict({{"Shared", array({"x", "y", "z"})}}), ""},
        {"a Shared string is a set of one path", dict({{"Shared", array({"y", "x"})}}), dict({{"Shared", "x"}}),
         dict({{"Shared", array({"x", "y"})}}), ""},
        {"Shared of another type in the bundle", dict({{"Shared", array({"y"})}}), dict({{"Shared", 4}}),
         dict({{"Shared", 4}}), "keeping the bundle's \"Shared\""},
        {"Shared of another type in the SDK", dict({{"Shared", dict({})}}), dict({{"Shared", array({"x"})}}),
         dict({{"Shared", array({"x"})}}), "keeping the bundle's \"Shared\""},
        {"every depth",
         dict({{"Shared", array({"sdk-top"})},
               {"VTExtension", dict({{"Nested", dict({{"CleanTimeout", 2}, {"Shared", array({"b"})}, {"Keep", "sdk"},
                                                      {"Added", true}})}})}}),
         dict({{"Shared", array({"top"})},
               {"VTExtension", dict({{"Nested", dict({{"CleanTimeout", 1}, {"Shared", array({"a"})}, {"Keep", "bundle"}})}})}}),
         dict({{"Shared", array({"top", "sdk-top"})},
               {"VTExtension", dict({{"Nested", dict({{"CleanTimeout", 2}, {"Shared", array({"a", "b"})}, {"Keep", "bundle"},
                                                      {"Added", true}})}})}}),
         ""},
        {"scalars and other arrays", dict({{"Name", "sdk"}, {"List", array({"s"})}, {"Count", 2}}),
         dict({{"Name", "bundle"}, {"List", array({"b"})}, {"Count", 1}}),
         dict({{"Name", "bundle"}, {"List", array({"b"})}, {"Count", 1}}), ""},
        {"a dictionary over something else", dict({{"VTExtensionAttributes", dict({{"a", 1}})}}),
         dict({{"VTExtensionAttributes", "x"}}), dict({{"VTExtensionAttributes", "x"}}),
         "keeping the bundle's \"VTExtensionAttributes\" x"},
    };
    for (const auto& [what, sdk, bundle, merged, logged] : cases) {
        SCOPED_TRACE(what);
        LogCapture log;
        EXPECT_EQ(Value(QMPlugInCore::mergeDictionaryInto(*sdk.asDictionary(), *bundle.asDictionary())), merged);
        EXPECT_EQ(log.lines().size(), logged.empty() ? 0u : 1u);
        EXPECT_TRUE(log.contains(logged)) << log.text();
    }
    EXPECT_EQ(Value(QMPlugInCore::mergeSharedResourcesInto({"c", "a"}, {"b", "a", "b"})), array({"b", "a", "c"}));
}

class SdkLookup : public ::testing::Test {
protected:
    Value protocolOf(const SdkRegistry& registry, const char* name) {
        auto sdk = registry.readSDKDictionary(name);
        return sdk ? at(Value(*sdk), {"VTExtension", "VTExtensionProtocol"}) : Value();
    }

    qmtest::TempDir dir;
    std::string testSdks = dir.file("test-sdks");
    std::string first = dir.file("first");
    std::string second = dir.file("second");
    std::string extra = dir.file("extra");
    ScopedEnvironment testSdk{"QMTEST_SDK", std::nullopt};
    ScopedEnvironment sdkPath{"QM_SDK_PATH", first + ":" + second};
};

// A test file is named without ".plist"; one that is no dictionary falls
// through to the next place silently.
TEST_F(SdkLookup, TheTestDirectoryComesFirstThenExtraThenTheSdkPathInOrder) {
    writePlist(testSdks + "/ovaro.s", sdkWithProtocol("from-test"));
    writePlist(extra + "/ovaro.s.plist", sdkWithProtocol("from-extra"));
    writePlist(testSdks + "/ovaro.later.plist", sdkWithProtocol("with-extension"));
    writePlist(testSdks + "/ovaro.list", array({"not", "a", "dictionary"}));
    qmtest::writeFile(testSdks + "/ovaro.broken", "<plist><dict><key>x</key>");
    for (const char* name : {"ovaro.s", "ovaro.list", "ovaro.broken"}) {
        writePlist(first + "/" + name + ".plist", sdkWithProtocol("from-first"));
    }
    writePlist(second + "/ovaro.s.plist", sdkWithProtocol("from-second"));
    writePlist(second + "/ovaro.later.plist", sdkWithProtocol("from-second"));

    EXPECT_EQ(protocolOf(SdkRegistry(), "ovaro.s"), Value("from-first"));
    EXPECT_EQ(protocolOf(SdkRegistry(), "ovaro.later"), Value("from-second"));
    EXPECT_EQ(protocolOf(SdkRegistry({extra}), "ovaro.s"), Value("from-extra"));
    ScopedEnvironment withTest("QMTEST_SDK", testSdks);
    LogCapture log;
    EXPECT_EQ(protocolOf(SdkRegistry({extra}), "ovaro.s"), Value("from-test"));
    EXPECT_EQ(at(Value(*QMPlugInCore::readSDKDictionary("ovaro.s")), {"VTExtension", "VTExtensionProtocol"}),
              Value("from-test"));
    for (const char* name : {"ovaro.later", "ovaro.list", "ovaro.broken"}) {
        EXPECT_EQ(protocolOf(SdkRegistry(), name), Value(name == std::string("ovaro.later") ? "from-second" : "from-first")) << name;
    }
    EXPECT_TRUE(log.lines().empty()) << log.text();
}

TEST_F(SdkLookup, NamesThatWouldLeaveTheDirectoryAreNeverRegistered) {
    writePlist(dir.file("secret"), sdkWithProtocol("escaped"));
    writePlist(dir.file("secret.plist"), sdkWithProtocol("escaped"));
    writePlist(first + "/..plist", sdkWithProtocol("dot"));
    ScopedEnvironment withTest("QMTEST_SDK", testSdks);
    LogCapture log;
    for (const char* name : {"../secret", "sub/../../secret", ".", "..", "", "missing"}) {
        EXPECT_FALSE(SdkRegistry().readSDKDictionary(name)) << name;
        EXPECT_TRUE(log.contains(std::string("plug-in sdk \"") + name + "\" not registered")) << name;
    }
    EXPECT_FALSE(SdkRegistry().readSDKDictionary(std::string_view("ovaro\0x", 7)));
}

class SdkResolution : public SdkLookup {
protected:
    std::unique_ptr<QMPlugInCore> resolved(const Value& top, const std::string& path = "/apps/A.app/PlugIns/P.bundle",
                                           const std::string& identifier = "com.example.p") {
        Value info = dict({{"MRBundleIdentifier", "com.example.p"}, {"VTExtension", top}});
        auto plugIn = QMPlugInCore::initWithName(identifier, path, info, Value(), std::nullopt);
        EXPECT_TRUE(plugIn);
        if (plugIn) {
            plugIn->resolveSDK();
        }
        return plugIn;
    }
};

TEST_F(SdkResolution, SdkDefaultsShowAtEveryLevelAfterResolution) {
    writePlist(first + "/ovaro.s.plist",
               dict({{"OvaroPlatform", "linux"},
                     {"VTExtension", dict({{"CleanTimeout", 30}, {"VTExtensionProtocol", "P"}, {"Shared", array({"z"})},
                                           {"VTExtensionAttributes", dict({{"a", 2}, {"b", 3}})}})}}));
    LogCapture log;
    auto p = resolved(dict({{"VTExtensionPointIdentifier", "ovaro.s"}, {"CleanTimeout", 5}, {"Shared", array({"x"})},
                            {"VTExtensionAttributes", dict({{"a", 1}})}}));
    ASSERT_TRUE(p);
    EXPECT_TRUE(log.lines().empty());
    // How each key merges is the merge's test; here that the merge happened, then canonical values.
    EXPECT_EQ(at(p->plugInDictionary(), {"CleanTimeout"}), Value(30));
    EXPECT_EQ(p->attributes(), dict({{"a", 1}, {"b", 3}, {"ovaro.format", "standard"}, {"VTExtensionPointVersion", "1"}}));
    EXPECT_EQ(at(p->bundleInfoDictionary(), {"OvaroPlatform"}), Value("linux"));
    EXPECT_EQ(at(p->bundleInfoDictionary(), {"VTExtension"}), p->plugInDictionary());
    EXPECT_EQ(p->diagnose(), std::nullopt);

    writePlist(first + "/ovaro.w.plist", dict({{"VTExtension", dict({{"Shared", array({"Widgets"})}})}}));
    auto extension = resolved(dict({{"VTExtensionPointIdentifier", "ovaro.w"}, {"Shared", array({"Mine"})}}),
                              "/apps/A.app/PlugIns/W.xbun");
    ASSERT_TRUE(extension);
    EXPECT_EQ(at(extension->plugInDictionary(), {"Shared"}), array({"."})) << "an extension shares only itself";
}

TEST_F(SdkResolution, WithoutAUsableSdkTheBundleIsLeftToValidation) {
    LogCapture log;
    auto plain = resolved(dict({{"VTExtensionProtocol", "P"}}));
    ASSERT_TRUE(plain);
    EXPECT_TRUE(log.lines().empty()) << "no SDK named: no lookup, no line";
    EXPECT_EQ(at(plain->attributes(), {"ovaro.format"}), Value("standard"));

    auto missing = resolved(dict({{"VTExtensionPointIdentifier", "ovaro.missing"}}));
    ASSERT_TRUE(missing);
    EXPECT_TRUE(log.contains("plug-in sdk \"ovaro.missing\" not registered"));
    EXPECT_EQ(missing->version(), Value("1")) << "still canonicalized";
    ASSERT_TRUE(missing->diagnose());
    EXPECT_EQ(missing->diagnose()->text(), "missing \"VTExtensionProtocol\" key in Info.plist or SDK");
    auto extension = resolved(dict({{"VTExtensionPointIdentifier", "ovaro.missing"}}), "/apps/A.app/PlugIns/W.xbun");
    ASSERT_TRUE(extension);
    EXPECT_EQ(extension->diagnose(), std::nullopt);

    // A name that is not a string stops resolution: neither merged nor canonicalized.
    Value top = dict({{"VTExtensionPointIdentifier", 12}, {"VTExtensionProtocol", "P"}});
    auto numbered = resolved(top);
    ASSERT_TRUE(numbered);
    EXPECT_TRUE(log.contains("invalid SDK key:12"));
    EXPECT_EQ(numbered->plugInDictionary(), top);
    EXPECT_TRUE(numbered->version().isNull());
}

TEST_F(SdkResolution, TheSdkIsNamedBeforeMergingSoItCannotNameAnother) {
    writePlist(first + "/ovaro.a.plist",
               dict({{"VTExtension", dict({{"VTExtensionPointIdentifier", "ovaro.b"}, {"VTExtensionProtocol", "A"}})}}));
    writePlist(first + "/ovaro.b.plist", sdkWithProtocol("B"));
    auto p = resolved(dict({{"VTExtensionPointIdentifier", "ovaro.a"}}));
    ASSERT_TRUE(p);
    EXPECT_EQ(p->protocolSpec(), Value("A"));
    EXPECT_EQ(p->sdkSpec(), Value("ovaro.a"));
}

// The SDK's "VTExtension" is merged into the top dictionary: a multiplexed
// plug-in, whose dictionary is its "Multiple" entry alone, gets only what the
// SDK says under "Multiple" for that very entry.
TEST_F(SdkResolution, AMultiplexedPlugInGetsSdkDefaultsOnlyThroughItsEntry) {
    writePlist(first + "/ovaro.m.plist",
               dict({{"VTExtension", dict({{"VTExtensionProtocol", "TopDefault"}, {"CleanTimeout", 20},
                                           {"Multiple", dict({{"com.example.b", dict({{"VTExtensionProtocol", "B"}})}})}})}}));
    Value top = dict({{"Multiple", dict({{"com.example.a", dict({{"VTExtensionPointIdentifier", "ovaro.m"}})},
                                         {"com.example.b", dict({{"VTExtensionPointIdentifier", "ovaro.m"}})}})}});
    auto a = resolved(top, "/apps/A.app/PlugIns/M.bundle", "com.example.a");
    auto b = resolved(top, "/apps/A.app/PlugIns/M.bundle", "com.example.b");
    ASSERT_TRUE(a && b);
    EXPECT_TRUE(a->protocolSpec().isNull());
    EXPECT_EQ(at(a->topDictionary(), {"VTExtensionProtocol"}), Value("TopDefault"));
    EXPECT_EQ(at(a->topDictionary(), {"CleanTimeout"}), Value(20));
    EXPECT_EQ(a->plugInDictionary().get("CleanTimeout"), nullptr);
    EXPECT_EQ(b->protocolSpec(), Value("B"));
    EXPECT_EQ(at(b->bundleInfoDictionary(), {"VTExtension", "Multiple", "com.example.b"}), b->plugInDictionary());
}

}  // namespace
