// The plug-in descriptor: setup in both configuration styles, multiplexed
// bundles, the rebuilding setters, canonical values and validation.

#include <gtest/gtest.h>

#include <tuple>

#include "ModelTestSupport.h"
#include "model/QMError.h"
#include "model/QMPlugInCore.h"

namespace {

using modeltest::array;
using modeltest::at;
using modeltest::dict;
using modeltest::LogCapture;
using qm::Value;

const std::string kPath = "/apps/Example.app/PlugIns/Share.bundle";
const std::string kAppExtensionPath = "/apps/Example.app/PlugIns/Widget.xbun";

std::unique_ptr<QMPlugInCore> setUp(const Value& info, const std::string& identifier = "com.example.share",
                                    const std::string& path = kPath, const Value& record = Value()) {
    return QMPlugInCore::initWithName(identifier, path, info, record, std::nullopt);
}

Value newStyleInfo(const Value& top) {
    return dict({{"MRBundleIdentifier", "com.example.share"}, {"MRBundleVersion", "4.2"}, {"VTExtension", top}});
}

Value oldStyleInfo(const Value& old) {
    return dict({{"Quamber", old}});
}

void expectLevelsAgree(const QMPlugInCore& plugIn) {
    EXPECT_EQ(at(plugIn.bundleInfoDictionary(), {"VTExtension"}), plugIn.topDictionary());
    if (plugIn.isMultiplexed()) {
        EXPECT_EQ(at(plugIn.topDictionary(), {"Multiple", plugIn.identifier()->c_str()}), plugIn.plugInDictionary());
    } else {
        EXPECT_EQ(plugIn.topDictionary(), plugIn.plugInDictionary());
    }
}

void expectUnusable(const qm::MaybeError& error, const std::string& message) {
    ASSERT_TRUE(error.has_value()) << "expected: " << message;
    EXPECT_EQ(error->domain, "Quamber");
    EXPECT_EQ(error->code, 12);
    EXPECT_EQ(error->text(), message);
}

// Old-style names are translated; the old dictionary stays beside its
// translation, so the style then reads as new.
TEST(PlugInSetup, EachStyleGivesThePlugInDictionaryOfItsIdentifier) {
    Value oldAttributes = dict({{"ovaro.identifier", "I"}, {"ovaro.version", "V"}, {"ovaro.protocol", "N"}, {"x", 1}});
    Value nested = dict({{"ovaro.identifier", "inner"}, {"ovaro.version", "9"}});
    Value oldMultiple = dict({{"Multiple", dict({{"com.example.a", dict({{"Protocol", "PA"},
                                                                        {"Attributes", dict({{"ovaro.identifier", "A"}})}})},
                                                {"com.example.b", dict({{"SDK", "SB"}})}})}});
    Value entry = dict({{"VTExtensionProtocol", "P"}});
    struct Case {
        const char* what;
        Value info;
        Value plugIn;
        const char* identifier = "com.example.share";
        Value record = Value();
    };
    const Case cases[] = {
        {"new style", newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", dict({{"a", 1}})}})),
         dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", dict({{"a", 1}})}})},
        {"new style wins over old", dict({{"VTExtension", entry}, {"Quamber", dict({{"Protocol", "old"}})}}), entry},
        {"the record's info is not consulted", newStyleInfo(entry), entry, "com.example.share",
         dict({{"VTExtensionProtocol", "from-record"}})},
        {"old style", oldStyleInfo(dict({{"Protocol", "P"}, {"SDK", "S"}, {"Subsystems", array({"one"})}, {"Attributes", oldAttributes}})),
         dict({{"VTExtensionProtocol", "P"},
               {"VTExtensionPointIdentifier", "S"},
               {"Subsystems", array({"one"})},
               {"VTExtensionAttributes", dict({{"VTExtensionIdentifier", "I"}, {"VTExtensionPointVersion", "V"},
                                               {"VTExtensionPointName", "N"}, {"x", 1}})}})},
        {"old attributes nested deeper are left alone", oldStyleInfo(dict({{"Attributes", dict({{"Formats", nested}})}})),
         dict({{"VTExtensionAttributes", dict({{"Formats", nested}})}})},
        {"old multiple, first entry", oldStyleInfo(oldMultiple),
         dict({{"VTExtensionProtocol", "PA"}, {"VTExtensionAttributes", dict({{"VTExtensionIdentifier", "A"}})}}),
         "com.example.a"},
        {"old multiple, second entry", oldStyleInfo(oldMultiple), dict({{"VTExtensionPointIdentifier", "SB"}}),
         "com.example.b"},
        {"a multiplexed entry inherits nothing",
         newStyleInfo(dict({{"CleanTimeout", 9}, {"VTExtensionProtocol", "top"}, {"Multiple", dict({{"com.example.share", entry}})}})),
         entry},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        auto plugIn = setUp(c.info, c.identifier, kPath, c.record);
        ASSERT_TRUE(plugIn);
        EXPECT_EQ(plugIn->plugInDictionary(), c.plugIn);
        EXPECT_EQ(plugIn->isMultiplexed(), at(c.info, {"VTExtension"}).get("Multiple") || at(c.info, {"Quamber"}).get("Multiple"));
        EXPECT_EQ(plugIn->identifier(), c.identifier) << "the name given, whatever the attributes say";
        EXPECT_FALSE(plugIn->oldStyle());
        Value info = plugIn->bundleInfoDictionary();
        EXPECT_EQ(Value(info.asDictionary()->changing("VTExtension", std::nullopt)),
                  Value(c.info.asDictionary()->changing("VTExtension", std::nullopt)));
        if (c.info.get("VTExtension")) {
            EXPECT_EQ(at(info, {"VTExtension"}), at(c.info, {"VTExtension"}));
        }
        expectLevelsAgree(*plugIn);
    }
}

TEST(PlugInSetup, WhatCannotBeSetUpIsExplainedByTheLineItLogs) {
    auto malformed = [](const Value& info) {
        return "malformed plug-in dictionary in plug-in com.example.share at file://" + kPath + ": " + info.description();
    };
    struct Case {
        const char* what;
        Value info;
        std::optional<std::string> identifier = "com.example.share";
        std::optional<std::string> path = kPath;
    };
    const Case cases[] = {
        {"old style not a dictionary", oldStyleInfo("not a dictionary")},
        {"old attributes not a dictionary", oldStyleInfo(dict({{"Protocol", "P"}, {"Attributes", array({"a"})}}))},
        {"old multiple not a dictionary", oldStyleInfo(dict({{"Multiple", "com.example.share"}}))},
        {"old entry not a dictionary", oldStyleInfo(dict({{"Multiple", dict({{"com.example.share", 7}})}}))},
        {"old entry's attributes not a dictionary",
         oldStyleInfo(dict({{"Multiple", dict({{"com.example.share", dict({{"Attributes", 3}})}})}}))},
        {"neither style", dict({{"MRBundleIdentifier", "com.example.share"}})},
        {"new style not a dictionary", dict({{"VTExtension", array({"x"})}})},
        {"info not a dictionary", Value(7)},
        {"no entry for the identifier", newStyleInfo(dict({{"Multiple", dict({{"com.example.other", dict({})}})}}))},
        {"entry not a dictionary", newStyleInfo(dict({{"Multiple", dict({{"com.example.share", "x"}})}}))},
        {"multiple not a dictionary", newStyleInfo(dict({{"Multiple", array({})}}))},
        {"no identifier", newStyleInfo(dict({})), std::nullopt},
        {"no info", Value()},
        {"no URL: no line at all", newStyleInfo(dict({})), "com.example.share", std::nullopt},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        std::vector<std::string> lines;
        if (!c.identifier) {
            lines = {"missing identifier in plug-in at " + kPath};
        } else if (c.info.isNull()) {
            lines = {"missing Info dictionary in plug-in com.example.share at " + kPath};
        } else if (c.path) {
            lines = {malformed(c.info)};
        }
        LogCapture log;
        QMPlugInCore plugIn;
        auto error = plugIn.setupWithNameExplained(c.identifier, c.path, c.info, Value(), std::nullopt);
        ASSERT_TRUE(error);
        EXPECT_EQ(error->code, 12);
        EXPECT_EQ(log.lines(), lines);
        if (!lines.empty()) {
            EXPECT_EQ(error->text(), lines.front());
        }
        EXPECT_FALSE(plugIn.uuid().has_value()) << "a failed setup leaves the UUID unset";
        EXPECT_FALSE(QMPlugInCore::initWithName(c.identifier, c.path, c.info, Value(), std::nullopt));
    }
}

TEST(PlugInSetup, DictionariesAreInstalledOnlyWhenTheyHaveATopLevel) {
    auto plugIn = setUp(newStyleInfo(dict({{"k", 1}})));
    ASSERT_TRUE(plugIn);
    Value before = plugIn->bundleInfoDictionary();
    EXPECT_FALSE(plugIn->setDictionaries(Value(3)));
    EXPECT_EQ(plugIn->bundleInfoDictionary(), before);

    QMPlugInCore direct;
    direct.setIdentifier("com.example.share");
    EXPECT_FALSE(direct.setDictionaries(oldStyleInfo(dict({}))));
    EXPECT_TRUE(direct.oldStyle()) << "an old-style dictionary installed untranslated reads as old style";
}

TEST(PlugInIdentity, DescriptorsAreEqualExactlyWhenTheirUuidsAre) {
    Value info = newStyleInfo(dict({}));
    auto first = setUp(info);
    auto second = setUp(info);
    ASSERT_TRUE(first && second);
    EXPECT_FALSE(*first == *second) << "two setups without UUIDs are two registrations";

    qm::Uuid uuid = qm::Uuid::random();
    auto a = QMPlugInCore::initWithName("com.example.a", "/a.bundle", info, Value(), uuid);
    auto b = QMPlugInCore::initWithName("com.example.b", "/b.bundle", newStyleInfo(dict({{"x", 1}})), Value(), uuid);
    ASSERT_TRUE(a && b);
    EXPECT_EQ(a->uuid(), uuid);
    EXPECT_TRUE(*a == *b);
    EXPECT_EQ(a->hash(), b->hash());
}

// Each setter rebuilds the levels above it and shares what it leaves alone.
TEST(PlugInSetters, SettersRebuildTheLevelsAbove) {
    Value replacement = dict({{"VTExtensionProtocol", "Q"}});
    auto plain = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "P"}})));
    ASSERT_TRUE(plain);
    plain->setPlugInDictionary(replacement);
    EXPECT_EQ(plain->plugInDictionary(), replacement);
    EXPECT_EQ(at(plain->bundleInfoDictionary(), {"MRBundleVersion"}), Value("4.2"));
    expectLevelsAgree(*plain);

    Value sibling = dict({{"VTExtensionProtocol", "S"}});
    auto multiplexed = setUp(newStyleInfo(dict({{"CleanTimeout", 3},
                                                {"Multiple", dict({{"com.example.share", dict({})}, {"com.example.sibling", sibling}})}})));
    ASSERT_TRUE(multiplexed);
    multiplexed->setPlugInDictionary(replacement);
    EXPECT_EQ(multiplexed->plugInDictionary(), replacement);
    EXPECT_TRUE(at(multiplexed->topDictionary(), {"Multiple", "com.example.sibling"}).isSameObject(sibling))
        << "untouched entries are shared, not copied";
    EXPECT_EQ(at(multiplexed->topDictionary(), {"CleanTimeout"}), Value(3));
    expectLevelsAgree(*multiplexed);

    Value top = dict({{"HubProtocolVersion", 3}});
    plain->setTopDictionary(top);
    EXPECT_EQ(at(plain->bundleInfoDictionary(), {"VTExtension"}), top);
    EXPECT_EQ(at(plain->bundleInfoDictionary(), {"MRBundleIdentifier"}), Value("com.example.share"));
}

// Canonical values complete what the bundle declares, at every level; the
// diagnosis then reports the first problem in its fixed order.
TEST(PlugInCanonical, CanonicalValuesAndTheDiagnosis) {
    auto attributes = [](const char* version, const char* format = "standard") {
        return dict({{"ovaro.format", format}, {"VTExtensionPointVersion", version}});
    };
    Value standard42 = attributes("4.2");
    Value objectClassAndShared = dict({{"VTExtensionProtocol", "VTObject"}, {"PrincipalClass", "VTObject"},
                                       {"Shared", array({"."})}, {"VTExtensionAttributes", standard42}});
    const char* missingProtocol = "missing \"VTExtensionProtocol\" key in Info.plist or SDK";
    struct Case {
        const char* what;
        Value info;
        Value plugIn;                   // after canonical values, when given
        const char* diagnosis;          // nullptr: valid
        const std::string& path = kPath;
        bool canonicalize = true;
        const char* logged = nullptr;  // the one line canonicalize logs
    };
    const Case cases[] = {
        {"an application extension gets the object class and shares itself",
         newStyleInfo(dict({{"Shared", array({"Resources", "Help"})}})), objectClassAndShared, nullptr, kAppExtensionPath},
        {"an application extension keeps its protocol and class",
         newStyleInfo(dict({{"VTExtensionProtocol", "Mine"}, {"PrincipalClass", "VTObject"}})),
         Value(objectClassAndShared.asDictionary()->changing("VTExtensionProtocol", "Mine")), nullptr, kAppExtensionPath},
        {"other plug-ins get no such defaults", newStyleInfo(dict({{"Shared", "Resources"}})),
         dict({{"Shared", "Resources"}, {"VTExtensionAttributes", standard42}}), missingProtocol},
        {"attributes get the format and the bundle's version",
         newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", dict({{"a", 1}})}})),
         dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", Value(standard42.asDictionary()->changing("a", 1))}}), nullptr},
        {"without any version the version is 1", dict({{"VTExtension", dict({{"VTExtensionProtocol", "P"}})}}),
         dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", attributes("1")}}), nullptr},
        {"a declared version is kept",
         newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", dict({{"VTExtensionPointVersion", "7"}})}})),
         dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", attributes("7")}}), nullptr},
        {"embedded code makes the format hybrid", newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"EmbeddedCode", false}})),
         dict({{"VTExtensionProtocol", "P"}, {"EmbeddedCode", false}, {"VTExtensionAttributes", attributes("4.2", "hybrid")}}),
         "hybrid plug-ins are not supported on this platform"},
        {"a multiplexed entry is canonical at every level and alone",
         newStyleInfo(dict({{"Multiple", dict({{"com.example.share", dict({})}, {"com.example.other", dict({})}})}})),
         objectClassAndShared, nullptr, kAppExtensionPath},
        {"attributes of the wrong type are kept and rejected",
         newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", "text"}})),
         dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", "text"}}),
         "missing \"VTExtensionAttributes\" key in Info.plist or SDK", kPath, true,
         "\"VTExtensionAttributes\" of plug-in com.example.share is not a dictionary: text"},
        {"the protocol is missed before the attributes", newStyleInfo(dict({{"PassProxy", true}})), Value(),
         missingProtocol, kPath, false},
        {"never canonical: no attributes", newStyleInfo(dict({{"VTExtensionProtocol", "P"}})), Value(),
         "missing \"VTExtensionAttributes\" key in Info.plist or SDK", kPath, false},
        {"PassProxy before hybrid",
         newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"PassProxy", true}, {"EmbeddedCode", "x"}})), Value(),
         "the \"PassProxy\" key is not supported on this platform"},
        {"an application extension may only use the object class", newStyleInfo(dict({{"PrincipalClass", "Custom"}})),
         Value(), "Application Extensions may not use the \"PrincipalClass\" key", kAppExtensionPath},
        {"elsewhere the class is free", newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"PrincipalClass", "Custom"}})),
         Value(), nullptr},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        auto plugIn = setUp(c.info, "com.example.share", c.path);
        ASSERT_TRUE(plugIn);
        LogCapture log;
        if (c.canonicalize) {
            plugIn->canonicalize();
        }
        if (!c.plugIn.isNull()) {
            EXPECT_EQ(plugIn->plugInDictionary(), c.plugIn);
            EXPECT_EQ(plugIn->version(), at(c.plugIn, {"VTExtensionAttributes", "VTExtensionPointVersion"}));
        }
        Value declared = at(plugIn->plugInDictionary(), {"VTExtensionAttributes"});
        EXPECT_EQ(plugIn->attributes(), declared.isDictionary() ? declared : Value());
        if (c.diagnosis) {
            expectUnusable(plugIn->diagnose(), c.diagnosis);
        } else {
            EXPECT_EQ(plugIn->diagnose(), std::nullopt);
        }
        EXPECT_EQ(log.lines(), c.logged ? std::vector<std::string>{c.logged} : std::vector<std::string>{});
        expectLevelsAgree(*plugIn);
        if (plugIn->isMultiplexed()) {
            EXPECT_EQ(at(plugIn->topDictionary(), {"Multiple", "com.example.other"}), dict({}));
        }
    }
    expectUnusable(QMPlugInCore().diagnose(), "missing identifier (no VTExtensionIdentifier, nor even MRBundleIdentifier)");
}

TEST(PlugInComputed, PropertiesReadThePlugInDictionary) {
    // {top dictionary, data, dedicated, hybrid, SDK, embedded protocol}
    const std::tuple<Value, bool, bool, bool, Value, Value> cases[] = {
        {dict({{"VTExtensionProtocol", "#Data"}, {"VTExtensionPointIdentifier", "ovaro.sdk"}, {"Dedicated", true}}),
         true, true, false, Value("ovaro.sdk"), Value("#Data")},  // the embedded protocol falls back to the protocol
        {dict({{"VTExtensionProtocol", "P"}, {"EmbeddedProtocol", "E"}}), false, false, false, Value(), Value("E")},
        {dict({{"Dedicated", false}, {"EmbeddedCode", false}}), false, false, true, Value(), Value()},  // any value counts
    };
    for (const auto& [top, data, dedicated, hybrid, sdk, embeddedProtocol] : cases) {
        SCOPED_TRACE(top.description());
        auto plugIn = setUp(newStyleInfo(top));
        ASSERT_TRUE(plugIn);
        EXPECT_EQ(plugIn->isData(), data);
        EXPECT_EQ(plugIn->isDedicated(), dedicated);
        EXPECT_EQ(plugIn->isHybrid(), hybrid);
        EXPECT_EQ(plugIn->sdkSpec(), sdk);
        EXPECT_EQ(plugIn->embeddedProtocolSpec(), embeddedProtocol);
        EXPECT_FALSE(plugIn->isAppExtension());
        EXPECT_EQ(plugIn->embeddedCodePath(), std::nullopt);
        plugIn->setLastModified(-86400);
        EXPECT_EQ(plugIn->timestamp(), qm::Date{-86400}) << "the registration time";
    }
    EXPECT_TRUE(setUp(newStyleInfo(dict({})), "com.example.widget", kAppExtensionPath)->isAppExtension());
}

}  // namespace
