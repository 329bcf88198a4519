// The plug-in descriptor: setup in both configuration styles, multiplexed
// bundles, the rebuilding setters, canonical values and validation.

#include <gtest/gtest.h>

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
                                    const std::string& path = kPath) {
    return QMPlugInCore::initWithName(identifier, path, info, Value(), std::nullopt);
}

Value newStyleInfo(const Value& top) {
    return dict({{"MRBundleIdentifier", "com.example.share"}, {"MRBundleVersion", "4.2"}, {"VTExtension", top}});
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

// --- setup and normalization ---------------------------------------------

TEST(PlugInSetup, NewStyleDerivesTheThreeLevelsFromTheInfoDictionary) {
    Value top = dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", dict({{"a", 1}})}});
    Value info = newStyleInfo(top);
    auto plugIn = setUp(info);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->bundleInfoDictionary(), info);
    EXPECT_EQ(plugIn->topDictionary(), top);
    EXPECT_EQ(plugIn->plugInDictionary(), top);
    EXPECT_EQ(plugIn->identifier(), "com.example.share");
    EXPECT_EQ(plugIn->path(), kPath);
    EXPECT_TRUE(plugIn->uuid().has_value());
    EXPECT_FALSE(plugIn->oldStyle());
    EXPECT_FALSE(plugIn->isMultiplexed());
}

TEST(PlugInSetup, TheInfoArgumentIsNotConsulted) {
    Value top = dict({{"VTExtensionProtocol", "from-bundle"}});
    auto plugIn = QMPlugInCore::initWithName("com.example.share", kPath, newStyleInfo(top),
                                             dict({{"VTExtensionProtocol", "from-record"}}), std::nullopt);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->protocolSpec(), Value("from-bundle"));
}

TEST(PlugInSetup, NewStyleWinsOverOldStyleInOneInfoDictionary) {
    Value info = dict({{"VTExtension", dict({{"VTExtensionProtocol", "new"}})},
                       {"Quamber", dict({{"Protocol", "old"}})}});
    auto plugIn = setUp(info);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->protocolSpec(), Value("new"));
    EXPECT_EQ(plugIn->bundleInfoDictionary(), info);
}

TEST(PlugInSetup, OldStyleIsTranslatedIntoNewStyleNames) {
    Value old = dict({{"Protocol", "P"},
                      {"SDK", "S"},
                      {"Subsystems", array({"one"})},
                      {"Attributes", dict({{"ovaro.identifier", "I"},
                                           {"ovaro.version", "V"},
                                           {"ovaro.protocol", "N"},
                                           {"x", 1}})}});
    auto plugIn = setUp(dict({{"Quamber", old}}));
    ASSERT_TRUE(plugIn);
    Value expected = dict({{"VTExtensionProtocol", "P"},
                           {"VTExtensionPointIdentifier", "S"},
                           {"Subsystems", array({"one"})},
                           {"VTExtensionAttributes", dict({{"VTExtensionIdentifier", "I"},
                                                           {"VTExtensionPointVersion", "V"},
                                                           {"VTExtensionPointName", "N"},
                                                           {"x", 1}})}});
    EXPECT_EQ(plugIn->plugInDictionary(), expected);
    // The old dictionary stays beside its translation, so the style reads as new.
    EXPECT_EQ(at(plugIn->bundleInfoDictionary(), {"Quamber"}), old);
    EXPECT_FALSE(plugIn->oldStyle());
    expectLevelsAgree(*plugIn);
}

TEST(PlugInSetup, AttributesNestedDeeperAreNotTranslated) {
    Value nested = dict({{"ovaro.identifier", "inner"}, {"ovaro.version", "9"}});
    auto plugIn = setUp(dict({{"Quamber", dict({{"Attributes", dict({{"Formats", nested}})}})}}));
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(at(plugIn->attributes(), {"Formats"}), nested);
}

TEST(PlugInSetup, OldStyleMultipleEntriesAreTranslatedEach) {
    Value old = dict({{"Multiple", dict({{"com.example.a", dict({{"Protocol", "PA"},
                                                                 {"Attributes", dict({{"ovaro.identifier", "A"}})}})},
                                         {"com.example.b", dict({{"SDK", "SB"}})}})}});
    auto a = setUp(dict({{"Quamber", old}}), "com.example.a");
    auto b = setUp(dict({{"Quamber", old}}), "com.example.b");
    ASSERT_TRUE(a);
    ASSERT_TRUE(b);
    EXPECT_EQ(a->plugInDictionary(), dict({{"VTExtensionProtocol", "PA"},
                                           {"VTExtensionAttributes", dict({{"VTExtensionIdentifier", "A"}})}}));
    EXPECT_EQ(b->plugInDictionary(), dict({{"VTExtensionPointIdentifier", "SB"}}));
    EXPECT_TRUE(a->isMultiplexed());
    expectLevelsAgree(*a);
}

TEST(PlugInSetup, OldStylePartsThatAreNotDictionariesMakeThePlugInMalformed) {
    const Value malformed[] = {
        dict({{"Quamber", "not a dictionary"}}),
        dict({{"Quamber", dict({{"Protocol", "P"}, {"Attributes", array({"a"})}})}}),
        dict({{"Quamber", dict({{"Multiple", "com.example.share"}})}}),
        dict({{"Quamber", dict({{"Multiple", dict({{"com.example.share", 7}})}})}}),
        dict({{"Quamber", dict({{"Multiple", dict({{"com.example.share", dict({{"Attributes", 3}})}})}})}}),
    };
    for (const Value& info : malformed) {
        LogCapture log;
        EXPECT_FALSE(setUp(info)) << info.description();
        EXPECT_TRUE(log.contains("malformed plug-in dictionary in plug-in com.example.share at "
                                 "file:///apps/Example.app/PlugIns/Share.bundle: " + info.description()))
            << info.description();
    }
}

TEST(PlugInSetup, AnInfoDictionaryOfNeitherStyleIsMalformed) {
    LogCapture log;
    EXPECT_FALSE(setUp(dict({{"MRBundleIdentifier", "com.example.share"}})));
    EXPECT_TRUE(log.contains("malformed plug-in dictionary in plug-in com.example.share"));
    EXPECT_FALSE(setUp(dict({{"VTExtension", array({"x"})}})));
    EXPECT_FALSE(setUp(Value("not a dictionary")));
}

TEST(PlugInSetup, MissingFactsFailWithTheirOwnLines) {
    LogCapture log;
    Value info = newStyleInfo(dict({}));
    EXPECT_FALSE(QMPlugInCore::initWithName(std::nullopt, kPath, info, Value(), std::nullopt));
    EXPECT_TRUE(log.contains("missing identifier in plug-in at " + kPath));
    EXPECT_FALSE(QMPlugInCore::initWithName("com.example.share", kPath, Value(), Value(), std::nullopt));
    EXPECT_TRUE(log.contains("missing Info dictionary in plug-in com.example.share at " + kPath));
    std::size_t before = log.lines().size();
    EXPECT_FALSE(QMPlugInCore::initWithName("com.example.share", std::nullopt, info, Value(), std::nullopt));
    EXPECT_EQ(log.lines().size(), before) << "a missing URL fails without a message";
}

TEST(PlugInSetup, TheExplainedSetupHandsBackTheLoggedLine) {
    LogCapture log;
    QMPlugInCore plugIn;
    auto error = plugIn.setupWithNameExplained("com.example.share", kPath, dict({}), Value(), std::nullopt);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code, 12);
    ASSERT_EQ(log.lines().size(), 1u);
    EXPECT_EQ(error->text(), log.lines().front());
    EXPECT_FALSE(plugIn.uuid().has_value()) << "a failed setup leaves the UUID unset";
}

TEST(PlugInSetup, AMultiplexedPlugInIsItsEntryAloneAndInheritsNothing) {
    Value entry = dict({{"VTExtensionProtocol", "P"}});
    Value top = dict({{"CleanTimeout", 9}, {"VTExtensionProtocol", "top"}, {"Multiple", dict({{"com.example.share", entry}})}});
    auto plugIn = setUp(newStyleInfo(top));
    ASSERT_TRUE(plugIn);
    EXPECT_TRUE(plugIn->isMultiplexed());
    EXPECT_EQ(plugIn->plugInDictionary(), entry);
    EXPECT_EQ(plugIn->protocolSpec(), Value("P"));
    EXPECT_EQ(plugIn->plugInDictionary().get("CleanTimeout"), nullptr);
}

TEST(PlugInSetup, AMultiplexedBundleWithoutTheEntryIsMalformed) {
    LogCapture log;
    Value top = dict({{"Multiple", dict({{"com.example.other", dict({})}})}});
    EXPECT_FALSE(setUp(newStyleInfo(top)));
    EXPECT_TRUE(log.contains("malformed plug-in dictionary in plug-in com.example.share"));
    EXPECT_FALSE(setUp(newStyleInfo(dict({{"Multiple", dict({{"com.example.share", "x"}})}}))));
    EXPECT_FALSE(setUp(newStyleInfo(dict({{"Multiple", array({})}}))));
}

TEST(PlugInSetup, SetDictionariesRefusesANonDictionaryAndChangesNothing) {
    auto plugIn = setUp(newStyleInfo(dict({{"k", 1}})));
    ASSERT_TRUE(plugIn);
    Value before = plugIn->bundleInfoDictionary();
    EXPECT_FALSE(plugIn->setDictionaries(Value(3)));
    EXPECT_EQ(plugIn->bundleInfoDictionary(), before);
}

// --- identity --------------------------------------------------------------

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

// --- rebuilding setters ----------------------------------------------------

TEST(PlugInSetters, SettingThePlugInDictionaryRebuildsTopAndInfo) {
    auto plugIn = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "P"}})));
    ASSERT_TRUE(plugIn);
    Value replacement = dict({{"VTExtensionProtocol", "Q"}});
    plugIn->setPlugInDictionary(replacement);
    EXPECT_EQ(plugIn->plugInDictionary(), replacement);
    EXPECT_EQ(plugIn->topDictionary(), replacement);
    EXPECT_EQ(at(plugIn->bundleInfoDictionary(), {"VTExtension"}), replacement);
    EXPECT_EQ(at(plugIn->bundleInfoDictionary(), {"MRBundleVersion"}), Value("4.2"));
}

TEST(PlugInSetters, SettingAMultiplexedPlugInDictionaryReplacesOnlyItsEntry) {
    Value sibling = dict({{"VTExtensionProtocol", "S"}});
    Value top = dict({{"CleanTimeout", 3},
                      {"Multiple", dict({{"com.example.share", dict({{"VTExtensionProtocol", "P"}})},
                                         {"com.example.sibling", sibling}})}});
    auto plugIn = setUp(newStyleInfo(top));
    ASSERT_TRUE(plugIn);
    Value replacement = dict({{"VTExtensionProtocol", "Q"}});
    plugIn->setPlugInDictionary(replacement);
    EXPECT_EQ(plugIn->plugInDictionary(), replacement);
    EXPECT_EQ(at(plugIn->topDictionary(), {"Multiple", "com.example.share"}), replacement);
    EXPECT_TRUE(at(plugIn->topDictionary(), {"Multiple", "com.example.sibling"}).isSameObject(sibling))
        << "untouched entries are shared, not copied";
    EXPECT_EQ(at(plugIn->topDictionary(), {"CleanTimeout"}), Value(3));
    expectLevelsAgree(*plugIn);
}

TEST(PlugInSetters, SettingTheTopDictionaryRebuildsTheInfoDictionary) {
    auto plugIn = setUp(newStyleInfo(dict({})));
    ASSERT_TRUE(plugIn);
    Value top = dict({{"HubProtocolVersion", 3}});
    plugIn->setTopDictionary(top);
    EXPECT_EQ(at(plugIn->bundleInfoDictionary(), {"VTExtension"}), top);
    EXPECT_EQ(at(plugIn->bundleInfoDictionary(), {"MRBundleIdentifier"}), Value("com.example.share"));
}

// --- canonical values ------------------------------------------------------

TEST(PlugInCanonical, AnApplicationExtensionGetsItsCanonicalValues) {
    Value top = dict({{"Shared", array({"Resources", "Help"})}});
    auto plugIn = setUp(newStyleInfo(top), "com.example.widget", kAppExtensionPath);
    ASSERT_TRUE(plugIn);
    EXPECT_TRUE(plugIn->isAppExtension());
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->protocolSpec(), Value("VTObject"));
    EXPECT_EQ(at(plugIn->plugInDictionary(), {"PrincipalClass"}), Value("VTObject"));
    EXPECT_EQ(at(plugIn->plugInDictionary(), {"Shared"}), array({"."}));
    EXPECT_EQ(plugIn->diagnose(), std::nullopt);
    // Forms carry only the Info dictionary: the values must show there too.
    EXPECT_EQ(at(plugIn->bundleInfoDictionary(), {"VTExtension", "Shared"}), array({"."}));
    expectLevelsAgree(*plugIn);
}

TEST(PlugInCanonical, AnApplicationExtensionKeepsTheProtocolAndClassItDeclares) {
    Value top = dict({{"VTExtensionProtocol", "Mine"}, {"PrincipalClass", "VTObject"}});
    auto plugIn = setUp(newStyleInfo(top), "com.example.widget", kAppExtensionPath);
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->protocolSpec(), Value("Mine"));
}

TEST(PlugInCanonical, OtherPlugInsGetNoApplicationExtensionDefaults) {
    auto plugIn = setUp(newStyleInfo(dict({{"Shared", "Resources"}})));
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    EXPECT_TRUE(plugIn->protocolSpec().isNull());
    EXPECT_EQ(plugIn->plugInDictionary().get("PrincipalClass"), nullptr);
    EXPECT_EQ(at(plugIn->plugInDictionary(), {"Shared"}), Value("Resources"));
}

TEST(PlugInCanonical, AttributesGetTheFormatAndTheBundleVersion) {
    auto plugIn = setUp(newStyleInfo(dict({{"VTExtensionAttributes", dict({{"a", 1}})}})));
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->attributes(),
              dict({{"a", 1}, {"ovaro.format", "standard"}, {"VTExtensionPointVersion", "4.2"}}));
    EXPECT_EQ(plugIn->version(), Value("4.2"));
    expectLevelsAgree(*plugIn);
}

TEST(PlugInCanonical, WithoutAnyVersionTheVersionIsOne) {
    auto plugIn = setUp(dict({{"VTExtension", dict({})}}));
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->attributes(), dict({{"ovaro.format", "standard"}, {"VTExtensionPointVersion", "1"}}));
}

TEST(PlugInCanonical, ADeclaredVersionIsKept) {
    auto plugIn = setUp(newStyleInfo(dict({{"VTExtensionAttributes", dict({{"VTExtensionPointVersion", "7"}})}})));
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->version(), Value("7"));
}

TEST(PlugInCanonical, EmbeddedCodeMakesTheFormatHybrid) {
    auto plugIn = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"EmbeddedCode", false}})));
    ASSERT_TRUE(plugIn);
    EXPECT_TRUE(plugIn->isHybrid()) << "any value of EmbeddedCode counts";
    plugIn->canonicalize();
    EXPECT_EQ(at(plugIn->attributes(), {"ovaro.format"}), Value("hybrid"));
    expectUnusable(plugIn->diagnose(), "hybrid plug-ins are not supported on this platform");
}

TEST(PlugInCanonical, AMultiplexedPlugInIsCanonicalAtEveryLevel) {
    Value top = dict({{"Multiple", dict({{"com.example.share", dict({{"VTExtensionProtocol", "P"}})},
                                         {"com.example.other", dict({})}})}});
    auto plugIn = setUp(newStyleInfo(top), "com.example.share", kAppExtensionPath);
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    EXPECT_EQ(at(plugIn->bundleInfoDictionary(),
                 {"VTExtension", "Multiple", "com.example.share", "VTExtensionAttributes", "ovaro.format"}),
              Value("standard"));
    EXPECT_EQ(at(plugIn->bundleInfoDictionary(), {"VTExtension", "Multiple", "com.example.share", "Shared"}),
              array({"."}));
    EXPECT_EQ(at(plugIn->topDictionary(), {"Multiple", "com.example.other"}), dict({}));
    expectLevelsAgree(*plugIn);
}

TEST(PlugInCanonical, AttributesOfTheWrongTypeAreKeptAndRejected) {
    LogCapture log;
    auto plugIn = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"VTExtensionAttributes", "text"}})));
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    EXPECT_EQ(at(plugIn->plugInDictionary(), {"VTExtensionAttributes"}), Value("text"));
    EXPECT_TRUE(plugIn->attributes().isNull());
    EXPECT_TRUE(log.contains("\"VTExtensionAttributes\" of plug-in com.example.share is not a dictionary: text"));
    expectUnusable(plugIn->diagnose(), "missing \"VTExtensionAttributes\" key in Info.plist or SDK");
}

// --- validation ------------------------------------------------------------

TEST(PlugInDiagnose, AnEmptyDescriptorLacksItsIdentifier) {
    QMPlugInCore empty;
    expectUnusable(empty.diagnose(), "missing identifier (no VTExtensionIdentifier, nor even MRBundleIdentifier)");
}

TEST(PlugInDiagnose, ChecksComeInTheirOrder) {
    // No protocol: reported before the missing attributes.
    auto plugIn = setUp(newStyleInfo(dict({{"PassProxy", true}})));
    ASSERT_TRUE(plugIn);
    expectUnusable(plugIn->diagnose(), "missing \"VTExtensionProtocol\" key in Info.plist or SDK");

    // Never canonicalized: the attributes are missing.
    plugIn = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"PassProxy", true}})));
    ASSERT_TRUE(plugIn);
    expectUnusable(plugIn->diagnose(), "missing \"VTExtensionAttributes\" key in Info.plist or SDK");

    // PassProxy before hybrid.
    plugIn->canonicalize();
    plugIn->setPlugInDictionary(Value(plugIn->plugInDictionary().asDictionary()->changing("EmbeddedCode", "x")));
    expectUnusable(plugIn->diagnose(), "the \"PassProxy\" key is not supported on this platform");
}

TEST(PlugInDiagnose, AnApplicationExtensionMayOnlyUseTheObjectClass) {
    auto plugIn = setUp(newStyleInfo(dict({{"PrincipalClass", "Custom"}})), "com.example.widget", kAppExtensionPath);
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    expectUnusable(plugIn->diagnose(), "Application Extensions may not use the \"PrincipalClass\" key");

    // Outside an application extension the class is free.
    auto other = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"PrincipalClass", "Custom"}})));
    ASSERT_TRUE(other);
    other->canonicalize();
    EXPECT_EQ(other->diagnose(), std::nullopt);
}

TEST(PlugInDiagnose, APlugInWithoutAttributesIsValidOnceCanonical) {
    auto plugIn = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "P"}})));
    ASSERT_TRUE(plugIn);
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->diagnose(), std::nullopt);
}

// --- computed properties ---------------------------------------------------

TEST(PlugInComputed, PropertiesReadThePlugInDictionary) {
    auto plugIn = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "#Data"},
                                           {"VTExtensionPointIdentifier", "ovaro.sdk"},
                                           {"Dedicated", true}})));
    ASSERT_TRUE(plugIn);
    EXPECT_TRUE(plugIn->isData());
    EXPECT_TRUE(plugIn->isDedicated());
    EXPECT_FALSE(plugIn->isHybrid());
    EXPECT_FALSE(plugIn->isAppExtension());
    EXPECT_EQ(plugIn->sdkSpec(), Value("ovaro.sdk"));
    EXPECT_EQ(plugIn->embeddedProtocolSpec(), Value("#Data")) << "falls back to the protocol";
    EXPECT_EQ(plugIn->embeddedCodePath(), std::nullopt);

    auto embedded = setUp(newStyleInfo(dict({{"VTExtensionProtocol", "P"}, {"EmbeddedProtocol", "E"}})));
    ASSERT_TRUE(embedded);
    EXPECT_EQ(embedded->embeddedProtocolSpec(), Value("E"));
    EXPECT_FALSE(embedded->isDedicated()) << "absent is false";
    EXPECT_FALSE(embedded->isData());

    auto notDedicated = setUp(newStyleInfo(dict({{"Dedicated", false}})));
    ASSERT_TRUE(notDedicated);
    EXPECT_FALSE(notDedicated->isDedicated());
}

TEST(PlugInComputed, TheTimestampIsTheRegistrationTime) {
    auto plugIn = setUp(newStyleInfo(dict({})));
    ASSERT_TRUE(plugIn);
    plugIn->setLastModified(-86400);
    EXPECT_EQ(plugIn->timestamp(), qm::Date{-86400});
}

TEST(PlugInComputed, AnOldStyleInfoDictionaryInstalledDirectlyReadsAsOldStyle) {
    QMPlugInCore plugIn;
    plugIn.setIdentifier("com.example.share");
    EXPECT_FALSE(plugIn.setDictionaries(dict({{"Quamber", dict({})}})));
    EXPECT_TRUE(plugIn.oldStyle());
}

}  // namespace
