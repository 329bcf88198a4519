// A real qmd over a catalog of the example applications: "match" with its
// filters and explanations, "annotate" and its notification, "add" and
// "remove", and installs seen while it runs.

#include <gtest/gtest.h>

#include <unistd.h>

#include <filesystem>
#include <map>
#include <set>

#include "platform/plist/PropertyList.h"
#include "platform/sandbox/ReadExtensions.h"
#include "support/ChildProcess.h"
#include "support/DaemonProcess.h"
#include "support/Eventually.h"
#include "support/FramePeer.h"
#include "support/ScopedEnvironment.h"

namespace {

using qm::Array;
using qm::Dictionary;
using qm::Value;
using qmtest::errorCode;
using qmtest::errorText;

namespace fs = std::filesystem;

class Discovery : public ::testing::Test {
protected:
    Discovery()
        : qmd(std::make_unique<qmtest::DaemonProcess>(std::vector<std::string>{"-v"}, qmtest::exampleApplications(roots))),
          client(std::make_unique<qmtest::FramePeer>(qmd->socketPath())) {}
    Value send(std::initializer_list<Dictionary::Entry> entries) {
        Dictionary request(entries);
        request.set("version", Value(std::uint64_t{3}));
        auto reply = client->roundTrip(Value(std::move(request)));
        EXPECT_TRUE(reply);
        return reply.value_or(Value());
    }
    Value match(Dictionary rules, std::uint64_t flags = 0, bool explain = false) {
        return send({{"request", Value("match")}, {"rules", Value(std::move(rules))}, {"flags", Value(flags)},
                     {"explain", Value(explain)}});
    }
    static std::vector<std::string> identifiers(const Value& reply, const char* key = "matches") {
        std::vector<std::string> found;
        const Value* packed = reply.get(key);
        const Value* forms = packed ? packed->packedContent() : nullptr;
        for (const Value& form : forms && forms->asArray() ? *forms->asArray() : Array{}) {
            found.push_back(*form.get("identifier")->asString());
        }
        return found;
    }
    static const Value* form(const Value& reply, const std::string& identifier) {
        for (const Value& form : *reply.get("matches")->packedContent()->asArray()) {
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

    qmtest::TempDir roots;
    std::unique_ptr<qmtest::DaemonProcess> qmd;
    std::unique_ptr<qmtest::FramePeer> client;
};

TEST_F(Discovery, RulesSelectAmongTheInstalledPlugInsInPathOrder) {
    struct Case {
        const char* name;
        Dictionary rules;
        std::vector<std::string> expected;
    };
    const Case cases[] = {
        {"one extension point", {{"VTExtensionPointName", Value("ovaro.share-services")}}, {"ovaro.example.notes.share"}},
        {"with the election filter", {{"VTExtensionPointName", Value("ovaro.share-services")}, {"VTUserElection", Value("1")}}, {}},
        {"an operator falls back to every plug-in",
         {{"VTExtensionPointName", Value(">ovaro.share-services")}},
         {"ovaro.example.notes.widget"}},
        {"two plug-ins of one multiplexed bundle",
         {{"VTExtensionPointName", Value("ovaro.image-filter")}},
         {"ovaro.example.studio.blur", "ovaro.example.studio.sharpen"}},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(identifiers(match(c.rules)), c.expected) << c.name;
    }
    EXPECT_EQ(errorCode(send({{"request", Value("match")}, {"rules", Value("x")}})), 4u);
    auto v2 = client->roundTrip(qmtest::request({{"request", Value("match")}, {"version", Value(std::uint64_t{2})}}));
    ASSERT_TRUE(v2);
    EXPECT_EQ(*v2, Value(Dictionary{})) << "version 2 has no matches";
    EXPECT_EQ(errorText(match({}, 0x200)), "unauthorized discovery flag (QMDiscoverAll)");
}

TEST_F(Discovery, ExplanationsSayWhyEachCandidateWasLeftOut) {
    Value reply = match({{"VTExtensionPointName", Value(">a")}, {"Category", Value("notes")}}, 0, true);
    const Value* packed = reply.get("explanations");
    ASSERT_TRUE(packed && packed->packedContent()) << reply.description();
    std::map<std::string, std::pair<std::string, std::string>> why;
    for (const Value& entry : *packed->packedContent()->asArray()) {
        why[*entry.get("identifier")->asString()] = {*entry.get("step")->asString(), *entry.get("detail")->asString()};
    }
    EXPECT_EQ(why["ovaro.example.notes.widget"], std::make_pair(std::string("rules"), std::string("Category")));
    EXPECT_EQ(why["ovaro.example.studio.passproxy"].first, "misconfigured");
    EXPECT_FALSE(why.contains("ovaro.example.notes.share")) << "offered, so not explained";
    EXPECT_EQ(identifiers(reply), std::vector<std::string>{"ovaro.example.notes.share"});
}

TEST_F(Discovery, AnElectionIsStoredAnnouncedAndSelectable) {
    Value before = match({{"VTExtensionPointName", Value("ovaro.share-services")}});
    ASSERT_TRUE(form(before, "ovaro.example.notes.share"));
    Value uuid = uuidOf("ovaro.example.notes.share");
    EXPECT_EQ(*form(before, "ovaro.example.notes.share")->get("annotations"), Value(Dictionary{}));

    struct Case {
        Dictionary annotations;
        std::optional<std::string> error;
    };
    const Case refused[] = {
        {{{"election", Value("1")}}, "invalid request format (annotation election)"},
        {{{"extension", Value(1)}}, "invalid request format (annotation extension)"},
    };
    for (const Case& c : refused) {
        EXPECT_EQ(errorText(send({{"request", Value("annotate")}, {"uuids", Value(Array{uuid})}, {"annotations", Value(c.annotations)}})),
                  *c.error);
    }
    EXPECT_EQ(send({{"request", Value("annotate")}, {"annotations", Value(Dictionary{{"other", Value(1)}})}}),
              Value(Dictionary{})) << "nothing to store: the uuids are not read";
    Value annotated = send({{"request", Value("annotate")},
                            {"uuids", Value(Array{uuid})},
                            {"annotations", Value(Dictionary{{"election", Value(1)}})}});
    EXPECT_EQ(annotated, Value(Dictionary{}));
    // Posted before the reply.
    EXPECT_EQ(qmtest::readFile(qmd->runtimeDirectory() + "/notify/ovaro.quamber.annotation-change"), "1");
    Value elected = match({{"VTExtensionPointName", Value("ovaro.share-services")}, {"VTUserElection", Value("1")}});
    ASSERT_TRUE(form(elected, "ovaro.example.notes.share"));
    EXPECT_EQ(*form(elected, "ovaro.example.notes.share")->get("annotations"), Value(Dictionary{{"election", Value(1)}}));
}

TEST_F(Discovery, AddAndRemoveRegisterByPathAndRefuseWhatIsNoPlugIn) {
    std::string outside = roots.file("outside/Extra.bundle");
    fs::create_directories(roots.file("outside"));
    fs::copy(roots.file("system/Notes.app/PlugIns/Spelling.bundle"), outside, fs::copy_options::recursive);
    std::string extraInfo = outside + "/Info.plist";
    auto info = qm::plist::readFile(extraInfo);
    ASSERT_TRUE(info);
    qm::Dictionary changed = *info->asDictionary();
    changed.set("MRBundleIdentifier", Value("ovaro.example.extra"));
    ASSERT_FALSE(qm::plist::writeFileAtomically(extraInfo, Value(changed), qm::plist::Format::xml));

    struct Case {
        const char* request;
        std::string path;
        std::optional<std::uint64_t> code;
        std::string error;
    };
    const Case cases[] = {
        {"add", "relative/path", 9, "absolute path required: relative/path"},
        {"add", roots.file("missing"), 9, "invalid plugin path: " + roots.file("missing")},
        {"add", roots.file("system/Notes.app"), 9, "invalid plugin path: " + roots.file("system/Notes.app")},
        {"add", roots.file("outside"), 2, "unable to register plug-in at " + roots.file("outside")},
        {"add", outside, std::nullopt, ""},
        {"remove", outside, std::nullopt, ""},
        {"remove", outside, 9, "no plugin at " + outside},
    };
    for (const Case& c : cases) {
        Value reply = send({{"request", Value(c.request)}, {"paths", Value(Array{Value(c.path)})}});
        EXPECT_EQ(errorCode(reply), c.code) << c.request << " " << c.path;
        EXPECT_EQ(errorText(reply), c.error) << c.request << " " << c.path;
    }
    EXPECT_TRUE(qmd->waitForLog("INSTALLED:ovaro.example.extra"));
    EXPECT_TRUE(qmd->waitForLog("UNINSTALLED:ovaro.example.extra"));
}

TEST_F(Discovery, ApplicationsInstalledAndRemovedWhileRunningAreSeen) {
    Dictionary rules{{"VTExtensionPointName", Value("ovaro.widget")}};
    ASSERT_EQ(identifiers(match(rules)), std::vector<std::string>{"ovaro.example.notes.widget"});
    fs::rename(roots.file("system/Notes.app"), roots.file("Notes.app"));
    EXPECT_TRUE(qmd->waitForLog("UNINSTALLED:ovaro.example.notes.widget")) << qmd->log();
    EXPECT_TRUE(identifiers(match(rules)).empty());
    fs::rename(roots.file("Notes.app"), roots.file("system/Notes.app"));
    // Seen again, under a new UUID.
    std::string uuidBefore = *form(match({}), "ovaro.example.studio.blur")->get("uuid")->asString();
    EXPECT_TRUE(qmtest::eventually([&] { return !identifiers(match(rules)).empty(); }));
    EXPECT_EQ(identifiers(match(rules)), std::vector<std::string>{"ovaro.example.notes.widget"});
    EXPECT_EQ(*form(match({}), "ovaro.example.studio.blur")->get("uuid")->asString(), uuidBefore)
        << "an untouched application keeps its plug-ins' UUIDs";
}

// A second application carries ShareToNotes again, one version up, and a
// plug-in that replaces it.
TEST_F(Discovery, DuplicatesResolveByVersionAndReplacementsAreMarked) {
    std::string copy = roots.file("Copy.app");
    fs::copy(roots.file("system/Notes.app"), copy, fs::copy_options::recursive);
    auto setVersion = [](const std::string& info, const char* version) {
        auto dictionary = qm::plist::readFile(info);
        ASSERT_TRUE(dictionary);
        ASSERT_FALSE(qm::plist::writeFileAtomically(
            info, Value(dictionary->asDictionary()->changing("MRBundleVersion", Value(version))), qm::plist::Format::xml));
    };
    setVersion(copy + "/PlugIns/ShareToNotes.bundle/Info.plist", "3.10");
    std::string replacing = copy + "/PlugIns/Spelling.bundle";
    qmtest::writeFile(replacing + "/Entitlements.plist",
                      R"(<plist version="1.0"><dict><key>ovaro.developer.replace-plugin</key>)"
                      R"(<string>ovaro.example.notes.share</string></dict></plist>)");
    fs::rename(copy, roots.file("system/Copy.app"));

    Dictionary shares{{"VTExtensionIdentifier", Value("ovaro.example.notes.share")}};
    auto versionsOf = [&](std::uint64_t flags) {
        std::multiset<std::string> versions;
        Value reply = match(shares, flags);
        for (const Value& found : *reply.get("matches")->packedContent()->asArray()) {
            versions.insert(*found.get("version")->asString());
        }
        return versions;
    };
    EXPECT_TRUE(qmtest::eventually([&] { return versionsOf(0x1).size() == 2; }));
    EXPECT_EQ(versionsOf(0), (std::multiset<std::string>{"3.10"})) << "3.10 is newer than 3.1";
    EXPECT_EQ(versionsOf(0x1), (std::multiset<std::string>{"3.1", "3.10"}));

    Value both = match({{"VTExtensionIdentifier", Value(Array{Value("ovaro.example.notes.share"), Value("ovaro.example.notes.spelling")})}});
    const Value* replacer = nullptr;
    for (const Value& found : *both.get("matches")->packedContent()->asArray()) {
        if (*found.get("path")->asString() == roots.file("system/Copy.app/PlugIns/Spelling.bundle")) {
            replacer = &found;
        }
    }
    ASSERT_TRUE(replacer) << both.description();
    EXPECT_EQ(*replacer->get("overriding"), Value("ovaro.example.notes.share"));
    const Value* replaced = form(both, "ovaro.example.notes.share");
    ASSERT_TRUE(replaced);
    EXPECT_EQ(*replaced->get("overrider"), *replacer->get("uuid"));
}

TEST_F(Discovery, TheUsersExclusionsAreReadAgainWhenTheyChange) {
    Dictionary rules{{"VTExtensionPointName", Value("ovaro.share-services")}};
    ASSERT_EQ(identifiers(match(rules)).size(), 1u);
    std::string prefs = qmd->scratchPath("config/ovaro/ovaro.quamber.userprefs.plist");
    fs::create_directories(fs::path(prefs).parent_path());
    auto storeExclusions = [&](Array exclusions) {
        ASSERT_FALSE(qm::plist::writeFileAtomically(prefs, Value(Dictionary{{"exclusions", Value(std::move(exclusions))}}),
                                                    qm::plist::Format::binary));
    };
    storeExclusions({Value("ovaro.example.notes.share"), Value(Array{})});
    EXPECT_EQ(identifiers(match(rules)).size(), 1u) << "entries that are no rules dictionaries exclude nothing";
    storeExclusions({Value(7), Value(Dictionary{{"VTExtensionIdentifier", Value("ovaro.example.notes.share")}})});
    EXPECT_TRUE(identifiers(match(rules)).empty());
    EXPECT_TRUE(qmd->waitForLog("plugin ovaro.example.notes.share excluded"));
}

TEST_F(Discovery, AHoldHidesItsPlugInsUntilReleasedOrItsClientDies) {
    std::string share = roots.file("system/Notes.app/PlugIns/ShareToNotes.bundle");
    Dictionary rules{{"VTExtensionPointName", Value("ovaro.share-services")}};
    auto lock = [&](qmtest::FramePeer& peer, std::uint64_t flags, Array paths) {
        auto reply = peer.roundTrip(qmtest::request({{"request", Value("lock")}, {"version", Value(std::uint64_t{3})},
                                                     {"flags", Value(flags)}, {"paths", Value(std::move(paths))}}));
        return reply.value_or(Value());
    };
    EXPECT_EQ(errorText(lock(*client, 3, Array{Value(share)})), "invalid request format (unsupported hold flags)");
    EXPECT_TRUE(lock(*client, 3, Array{}).get("uuids")) << "no path: an empty hold";
    EXPECT_EQ(errorText(lock(*client, 2, Array{Value(roots.file("system/Notes.app"))})),
              "no plug-in at path:" + roots.file("system/Notes.app"));

    Value granted = lock(*client, 2, Array{Value(share)});
    ASSERT_TRUE(granted.get("uuids") && granted.get("uuids")->asUuid()) << granted.description();
    Value token = *granted.get("uuids");
    EXPECT_TRUE(identifiers(match(rules)).empty());
    EXPECT_EQ(identifiers(match(rules, 0, true), "explanations"), std::vector<std::string>{"ovaro.example.notes.share"});
    Value holds = send({{"request", Value("holds")}});
    ASSERT_EQ(holds.get("holds")->asArray()->size(), 2u) << holds.description();
    EXPECT_EQ(*(*holds.get("holds")->asArray())[1].get("uuid"), token);
    EXPECT_EQ(*(*holds.get("holds")->asArray())[1].get("pid"), Value(static_cast<std::int64_t>(::getpid())));

    // Any client may release by token; a second release changes nothing.
    qmtest::FramePeer other(qmd->socketPath());
    for (int i = 0; i < 2; ++i) {
        EXPECT_EQ(other.roundTrip(qmtest::request({{"request", Value("lock")}, {"version", Value(std::uint64_t{3})},
                                                   {"uuids", Value(Array{token})}})),
                  Value(Dictionary{}));
    }
    EXPECT_EQ(identifiers(match(rules)), std::vector<std::string>{"ovaro.example.notes.share"});

    // A holder that dies leaves no hold behind.
    {
        qmtest::FramePeer installer(qmd->socketPath());
        ASSERT_TRUE(lock(installer, 1, Array{Value(roots.file("system/Notes.app"))}).get("uuids"));
        EXPECT_TRUE(identifiers(match(rules)).empty());
    }
    EXPECT_TRUE(qmd->waitForLog("for dead client pid"));
    EXPECT_EQ(identifiers(match(rules)), std::vector<std::string>{"ovaro.example.notes.share"});
}

TEST_F(Discovery, AnApplicationWithABusyPlugInCannotBeHeld) {
    std::string bundle = roots.file("system/Notes.app/PlugIns/ShareToNotes.bundle");
    fs::copy_file("/bin/sleep", bundle + "/ShareToNotes", fs::copy_options::overwrite_existing);
    auto holdNotes = [&] {
        return send({{"request", Value("lock")}, {"flags", Value(std::uint64_t{1})},
                     {"paths", Value(Array{Value(roots.file("system/Notes.app"))})}});
    };
    qmtest::ChildProcess running(bundle + "/ShareToNotes", "30");  // returns once it runs the executable
    ASSERT_GT(running.pid(), 0);
    Value refused = holdNotes();
    running.reap();
    ASSERT_EQ(errorCode(refused), 14u);
    EXPECT_EQ(errorText(refused), "plug-ins are busy");
    EXPECT_EQ(*refused.get("conflicts"),
              Value(Array{Value(Dictionary{{"MRBundleIdentifier", Value("ovaro.example.notes.share")}})}));
    EXPECT_TRUE(holdNotes().get("uuids")) << "an exited process is busy no more";
}

TEST_F(Discovery, HostsGetTokensForBundlesAndSharedResourcesAndLaunchRegistrations) {
    std::string share = roots.file("system/Notes.app/PlugIns/ShareToNotes.bundle");
    // A shared path that leaves its bundle through a link gets no token.
    fs::remove_all(share + "/Help");
    fs::create_directory_symlink(roots.file("system"), share + "/Help");
    Value found = match({{"VTExtensionPointName", Value("ovaro.share-services")}});
    const Value* form = this->form(found, "ovaro.example.notes.share");
    ASSERT_TRUE(form);
    const Value* extensions = form->get("extensions");
    ASSERT_TRUE(extensions && extensions->isDictionary()) << form->description();
    EXPECT_TRUE(extensions->get("Resources"));
    EXPECT_FALSE(extensions->get("Help")) << "a link out of the bundle";
    EXPECT_FALSE(extensions->get("Templates")) << "no such resource";
    EXPECT_TRUE(qmd->waitForLog("failed to make extension for " + share + "/Help"));

    Value shareUuid = uuidOf("ovaro.example.notes.share");
    Value spellingUuid = uuidOf("ovaro.example.notes.spelling");

    qmtest::ScopedEnvironment duct("QM_DUCT_DIR", qmd->runtimeDirectory());
    Value access = send({{"request", Value("access")}, {"uuids", Value(Array{spellingUuid, shareUuid})}});
    const qm::Array* tokens = access.get("extensions") ? access.get("extensions")->asArray() : nullptr;
    ASSERT_TRUE(tokens && tokens->size() == 2) << access.description();
    auto named = qm::verifyExtension(*(*tokens)[1].asString());
    ASSERT_TRUE(named) << named.error().text();
    EXPECT_EQ(named->path, fs::canonical(share).string());

    EXPECT_EQ(send({{"request", Value("ready")}, {"uuids", Value(Array{spellingUuid, shareUuid, shareUuid})}}),
              Value(Dictionary{}));
    std::string services = qmd->runtimeDirectory() + "/services/" + std::to_string(::getpid());
    auto registration = qm::plist::readFile(services + "/ovaro.example.notes.share.plist");
    ASSERT_TRUE(registration) << registration.error().text();
    std::string container = qmd->scratchPath("data/ovaro/Containers/ovaro.example.notes.share");
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

    Value hold = send({{"request", Value("lock")}, {"flags", Value(std::uint64_t{2})}, {"paths", Value(Array{Value(share)})}});
    ASSERT_TRUE(hold.get("uuids"));
    EXPECT_EQ(errorText(send({{"request", Value("ready")}, {"uuids", Value(Array{shareUuid})}})),
              "access to plugin ovaro.example.notes.share denied: the plug-in is on hold");
    EXPECT_EQ(send({{"request", Value("access")}, {"uuids", Value(Array{shareUuid})}}).get("extensions")->asArray()->size(), 1u)
        << "tokens for a held plug-in all the same";
}

TEST_F(Discovery, AKeyboardIsSandboxedUnlessItsApplicationWasGrantedTheNetwork) {
    std::string app = roots.file("Keys.app");
    qmtest::writeFile(app + "/Info.plist",
                      R"(<plist version="1.0"><dict><key>MRBundleIdentifier</key><string>ovaro.example.keys</string></dict></plist>)");
    qmtest::writeFile(app + "/PlugIns/Keyboard.bundle/Info.plist", R"(<plist version="1.0"><dict>
        <key>MRBundleIdentifier</key><string>ovaro.example.keys.keyboard</string>
        <key>MRBundleExecutable</key><string>Keyboard</string>
        <key>VTExtension</key><dict>
          <key>VTExtensionPointIdentifier</key><string>ovaro.keyboard-service</string>
          <key>VTExtensionProtocol</key><string>KeyboardProtocol</string>
          <key>VTExtensionAttributes</key><dict><key>VTExtensionPointName</key><string>ovaro.keyboard-service</string>
            <key>RequestsOpenAccess</key><true/></dict></dict></dict></plist>)");
    qmtest::writeFile(app + "/PlugIns/Keyboard.bundle/Keyboard", "#!/bin/sh\n");
    fs::rename(app, roots.file("system/Keys.app"));
    ASSERT_TRUE(qmtest::eventually([&] { return !uuidOf("ovaro.example.keys.keyboard").isNull(); }));
    Value uuid = uuidOf("ovaro.example.keys.keyboard");

    struct Case {
        const char* name;
        std::optional<std::string> consent;  // none: no file
        const char* profile;
    };
    const std::string granting = R"(<plist version="1.0"><dict><key>ovaro.example.keys</key><dict>)"
                                 R"(<key>ovaro.pvc.keyboard-network</key><true/></dict></dict></plist>)";
    const Case cases[] = {
        {"no consent file", std::nullopt, "keyboard"},
        {"granted", granting, "plugin"},
        {"refused", R"(<plist version="1.0"><dict><key>ovaro.example.keys</key><dict>)"
                    R"(<key>ovaro.pvc.keyboard-network</key><false/></dict></dict></plist>)", "keyboard"},
        {"damaged", "<plist", "keyboard"},
    };
    std::string consentFile = qmd->scratchPath("data/ovaro/Consent.plist");
    for (const Case& c : cases) {
        fs::remove(consentFile);
        if (c.consent) {
            qmtest::writeFile(consentFile, *c.consent);
        }
        ASSERT_EQ(send({{"request", Value("ready")}, {"uuids", Value(Array{uuid})}}), Value(Dictionary{})) << c.name;
        auto registration = qm::plist::readFile(qmd->runtimeDirectory() + "/services/" + std::to_string(::getpid()) +
                                                "/ovaro.example.keys.keyboard.plist");
        ASSERT_TRUE(registration) << c.name;
        EXPECT_EQ(*registration->get("DuctService")->get("_SandboxProfile"), Value(c.profile)) << c.name;
    }
    EXPECT_TRUE(qmd->waitForLog("PVCAccessCopyInformationForBundle failed for"));
}

}  // namespace
