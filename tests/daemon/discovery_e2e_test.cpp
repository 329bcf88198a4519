// A real qmd over a catalog of the example applications: "match" with its
// filters and explanations, "annotate" and its notification, "add" and
// "remove", holds, and what hosts get to launch plug-ins. How rules match,
// elections filter and the catalog follows installs are the unit tests'
// business; here each takes its path through the daemon.

#include <gtest/gtest.h>

#include <unistd.h>

#include <filesystem>
#include <map>
#include <set>

#include "platform/plist/PropertyList.h"
#include "support/ChildProcess.h"
#include "support/DaemonProcess.h"
#include "support/Eventually.h"
#include "support/FramePeer.h"

namespace {

using qm::Array;
using qm::Dictionary;
using qm::Value;
using qmtest::errorCode;
using qmtest::errorText;

namespace fs = std::filesystem;

class Discovery : public ::testing::Test {
protected:
    Value match(Dictionary rules, std::uint64_t flags = 0, bool explain = false) {
        return client.ask({{"request", Value("match")}, {"rules", Value(std::move(rules))}, {"flags", Value(flags)},
                           {"explain", Value(explain)}});
    }
    Value hold(qmtest::FramePeer& peer, std::uint64_t flags, Array paths) {
        return peer.ask({{"request", Value("lock")}, {"flags", Value(flags)}, {"paths", Value(std::move(paths))}});
    }
    static const Array& forms(const Value& reply, const char* key = "matches") {
        static const Array none;
        const Value* packed = reply.get(key);
        const Value* list = packed ? packed->packedContent() : nullptr;
        return list && list->asArray() ? *list->asArray() : none;
    }
    static std::vector<std::string> identifiers(const Value& reply, const char* key = "matches") {
        std::vector<std::string> found;
        for (const Value& form : forms(reply, key)) {
            found.push_back(*form.get("identifier")->asString());
        }
        return found;
    }
    static const Value* form(const Value& reply, const std::string& identifier) {
        for (const Value& form : forms(reply)) {
            if (*form.get("identifier")->asString() == identifier) {
                return &form;
            }
        }
        return nullptr;
    }
    // The UUID the daemon gave the plug-in, as a request carries it (null when it is not offered).
    Value uuidOf(const std::string& identifier) {
        Value reply = match({{"VTExtensionIdentifier", Value(identifier)}});
        const Value* found = form(reply, identifier);
        return found ? Value(*qm::Uuid::parse(*found->get("uuid")->asString())) : Value();
    }
    static void changeInfo(const std::string& bundle, const char* key, Value value) {
        auto info = qm::plist::readFile(bundle + "/Info.plist");
        ASSERT_TRUE(info);
        qmtest::writePlist(bundle + "/Info.plist", Value(info->asDictionary()->changing(key, std::move(value))));
    }

    qmtest::TempDir roots;
    qmtest::DaemonProcess qmd{{"-v"}, qmtest::exampleApplications(roots)};
    qmtest::FramePeer client{qmd.socketPath()};
    const std::string notes = roots.file("system/Notes.app");
    const std::string share = notes + "/PlugIns/ShareToNotes.bundle";
    const Dictionary shareServices{{"VTExtensionPointName", Value("ovaro.share-services")}};
};

TEST_F(Discovery, RulesSelectAmongTheInstalledPlugInsInPathOrder) {
    const std::pair<Dictionary, std::vector<std::string>> cases[] = {
        {shareServices, {"ovaro.example.notes.share"}},
        // An operator leaves no extension point to narrow the search by.
        {{{"VTExtensionPointName", Value(">ovaro.share-services")}}, {"ovaro.example.notes.widget"}},
        // Two plug-ins of one multiplexed bundle.
        {{{"VTExtensionPointName", Value("ovaro.image-filter")}}, {"ovaro.example.studio.blur", "ovaro.example.studio.sharpen"}},
    };
    for (const auto& [rules, expected] : cases) {
        EXPECT_EQ(identifiers(match(rules)), expected) << Value(rules).description();
    }
    EXPECT_EQ(errorCode(client.ask({{"request", Value("match")}, {"rules", Value("x")}})), 4u);
    EXPECT_EQ(client.ask({{"request", Value("match")}, {"version", Value(std::uint64_t{2})}}), Value(Dictionary{}))
        << "version 2 has no matches";
    EXPECT_EQ(errorText(match({}, 0x200)), "unauthorized discovery flag (QMDiscoverAll)");
}

TEST_F(Discovery, ExplanationsSayWhyEachCandidateWasLeftOut) {
    Value reply = match({{"VTExtensionPointName", Value(">a")}, {"Category", Value("notes")}}, 0, true);
    std::map<std::string, std::pair<std::string, std::string>> why;
    for (const Value& entry : forms(reply, "explanations")) {
        why[*entry.get("identifier")->asString()] = {*entry.get("step")->asString(), *entry.get("detail")->asString()};
    }
    EXPECT_EQ(why["ovaro.example.notes.widget"], std::make_pair(std::string("rules"), std::string("Category")))
        << reply.description();
    EXPECT_EQ(why["ovaro.example.studio.passproxy"].first, "misconfigured");
    EXPECT_FALSE(why.contains("ovaro.example.notes.share")) << "offered, so not explained";
    EXPECT_EQ(identifiers(reply), std::vector<std::string>{"ovaro.example.notes.share"});
}

TEST_F(Discovery, AnElectionIsStoredAnnouncedAndSelectable) {
    Value uuid = uuidOf("ovaro.example.notes.share");
    auto annotate = [&](Dictionary annotations) {
        return client.ask({{"request", Value("annotate")}, {"uuids", Value(Array{uuid})}, {"annotations", Value(std::move(annotations))}});
    };
    ASSERT_TRUE(form(match(shareServices), "ovaro.example.notes.share"));
    EXPECT_EQ(*form(match(shareServices), "ovaro.example.notes.share")->get("annotations"), Value(Dictionary{}));
    // An election is a number, an extension a dictionary.
    for (const auto& [key, wrong] : {std::pair{"election", Value("1")}, std::pair{"extension", Value(1)}}) {
        EXPECT_EQ(errorText(annotate({{key, wrong}})), std::string("invalid request format (annotation ") + key + ")");
    }
    EXPECT_EQ(client.ask({{"request", Value("annotate")}, {"annotations", Value(Dictionary{{"other", Value(1)}})}}),
              Value(Dictionary{})) << "nothing to store: the uuids are not read";
    EXPECT_EQ(annotate({{"election", Value(1)}}), Value(Dictionary{}));
    // Posted before the reply.
    EXPECT_EQ(qmtest::readFile(qmd.runtimeDirectory() + "/notify/ovaro.quamber.annotation-change"), "1");
    Value elected = match(shareServices.changing("VTUserElection", Value("1")));
    ASSERT_TRUE(form(elected, "ovaro.example.notes.share"));
    EXPECT_EQ(*form(elected, "ovaro.example.notes.share")->get("annotations"), Value(Dictionary{{"election", Value(1)}}));
}

TEST_F(Discovery, AddAndRemoveRegisterByPathAndRefuseWhatIsNoPlugIn) {
    const std::string outside = roots.file("outside/Extra.bundle");
    fs::create_directories(roots.file("outside"));
    fs::copy(notes + "/PlugIns/Spelling.bundle", outside, fs::copy_options::recursive);
    changeInfo(outside, "MRBundleIdentifier", Value("ovaro.example.extra"));
    struct Case {
        const char* request;
        std::string path;
        std::optional<std::uint64_t> code;
        std::string error;
    };
    const Case cases[] = {
        {"add", "relative/path", 9, "absolute path required: relative/path"},
        {"add", roots.file("missing"), 9, "invalid plugin path: " + roots.file("missing")},
        {"add", notes, 9, "invalid plugin path: " + notes},
        {"add", roots.file("outside"), 2, "unable to register plug-in at " + roots.file("outside")},
        {"add", outside, std::nullopt, ""},
        {"remove", outside, std::nullopt, ""},
        {"remove", outside, 9, "no plugin at " + outside},
    };
    for (const Case& c : cases) {
        Value reply = client.ask({{"request", Value(c.request)}, {"paths", Value(Array{Value(c.path)})}});
        EXPECT_EQ(errorCode(reply), c.code) << c.request << " " << c.path;
        EXPECT_EQ(errorText(reply), c.error) << c.request << " " << c.path;
    }
    EXPECT_TRUE(qmd.waitForLog("INSTALLED:ovaro.example.extra"));
    EXPECT_TRUE(qmd.waitForLog("UNINSTALLED:ovaro.example.extra"));
}

// A second application carries ShareToNotes again, one version up, and a
// plug-in that replaces it.
TEST_F(Discovery, DuplicatesResolveByVersionAndReplacementsAreMarked) {
    const std::string copy = roots.file("Copy.app");
    fs::copy(notes, copy, fs::copy_options::recursive);
    changeInfo(copy + "/PlugIns/ShareToNotes.bundle", "MRBundleVersion", Value("3.10"));
    qmtest::writeFile(copy + "/PlugIns/Spelling.bundle/Entitlements.plist",
                      R"(<plist version="1.0"><dict><key>ovaro.developer.replace-plugin</key>)"
                      R"(<string>ovaro.example.notes.share</string></dict></plist>)");
    fs::rename(copy, roots.file("system/Copy.app"));

    auto versionsOf = [&](std::uint64_t flags) {
        std::multiset<std::string> versions;
        const Value reply = match({{"VTExtensionIdentifier", Value("ovaro.example.notes.share")}}, flags);
        for (const Value& found : forms(reply)) {
            versions.insert(*found.get("version")->asString());
        }
        return versions;
    };
    EXPECT_TRUE(qmtest::eventually([&] { return versionsOf(0x1).size() == 2; }));
    EXPECT_EQ(versionsOf(0), (std::multiset<std::string>{"3.10"})) << "3.10 is newer than 3.1";
    EXPECT_EQ(versionsOf(0x1), (std::multiset<std::string>{"3.1", "3.10"}));

    Value both = match({{"VTExtensionIdentifier", Value(Array{Value("ovaro.example.notes.share"), Value("ovaro.example.notes.spelling")})}});
    const Value* replacer = nullptr;
    for (const Value& found : forms(both)) {
        replacer = *found.get("path")->asString() == roots.file("system/Copy.app/PlugIns/Spelling.bundle") ? &found : replacer;
    }
    ASSERT_TRUE(replacer) << both.description();
    EXPECT_EQ(*replacer->get("overriding"), Value("ovaro.example.notes.share"));
    const Value* replaced = form(both, "ovaro.example.notes.share");
    ASSERT_TRUE(replaced);
    EXPECT_EQ(*replaced->get("overrider"), *replacer->get("uuid"));
}

TEST_F(Discovery, TheUsersExclusionsAreReadAgainWhenTheyChange) {
    ASSERT_EQ(identifiers(match(shareServices)).size(), 1u);
    const std::string prefs = qmd.scratchPath("config/ovaro/ovaro.quamber.userprefs.plist");
    auto storeExclusions = [&](Array exclusions) {
        qmtest::writePlist(prefs, Value(Dictionary{{"exclusions", Value(std::move(exclusions))}}), qm::plist::Format::binary);
    };
    storeExclusions({Value("ovaro.example.notes.share"), Value(Array{})});
    EXPECT_EQ(identifiers(match(shareServices)).size(), 1u) << "entries that are no rules dictionaries exclude nothing";
    storeExclusions({Value(7), Value(Dictionary{{"VTExtensionIdentifier", Value("ovaro.example.notes.share")}})});
    EXPECT_TRUE(identifiers(match(shareServices)).empty());
    EXPECT_TRUE(qmd.waitForLog("plugin ovaro.example.notes.share excluded"));
}

// How holds are kept and dropped is the hold list's test; here the requests,
// the listing and a holder's death as the daemon sees them.
TEST_F(Discovery, AHoldHidesItsPlugInsUntilReleasedOrItsClientDies) {
    const std::vector<std::string> offered{"ovaro.example.notes.share"};
    EXPECT_EQ(errorText(hold(client, 3, {Value(share)})), "invalid request format (unsupported hold flags)");
    EXPECT_TRUE(hold(client, 3, {}).get("uuids")) << "no path: an empty hold";
    EXPECT_EQ(errorText(hold(client, 2, {Value(notes)})), "no plug-in at path:" + notes);

    Value granted = hold(client, 2, {Value(share)});
    ASSERT_TRUE(granted.get("uuids") && granted.get("uuids")->asUuid()) << granted.description();
    const Value token = *granted.get("uuids");
    EXPECT_TRUE(identifiers(match(shareServices)).empty());
    EXPECT_EQ(identifiers(match(shareServices, 0, true), "explanations"), offered);
    Value holds = client.ask({{"request", Value("holds")}});
    ASSERT_EQ(holds.get("holds")->asArray()->size(), 2u) << holds.description();
    EXPECT_EQ(*(*holds.get("holds")->asArray())[1].get("uuid"), token);
    EXPECT_EQ(*(*holds.get("holds")->asArray())[1].get("pid"), Value(static_cast<std::int64_t>(::getpid())));

    // Any client may release by token; a second release changes nothing.
    qmtest::FramePeer other(qmd.socketPath());
    for (int i = 0; i < 2; ++i) {
        EXPECT_EQ(other.ask({{"request", Value("lock")}, {"uuids", Value(Array{token})}}), Value(Dictionary{}));
    }
    EXPECT_EQ(identifiers(match(shareServices)), offered);

    {
        qmtest::FramePeer installer(qmd.socketPath());
        ASSERT_TRUE(hold(installer, 1, {Value(notes)}).get("uuids"));
        EXPECT_TRUE(identifiers(match(shareServices)).empty());
    }
    EXPECT_TRUE(qmd.waitForLog("for dead client pid"));
    EXPECT_EQ(identifiers(match(shareServices)), offered) << "a holder that died left its hold";
}

TEST_F(Discovery, AnApplicationWithABusyPlugInCannotBeHeld) {
    fs::copy_file("/bin/sleep", share + "/ShareToNotes", fs::copy_options::overwrite_existing);
    qmtest::ChildProcess running(share + "/ShareToNotes", "30");  // returns once it runs the executable
    ASSERT_GT(running.pid(), 0);
    Value refused = hold(client, 1, {Value(notes)});
    running.reap();
    ASSERT_EQ(errorCode(refused), 14u);
    EXPECT_EQ(errorText(refused), "plug-ins are busy");
    EXPECT_EQ(*refused.get("conflicts"),
              Value(Array{Value(Dictionary{{"MRBundleIdentifier", Value("ovaro.example.notes.share")}})}));
    EXPECT_TRUE(hold(client, 1, {Value(notes)}).get("uuids")) << "an exited process is busy no more";
}

TEST_F(Discovery, HostsGetTokensForBundlesAndSharedResourcesAndLaunchRegistrations) {
    // A shared path that leaves its bundle through a link gets no token.
    fs::remove_all(share + "/Help");
    fs::create_directory_symlink(roots.file("system"), share + "/Help");
    const Value offered = match(shareServices);
    const Value* found = form(offered, "ovaro.example.notes.share");
    ASSERT_TRUE(found);
    const Value* extensions = found->get("extensions");
    ASSERT_TRUE(extensions && extensions->isDictionary()) << found->description();
    EXPECT_TRUE(extensions->get("Resources"));
    EXPECT_FALSE(extensions->get("Help")) << "a link out of the bundle";
    EXPECT_FALSE(extensions->get("Templates")) << "no such resource";
    EXPECT_TRUE(qmd.waitForLog("failed to make extension for " + share + "/Help"));

    const Value shareUuid = uuidOf("ovaro.example.notes.share");
    const Value spellingUuid = uuidOf("ovaro.example.notes.spelling");
    // That "access" grants tokens naming each bundle is qmkit's access test.
    EXPECT_EQ(client.ask({{"request", Value("ready")}, {"uuids", Value(Array{spellingUuid, shareUuid, shareUuid})}}),
              Value(Dictionary{}));
    const std::string services = qmd.runtimeDirectory() + "/services/" + std::to_string(::getpid());
    auto registration = qm::plist::readFile(services + "/ovaro.example.notes.share.plist");
    ASSERT_TRUE(registration) << registration.error().text();
    const std::string container = qmd.scratchPath("data/ovaro/Containers/ovaro.example.notes.share");
    Value expected(Dictionary{
        {"DuctService", Value(Dictionary{{"EnvironmentVariables", Value(Dictionary{{"HOME", Value(container)},
                                                                                   {"MRFIXED_USER_HOME", Value(container)},
                                                                                   {"TMPDIR", Value(container + "/tmp")}})},
                                         {"_OmitSandboxParameters", Value(true)},
                                         {"_SandboxProfile", Value("plugin")}})},
        {"ExecutablePath", Value(fs::canonical(share).string() + "/ShareToNotes")},
        {"MRBundleIdentifier", Value("ovaro.example.notes.share")},
        {"MRBundlePackageType", Value("DCT!")},
        {"MRBundleVersion", Value("3.1")}});
    EXPECT_EQ(*registration, expected);
    EXPECT_FALSE(fs::exists(services + "/ovaro.example.notes.spelling.plist")) << "a data plug-in launches nothing";

    ASSERT_TRUE(hold(client, 2, {Value(share)}).get("uuids"));
    EXPECT_EQ(errorText(client.ask({{"request", Value("ready")}, {"uuids", Value(Array{shareUuid})}})),
              "access to plugin ovaro.example.notes.share denied: the plug-in is on hold");
    EXPECT_EQ(client.ask({{"request", Value("access")}, {"uuids", Value(Array{shareUuid})}}).get("extensions")->asArray()->size(), 1u)
        << "tokens for a held plug-in all the same";
}

// Whether a grant stands is the consent store's test; here what the daemon
// makes of each answer, a withdrawn grant and an unreadable file included.
TEST_F(Discovery, AKeyboardIsSandboxedUnlessItsApplicationWasGrantedTheNetwork) {
    const std::string app = roots.file("Keys.app");
    qmtest::writeFile(app + "/Info.plist",
                      R"(<plist version="1.0"><dict><key>MRBundleIdentifier</key><string>ovaro.example.keys</string></dict></plist>)");
    const Dictionary attributes{{"VTExtensionPointName", Value("ovaro.keyboard-service")}, {"RequestsOpenAccess", Value(true)}};
    qmtest::writePlist(app + "/PlugIns/Keyboard.bundle/Info.plist",
                       Value(Dictionary{{"MRBundleIdentifier", Value("ovaro.example.keys.keyboard")}, {"MRBundleExecutable", Value("Keyboard")},
                                        {"VTExtension", Value(Dictionary{{"VTExtensionPointIdentifier", Value("ovaro.keyboard-service")},
                                                                         {"VTExtensionProtocol", Value("KeyboardProtocol")},
                                                                         {"VTExtensionAttributes", Value(attributes)}})}}));
    qmtest::writeFile(app + "/PlugIns/Keyboard.bundle/Keyboard", "#!/bin/sh\n");
    fs::rename(app, roots.file("system/Keys.app"));
    ASSERT_TRUE(qmtest::eventually([&] { return !uuidOf("ovaro.example.keys.keyboard").isNull(); }));
    const Value uuid = uuidOf("ovaro.example.keys.keyboard");

    auto consent = [](const char* granted) {
        return std::string(R"(<plist version="1.0"><dict><key>ovaro.example.keys</key><dict>)") +
               "<key>ovaro.pvc.keyboard-network</key><" + granted + "/></dict></dict></plist>";
    };
    // {consent file (none: no file), sandbox profile}
    const std::pair<std::optional<std::string>, const char*> cases[] = {
        {std::nullopt, "keyboard"}, {consent("true"), "plugin"}, {consent("false"), "keyboard"}, {"<plist", "keyboard"}};
    const std::string consentFile = qmd.scratchPath("data/ovaro/Consent.plist");
    for (const auto& [content, profile] : cases) {
        SCOPED_TRACE(content.value_or("no file"));
        fs::remove(consentFile);
        if (content) {
            qmtest::writeFile(consentFile, *content);
        }
        ASSERT_EQ(client.ask({{"request", Value("ready")}, {"uuids", Value(Array{uuid})}}), Value(Dictionary{}));
        auto registration = qm::plist::readFile(qmd.runtimeDirectory() + "/services/" + std::to_string(::getpid()) +
                                                "/ovaro.example.keys.keyboard.plist");
        ASSERT_TRUE(registration);
        EXPECT_EQ(*registration->get("DuctService")->get("_SandboxProfile"), Value(profile));
    }
    EXPECT_TRUE(qmd.waitForLog("PVCAccessCopyInformationForBundle failed for"));
}

}  // namespace
