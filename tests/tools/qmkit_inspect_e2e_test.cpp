// qmkit inspect, end to end: the built tool run on the example bundles,
// offline, checked by exit status and output.

#include <gtest/gtest.h>

#include "model/ModelTestSupport.h"
#include "platform/value/Json.h"
#include "support/DaemonProcess.h"
#include "support/TempDir.h"

namespace {

using modeltest::at;
using modeltest::ScopedEnvironment;
using qm::Value;

const std::string kExamples = std::string(QM_SOURCE_DIR) + "/examples";
const std::string kNotesPlugIns = kExamples + "/Applications/Notes.app/PlugIns/";
const std::string kStudioPlugIns = kExamples + "/Applications/Studio.app/Contents/PlugIns/";

class QmkitInspect : public ::testing::Test {
protected:
    qmtest::TempDir dir;
    ScopedEnvironment testSdk{"QMTEST_SDK", std::nullopt};
    ScopedEnvironment systemRoots{"QM_SYSTEM_ROOTS", std::nullopt};
    std::map<std::string, std::string> environment{{"QM_SDK_PATH", dir.file("no-sdks")},
                                                   {"XDG_DATA_HOME", dir.file("data")},
                                                   {"QM_LOG_STDERR", "0"}};

    qmtest::ProgramResult inspect(std::vector<std::string> arguments, bool withExampleSdks = true) {
        std::vector<std::string> argv{QMKIT_BINARY_PATH, "inspect"};
        if (withExampleSdks) {
            argv.insert(argv.end(), {"--sdk-dir", kExamples + "/SDKs"});
        }
        argv.insert(argv.end(), arguments.begin(), arguments.end());
        return qmtest::runProgram(argv, environment);
    }

    static Value json(const qmtest::ProgramResult& result) {
        auto parsed = qm::json::parse(result.out);
        EXPECT_TRUE(parsed.ok()) << result.out;
        return parsed.ok() ? *parsed : Value();
    }
};

TEST_F(QmkitInspect, AValidPlugInPrintsItsFactsAndForm) {
    auto result = inspect({kNotesPlugIns + "ShareToNotes.bundle"});
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(result.err, "");
    for (const std::string& line : {
             std::string("plug-in ovaro.example.notes.share\n"),
             "  path: " + kNotesPlugIns + "ShareToNotes.bundle\n",
             "  containing application: " + kExamples + "/Applications/Notes.app\n",
             std::string("  system volume: no\n"),
             std::string("  sdk: ovaro.share-services\n"),
             std::string("  protocol: ShareServiceProtocol\n"),
             std::string("  version: 3.1\n"),
             std::string("  hub protocol version: 2\n"),
             "  data container: " + dir.file("data") + "/ovaro/Containers/ovaro.example.notes.share\n",
             std::string("  valid: yes\n"),
             std::string("CleanTimeout: 30\n"),
         }) {
        EXPECT_NE(result.out.find(line), std::string::npos) << line << "\nin:\n" << result.out;
    }
}

TEST_F(QmkitInspect, JsonPrintsTheForm) {
    auto result = inspect({kNotesPlugIns + "ShareToNotes.bundle", "--json"});
    ASSERT_EQ(result.exitStatus, 0) << result.err;
    Value form = json(result);
    EXPECT_EQ(at(form, {"identifier"}), Value("ovaro.example.notes.share"));
    EXPECT_EQ(at(form, {"path"}), Value(kNotesPlugIns + "ShareToNotes.bundle"));
    EXPECT_EQ(at(form, {"version"}), Value("3.1"));
    EXPECT_EQ(at(form, {"hubProtocolVersion"}), Value(2));
    EXPECT_EQ(at(form, {"systemResident"}), Value(false));
    EXPECT_EQ(at(form, {"annotations"}), modeltest::dict({}));
    EXPECT_EQ(at(form, {"localizedContainingDisplayName"}), Value("Example Notes"));
    EXPECT_EQ(at(form, {"bundleInfo", "VTExtension", "CleanTimeout"}), Value(30));
    EXPECT_EQ(at(form, {"bundleInfo", "MRBundleInfoPlistURL"}), Value());
    ASSERT_TRUE(at(form, {"uuid"}).isString());
    EXPECT_TRUE(qm::Uuid::parse(*at(form, {"uuid"}).asString()));
}

TEST_F(QmkitInspect, EachRunIsAFreshRegistration) {
    auto first = json(inspect({kNotesPlugIns + "Spelling.bundle", "--json"}));
    auto second = json(inspect({kNotesPlugIns + "Spelling.bundle", "--json"}));
    EXPECT_NE(at(first, {"uuid"}), at(second, {"uuid"}));
}

TEST_F(QmkitInspect, ADataPlugInSaysItNeedsNoContainer) {
    auto result = inspect({kNotesPlugIns + "Spelling.bundle"});
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_NE(result.out.find("  data container: none (a data plug-in needs none)\n"), std::string::npos) << result.out;
    EXPECT_NE(result.out.find("  protocol: #Data\n"), std::string::npos) << result.out;
}

TEST_F(QmkitInspect, TheSystemRootsDecideTheSystemVolume) {
    environment["QM_SYSTEM_ROOTS"] = kExamples + "/Applications";
    auto result = inspect({kNotesPlugIns + "NotesWidget.xbun", "--json"});
    ASSERT_EQ(result.exitStatus, 0) << result.err;
    Value form = json(result);
    EXPECT_EQ(at(form, {"systemResident"}), Value(true));
    EXPECT_EQ(at(form, {"info", "Shared"}), modeltest::array({"."}));
    EXPECT_EQ(at(form, {"info", "PrincipalClass"}), Value("VTObject"));
}

TEST_F(QmkitInspect, AMultiplexedBundleShowsEveryPlugInOrTheOneAskedFor) {
    auto all = inspect({kStudioPlugIns + "Filters.bundle", "--json"});
    ASSERT_EQ(all.exitStatus, 0) << all.err;
    Value forms = json(all);
    ASSERT_TRUE(forms.isArray());
    ASSERT_EQ(forms.asArray()->size(), 2u);
    EXPECT_EQ(at(forms.asArray()->at(0), {"identifier"}), Value("ovaro.example.studio.blur"));
    EXPECT_EQ(at(forms.asArray()->at(1), {"identifier"}), Value("ovaro.example.studio.sharpen"));
    EXPECT_EQ(at(forms.asArray()->at(1), {"hubProtocolVersion"}), Value(3));

    auto one = inspect({kStudioPlugIns + "Filters.bundle", "-i", "ovaro.example.studio.sharpen", "--json"});
    ASSERT_EQ(one.exitStatus, 0) << one.err;
    Value form = json(one);
    EXPECT_EQ(at(form, {"identifier"}), Value("ovaro.example.studio.sharpen"));
    EXPECT_EQ(at(form, {"version"}), Value("1.1"));
}

TEST_F(QmkitInspect, AMissingMultipleEntryIsAMalformedPlugIn) {
    auto result = inspect({kStudioPlugIns + "Filters.bundle", "-i", "ovaro.example.studio.none"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_TRUE(result.err.starts_with("qmkit: plug-in ovaro.example.studio.none in " + kStudioPlugIns +
                                       "Filters.bundle: malformed plug-in dictionary in plug-in "
                                       "ovaro.example.studio.none at file://"))
        << result.err;
    EXPECT_TRUE(result.err.ends_with("(code 12)\n")) << result.err;
}

TEST_F(QmkitInspect, MisconfiguredPlugInsFailWithTheExactMessage) {
    const std::pair<const char*, const char*> cases[] = {
        {"PassProxy.bundle", "ovaro.example.studio.passproxy: the \"PassProxy\" key is not supported on this platform"},
        {"Hybrid.bundle", "ovaro.example.studio.hybrid: hybrid plug-ins are not supported on this platform"},
        {"Inspector.xbun", "ovaro.example.studio.inspector: Application Extensions may not use the \"PrincipalClass\" key"},
        {"Unregistered.bundle",
         "ovaro.example.studio.unregistered: missing \"VTExtensionProtocol\" key in Info.plist or SDK"},
        {"NoExecutable.bundle", "ovaro.example.studio.noexecutable: this plug-in has no sandbox data container"},
    };
    for (const auto& [bundle, message] : cases) {
        std::string path = kStudioPlugIns + bundle;
        auto result = inspect({path});
        EXPECT_EQ(result.exitStatus, 1) << bundle;
        std::string id = std::string(message).substr(0, std::string(message).find(':'));
        std::string text = std::string(message).substr(id.size() + 2);
        EXPECT_EQ(result.err, "qmkit: plug-in " + id + " in " + path + ": " + text + " (code 12)\n") << bundle;
        EXPECT_NE(result.out.find("  valid: no\n"), std::string::npos) << bundle << "\n" << result.out;
    }
}

TEST_F(QmkitInspect, WithoutItsSdkAPlugInLacksItsProtocol) {
    auto result = inspect({kNotesPlugIns + "ShareToNotes.bundle"}, false);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_NE(result.err.find("missing \"VTExtensionProtocol\" key in Info.plist or SDK (code 12)"), std::string::npos)
        << result.err;

    // The SDK path of the environment serves as well as --sdk-dir.
    environment["QM_SDK_PATH"] = kExamples + "/SDKs";
    EXPECT_EQ(inspect({kNotesPlugIns + "ShareToNotes.bundle"}, false).exitStatus, 0);
}

TEST_F(QmkitInspect, UnreadableBundlesFail) {
    auto broken = inspect({kStudioPlugIns + "Broken.bundle"});
    EXPECT_EQ(broken.exitStatus, 1);
    EXPECT_TRUE(broken.err.starts_with("qmkit: unreadable Info dictionary in plug-in bundle at " + kStudioPlugIns +
                                       "Broken.bundle: "))
        << broken.err;

    auto missing = inspect({dir.file("Nowhere.bundle")});
    EXPECT_EQ(missing.exitStatus, 1);
    EXPECT_EQ(missing.err, "qmkit: no plug-in bundle at " + dir.file("Nowhere.bundle") + " (code 9)\n");
}

TEST_F(QmkitInspect, BadUsageExitsTwo) {
    EXPECT_EQ(inspect({}).exitStatus, 2);
    EXPECT_EQ(inspect({"--frobnicate", kNotesPlugIns + "Spelling.bundle"}).exitStatus, 2);
    EXPECT_EQ(inspect({kNotesPlugIns + "Spelling.bundle", "-i"}).exitStatus, 2);
    EXPECT_EQ(inspect({kNotesPlugIns + "Spelling.bundle", kNotesPlugIns + "NotesWidget.xbun"}).exitStatus, 2);
    auto noBundle = inspect({});
    EXPECT_NE(noBundle.err.find("usage: qmkit inspect BUNDLE"), std::string::npos) << noBundle.err;

    auto help = inspect({"--help"});
    EXPECT_EQ(help.exitStatus, 0);
    EXPECT_TRUE(help.out.starts_with("usage: qmkit inspect BUNDLE")) << help.out;
}

}  // namespace
