// The plug-in form: what export writes, and that a descriptor survives the
// trip through the wire (export, packed property list, CBOR, initWithForm).

#include <gtest/gtest.h>

#include "ModelTestSupport.h"
#include "model/QMPlugInCore.h"
#include "platform/duct/CborCodec.h"

namespace {

using modeltest::array;
using modeltest::at;
using modeltest::dict;
using qm::Value;

const std::string kPath = "/apps/Example.app/PlugIns/Share.bundle";

Value infoDictionary() {
    return dict({{"MRBundleIdentifier", "com.example.share"},
                 {"MRBundleVersion", "2.5"},
                 {"MRBundleInfoPlistURL", "file:///apps/Example.app/PlugIns/Share.bundle/Info.plist"},
                 {"VTExtension", dict({{"VTExtensionProtocol", "P"},
                                       {"Shared", array({"Resources"})},
                                       {"VTExtensionAttributes", dict({{"Category", "notes"}})}})}});
}

std::unique_ptr<QMPlugInCore> resolvedPlugIn(const Value& info = infoDictionary(), const std::string& identifier = "com.example.share") {
    auto plugIn = QMPlugInCore::initWithName(identifier, kPath, info, Value(), std::nullopt);
    if (plugIn) {
        plugIn->resolveSDK();
    }
    return plugIn;
}

// The wire carries forms inside a packed property list, encoded as CBOR.
Value throughTheWire(const qm::Dictionary& form) {
    auto decoded = qm::cbor::decode(qm::cbor::encode(Value::packed(Value(form))));
    EXPECT_TRUE(decoded.ok() && decoded->packedContent());
    return decoded.ok() && decoded->packedContent() ? *decoded->packedContent() : Value();
}

// Every fact of the descriptor is in its form, so an equal export after the
// trip means every fact came back.
TEST(PlugInForm, ExportWritesEveryKeyThatHasAValueAndTheDescriptorSurvivesTheWire) {
    auto plugIn = resolvedPlugIn();
    ASSERT_TRUE(plugIn);
    plugIn->setHubProtocolVersion(2);
    plugIn->setLastModified(-12345);
    plugIn->setOnSystemVolume(true);
    // No annotations export as an empty dictionary.
    qm::Dictionary expected{
        {"hubProtocolVersion", std::uint64_t{2}}, {"path", kPath}, {"systemResident", true}, {"identifier", "com.example.share"},
        {"version", "2.5"}, {"info", plugIn->plugInDictionary()}, {"uuid", plugIn->uuid()->text()}, {"lastmodified", -12345},
        {"annotations", dict({})},
        {"bundleInfo", Value(plugIn->bundleInfoDictionary().asDictionary()->changing("MRBundleInfoPlistURL", std::nullopt))},
    };
    EXPECT_EQ(Value(plugIn->exportForm()), Value(expected));
    EXPECT_EQ(at(Value(plugIn->exportForm()), {"hubProtocolVersion"}).type(), qm::ValueType::unsignedInteger);

    plugIn->setContainingUrl("/apps/Example.app");
    plugIn->setLocalizedName("Share to Example");
    plugIn->setLocalizedShortName("Share");
    plugIn->setLocalizedContainingName("Example");
    plugIn->setAnnotations(qm::Dictionary{{"election", 1}, {"extension", dict({{"k", "v"}})}});
    for (const auto& [key, value] : {std::pair{"containingPath", "/apps/Example.app"}, {"localizedDisplayName", "Share to Example"},
                                     {"localizedShortName", "Share"}, {"localizedContainingDisplayName", "Example"}}) {
        expected.set(key, value);
    }
    expected.set("annotations", dict({{"election", 1}, {"extension", dict({{"k", "v"}})}}));
    EXPECT_EQ(Value(plugIn->exportForm()), Value(expected));

    auto copy = QMPlugInCore::initWithForm(throughTheWire(plugIn->exportForm()));
    ASSERT_TRUE(copy);
    EXPECT_TRUE(*copy == *plugIn);
    EXPECT_EQ(Value(copy->exportForm()), Value(expected));
    EXPECT_EQ(copy->topDictionary(), plugIn->topDictionary());
    EXPECT_EQ(copy->attributes(), plugIn->attributes());
    EXPECT_EQ(copy->diagnose(), std::nullopt);
}

TEST(PlugInForm, AMultiplexedPlugInComesBackAsItsOwnEntry) {
    Value info = dict({{"VTExtension", dict({{"Multiple", dict({{"com.example.a", dict({{"VTExtensionProtocol", "A"}})},
                                                                {"com.example.b", dict({{"VTExtensionProtocol", "B"}})}})}})}});
    auto original = resolvedPlugIn(info, "com.example.b");
    ASSERT_TRUE(original);
    auto copy = QMPlugInCore::initWithForm(throughTheWire(original->exportForm()));
    ASSERT_TRUE(copy);
    EXPECT_EQ(copy->protocolSpec(), Value("B"));
    EXPECT_EQ(copy->plugInDictionary(), original->plugInDictionary());
    EXPECT_EQ(at(copy->attributes(), {"ovaro.format"}), Value("standard"));
}

TEST(PlugInForm, AbsentKeysReadAsTheirDefaultsAndTheInfoIsNotConsulted) {
    auto original = resolvedPlugIn();
    ASSERT_TRUE(original);
    original->setHubProtocolVersion(5);
    original->setLastModified(77);
    original->setOnSystemVolume(true);
    original->setAnnotations(qm::Dictionary{{"election", 1}});
    qm::Dictionary form = original->exportForm();
    for (const char* key : {"hubProtocolVersion", "uuid", "lastmodified", "systemResident", "annotations"}) {
        form.remove(key);
    }
    form.set("info", dict({{"VTExtensionProtocol", "X"}}));
    form.set("hash", qm::Bytes{1, 2, 3});
    form.set("requirement", "identifier com.example.share");
    auto copy = QMPlugInCore::initWithForm(Value(form));
    ASSERT_TRUE(copy);
    EXPECT_EQ(copy->hubProtocolVersion(), 1u);
    ASSERT_TRUE(copy->uuid());
    EXPECT_FALSE(*copy == *original) << "a form without a UUID gives a fresh one";
    EXPECT_EQ(copy->lastModified(), 0);
    EXPECT_FALSE(copy->onSystemVolume());
    EXPECT_EQ(copy->annotations(), std::nullopt);
    EXPECT_EQ(copy->protocolSpec(), Value("P"));
    EXPECT_EQ(copy->cdhash(), (qm::Bytes{1, 2, 3}));
    EXPECT_EQ(copy->requirement(), "identifier com.example.share");

    auto malformedUuid = QMPlugInCore::initWithForm(Value(original->exportForm().changing("uuid", "not-a-uuid")));
    ASSERT_TRUE(malformedUuid && malformedUuid->uuid());
    EXPECT_FALSE(*malformedUuid == *original);
}

TEST(PlugInForm, AFormWithoutItsEssentialsSetsNothingUp) {
    auto original = resolvedPlugIn();
    ASSERT_TRUE(original);
    qm::Dictionary form = original->exportForm();
    // What setup logs of each is the descriptor's test.
    for (const Value& broken : {Value(form.changing("path", std::nullopt)), Value(form.changing("path", 42)),
                                Value(form.changing("identifier", std::nullopt)), Value(form.changing("bundleInfo", std::nullopt)),
                                Value(form.changing("bundleInfo", array({}))), Value("not a form")}) {
        EXPECT_FALSE(QMPlugInCore::initWithForm(broken)) << broken.description();
    }
}

TEST(PlugInForm, ANeverCanonicalizedDescriptorExportsNoVersion) {
    Value info = dict({{"VTExtension", dict({{"VTExtensionPointIdentifier", array({})}, {"VTExtensionProtocol", "P"}})}});
    auto plugIn = resolvedPlugIn(info);
    ASSERT_TRUE(plugIn);
    Value form(plugIn->exportForm());
    EXPECT_EQ(form.get("version"), nullptr);
    EXPECT_TRUE(QMPlugInCore::initWithForm(form));
}

TEST(PlugInForm, AnnotationsAreTakenFromAFormOrChangedOneEntryAtATime) {
    auto plugIn = resolvedPlugIn();
    ASSERT_TRUE(plugIn);
    plugIn->setAnnotationValue("election", Value(1));
    EXPECT_EQ(plugIn->annotations(), std::nullopt) << "no annotation dictionary to change";
    plugIn->updateFromForm(dict({{"annotations", dict({{"election", 2}, {"extension", dict({})}})}}));
    EXPECT_EQ(plugIn->annotations(), (qm::Dictionary{{"election", 2}, {"extension", dict({})}}));
    plugIn->setAnnotationValue("election", Value(3));
    plugIn->setAnnotationValue("extension", std::nullopt);
    EXPECT_EQ(plugIn->annotations(), (qm::Dictionary{{"election", 3}}));
    plugIn->updateFromForm(dict({{"identifier", "ignored"}}));
    EXPECT_EQ(plugIn->annotations(), std::nullopt);
    EXPECT_EQ(plugIn->identifier(), "com.example.share");
}

}  // namespace
