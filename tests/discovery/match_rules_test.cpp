// The rule language over one plug-in's facts, and the host checks.

#include <gtest/gtest.h>

#include "discovery/HostChecks.h"
#include "discovery/MatchRules.h"
#include "support/LogCapture.h"
#include "support/TempDir.h"

namespace {

using qm::Array;
using qm::Dictionary;
using qm::Value;

// A small mime database: an alias, and a chain of two parents.
std::string writeMimeDatabase(const qmtest::TempDir& dir) {
    qmtest::writeFile(dir.file("mime/subclasses"), "image/svg+xml application/xml\napplication/xml text/plain\n");
    qmtest::writeFile(dir.file("mime/aliases"), "image/x-svg image/svg+xml\n");
    return dir.file("mime");
}

class MatchRulesTest : public ::testing::Test {
protected:
    PlugInFacts facts(std::optional<Value> election = std::nullopt) const {
        PlugInFacts f;
        f.identifier = "com.example.share";
        f.uuid = qm::Uuid::parse("0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9");
        f.attributes = Value(Dictionary{{"VTExtensionPointName", Value("ovaro.share")},
                                        {"Number", Value(2)},
                                        {"Types", Value(Array{Value("image/x-svg"), Value("text/plain")})},
                                        {"Flag", Value(false)},
                                        {"Version", Value("1.10")},
                                        {"Activation", Value(Dictionary{{"text/plain", Value(2)}})}});
        f.bundleInfoDictionary = Value(Dictionary{{"MRBundleVersion", Value("3.2")}, {"VTExtensionPointName", Value("ignored")}});
        f.entitlements = Value(Dictionary{{"ovaro.granted", Value("NO")}, {"ovaro.denied", Value(false)}});
        f.election = [election] { return election; };
        return f;
    }
    qmtest::TempDir dir;
    qm::UniformTypes types = qm::UniformTypes::fromMimeDirectories({writeMimeDatabase(dir)});
    MatchRules rules{types};
};

TEST_F(MatchRulesTest, EachKeyAndPatternFormSelectsAsTheLanguageSays) {
    struct Case {
        const char* key;
        Value pattern;
        bool matches;
    };
    const Case cases[] = {
        {"VTExtensionPointName", Value("ovaro.share"), true},  // attributes before the Info dictionary
        {"VTExtensionPointName", Value("ignored"), false},
        {"MRBundleVersion", Value("=3.2"), true},              // the Info dictionary when attributes lack it
        {"VTExtensionIdentifier", Value("com.example.share"), true},
        {"ovaro.uuid", Value("0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9"), true},
        {"ovaro.uuid", Value("0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9"), false},
        {"Number", Value("2"), false},                         // a number fact never matches text
        {"Number", Value(">1"), false},
        {"Number", Value(true), true},
        {"Missing", Value(false), true},
        {"Missing", Value(true), false},
        {"Flag", Value(false), true},
        {"Flag", Value(true), false},
        {"Number", Value(2), false},                           // a number pattern matches nothing
        {"ENTITLEMENT:ovaro.granted", Value(true), true},      // the string NO is present and not false
        {"ENTITLEMENT:ovaro.denied", Value(false), true},
        {"ENTITLEMENT:ovaro.absent", Value(false), true},
        {"ENTITLEMENT:VTExtensionPointName", Value(true), false},  // entitlements only, nothing else
        {"Version", Value(">=1.10"), true},
        {"Version", Value(">1.9"), true},
        {"Version", Value("<1.9"), false},
        {"Version", Value("<>1.10"), false},
        {"Version", Value("<=1.10"), true},
        {"Version", Value("==1.10"), false},                   // "=" with the operand "=1.10"
        {"Types", Value("text/plain"), true},                  // any element of an array fact
        {"Types", Value(Array{Value("x"), Value("text/plain")}), true},
        {"Types", Value(Array{}), false},
        {"Types", Value("?TY-CONFORMS:application/xml"), true},  // through the alias and the parent
        {"Types", Value("?TY-CONFORMS:text/plain"), true},
        {"Types", Value("?TY-IS:IMAGE/SVG+XML"), true},
        {"Types", Value("?TY-CONFORMS:image/png"), false},
        {"Activation", Value(Dictionary{{"text/plain", Value(2)}}), true},
        {"Activation", Value(Dictionary{{"text/plain", Value(3)}}), false},
        {"VTUserElection", Value("0"), true},                   // no election is "0"
        {"VTUserElection", Value(true), true},
        {"VTUserElection", Value(false), false},
    };
    PlugInFacts plugIn = facts();
    for (const Case& c : cases) {
        EXPECT_EQ(rules.matchKey(plugIn, c.key, c.pattern), c.matches) << c.key << " " << c.pattern.description();
    }
}

TEST_F(MatchRulesTest, ElectionsPrintAsTheirDecimalText) {
    struct Case {
        Value election;
        const char* text;
    };
    const Case cases[] = {{Value(1), "1"}, {Value(true), "1"}, {Value(false), "0"}, {Value(257), "257"},
                          {Value(2.0), "2"}, {Value(2.5), "2.5"}};
    for (const Case& c : cases) {
        Dictionary byText{{"VTUserElection", Value(c.text)}};
        EXPECT_TRUE(rules.match(facts(c.election), &byText)) << c.election.description();
    }
    Dictionary above{{"VTUserElection", Value(">0")}};
    EXPECT_FALSE(rules.match(facts(), &above));
    EXPECT_TRUE(rules.match(facts(Value(3)), &above));
}

TEST_F(MatchRulesTest, AllKeysMustMatchAndAnUnknownOperatorFailsWithALogLine) {
    qmtest::LogCapture log;
    EXPECT_TRUE(rules.match(facts(), nullptr));
    Dictionary empty;
    EXPECT_TRUE(rules.match(facts(), &empty));
    Dictionary both{{"VTExtensionPointName", Value("ovaro.share")}, {"Version", Value("<1")}};
    EXPECT_EQ(rules.firstFailingKey(facts(), &both), std::optional<std::string>("Version"));
    Dictionary unknown{{"VTExtensionPointName", Value("?SOMETHING")}};
    EXPECT_FALSE(rules.match(facts(), &unknown));
    EXPECT_EQ(log.countContaining("unrecognized match operator:?SOMETHING"), 1u) << log.text();
}

TEST_F(MatchRulesTest, HostChecksReadTheHostsRestrictionThenThePlugInsDemand) {
    struct Case {
        const char* name;
        std::optional<Value> hostEntitlements;
        Value plugInDictionary;
        std::optional<std::string> reason;
    };
    Value demands(Dictionary{{"VTExtensionHostEntitlement", Value("ovaro.host.share")}});
    const Case cases[] = {
        {"no restriction, no demand", std::nullopt, Value(Dictionary{}), std::nullopt},
        {"restricted to this plug-in",
         Value(Dictionary{{"ovaro.developer.quamber.allowedplugins",
                           Value(Dictionary{{"VTExtensionIdentifier", Value("com.example.share")}})}}),
         Value(Dictionary{}), std::nullopt},
        {"restricted to another",
         Value(Dictionary{{"ovaro.developer.quamber.allowedplugins",
                           Value(Dictionary{{"VTExtensionIdentifier", Value("com.example.other")}})}}),
         Value(Dictionary{}), "the host's plug-in entitlement does not allow this plug-in"},
        {"restriction of the wrong type",
         Value(Dictionary{{"ovaro.developer.quamber.allowedplugins", Value(Array{})}}), Value(Dictionary{}),
         "invalid host restriction entitlement"},
        {"demand met", Value(Dictionary{{"ovaro.host.share", Value(true)}}), demands, std::nullopt},
        {"demand refused by false", Value(Dictionary{{"ovaro.host.share", Value(false)}}), demands,
         "the host does not have the \"ovaro.host.share\" entitlement"},
        {"demand of a host without entitlements", std::nullopt, demands,
         "the host does not have the \"ovaro.host.share\" entitlement"},
    };
    for (const Case& c : cases) {
        ClientIdentity host;
        host.entitlements = c.hostEntitlements;
        EXPECT_EQ(allowForClient(rules, facts(), c.plugInDictionary, host), c.reason) << c.name;
    }
}

}  // namespace
