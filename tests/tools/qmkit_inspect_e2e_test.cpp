// qmkit inspect, end to end: the built tool run on the example bundles,
// offline, checked by exit status and output. What the model makes of each
// bundle is the model's tests' business.

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
const std::string kNotes = kExamples + "/Applications/Notes.app/PlugIns/";
const std::string kStudio = kExamples + "/Applications/Studio.app/Contents/PlugIns/";

class QmkitInspect : public ::testing::Test {
protected:
    qmtest::ProgramResult inspect(std::vector<std::string> arguments, std::map<std::string, std::string> environment = {}) {
        arguments.insert(arguments.begin(), {QMKIT_BINARY_PATH, "inspect"});
        environment.merge(std::map<std::string, std::string>{
            {"QM_SDK_PATH", kExamples + "/SDKs"}, {"XDG_DATA_HOME", dir.file("data")}, {"QM_LOG_STDERR", "0"}});
        return qmtest::runProgram(arguments, environment);
    }
    Value json(std::vector<std::string> arguments, std::map<std::string, std::string> environment = {}) {
        arguments.push_back("--json");
        auto result = inspect(arguments, environment);
        EXPECT_EQ(result.exitStatus, 0) << result.err;
        auto parsed = qm::json::parse(result.out);
        EXPECT_TRUE(parsed.ok()) << result.out;
        return parsed.ok() ? *parsed : Value();
    }

    qmtest::TempDir dir;
    ScopedEnvironment testSdk{"QMTEST_SDK", std::nullopt};
    ScopedEnvironment systemRoots{"QM_SYSTEM_ROOTS", std::nullopt};
};

TEST_F(QmkitInspect, ItsOutputAndExitStatus) {
    struct Case {
        std::vector<std::string> arguments;
        int exitStatus;
        std::vector<std::string> out;  // lines it holds
        std::string err;               // what it holds; empty: nothing at all
        std::map<std::string, std::string> environment = {};
    };
    const std::string share = kNotes + "ShareToNotes.bundle";
    const std::string filters = kStudio + "Filters.bundle";
    const std::string noSdks = dir.file("no-sdks");
    const std::string usage = "usage: qmkit inspect BUNDLE";
    const Case cases[] = {
        {{share}, 0,
         {"plug-in ovaro.example.notes.share\n", "  path: " + share + "\n",
          "  containing application: " + kExamples + "/Applications/Notes.app\n", "  system volume: no\n",
          "  sdk: ovaro.share-services\n", "  protocol: ShareServiceProtocol\n", "  version: 3.1\n",
          "  hub protocol version: 2\n",
          "  data container: " + dir.file("data") + "/ovaro/Containers/ovaro.example.notes.share\n", "  valid: yes\n",
          "CleanTimeout: 30\n"},
         ""},
        {{kNotes + "Spelling.bundle"}, 0, {"  data container: none (a data plug-in needs none)\n", "  protocol: #Data\n"}, ""},
        // The SDKs come from QM_SDK_PATH or --sdk-dir.
        {{share}, 1, {}, "missing \"VTExtensionProtocol\" key in Info.plist or SDK (code 12)\n", {{"QM_SDK_PATH", noSdks}}},
        {{share, "--sdk-dir", kExamples + "/SDKs"}, 0, {"  valid: yes\n"}, "", {{"QM_SDK_PATH", noSdks}}},
        {{kStudio + "Hybrid.bundle"}, 1, {"  valid: no\n"},
         "qmkit: plug-in ovaro.example.studio.hybrid in " + kStudio +
             "Hybrid.bundle: hybrid plug-ins are not supported on this platform (code 12)\n"},
        {{filters, "-i", "ovaro.example.studio.none"}, 1, {},
         "qmkit: plug-in ovaro.example.studio.none in " + filters +
             ": malformed plug-in dictionary in plug-in ovaro.example.studio.none at file://"},
        {{kStudio + "Broken.bundle"}, 1, {},
         "qmkit: unreadable Info dictionary in plug-in bundle at " + kStudio + "Broken.bundle: "},
        {{dir.file("Nowhere.bundle")}, 1, {}, "qmkit: no plug-in bundle at " + dir.file("Nowhere.bundle") + " (code 9)\n"},
        {{}, 2, {}, usage},
        {{"--frobnicate", share}, 2, {}, usage},
        {{share, "-i"}, 2, {}, usage},
        {{share, filters}, 2, {}, usage},
        {{"--help"}, 0, {usage}, ""},
    };
    for (const Case& c : cases) {
        auto result = inspect(c.arguments, c.environment);
        SCOPED_TRACE((c.arguments.empty() ? "" : c.arguments.back()) + "\nout:\n" + result.out + "err:\n" + result.err);
        EXPECT_EQ(result.exitStatus, c.exitStatus);
        for (const std::string& line : c.out) {
            EXPECT_NE(result.out.find(line), std::string::npos) << line;
        }
        EXPECT_TRUE(c.err.empty() ? result.err.empty() : result.err.find(c.err) != std::string::npos);
    }
}

// What the form holds is the model's test; here that it is printed whole.
TEST_F(QmkitInspect, JsonPrintsTheFormOrEveryFormOfTheBundle) {
    Value form = json({kNotes + "ShareToNotes.bundle"});
    EXPECT_EQ(at(form, {"identifier"}), Value("ovaro.example.notes.share"));
    EXPECT_EQ(at(form, {"systemResident"}), Value(false));
    EXPECT_EQ(at(form, {"bundleInfo", "VTExtension", "CleanTimeout"}), Value(30));
    EXPECT_TRUE(at(form, {"uuid"}).asString() && qm::Uuid::parse(*at(form, {"uuid"}).asString()));

    Value widget = json({kNotes + "NotesWidget.xbun"}, {{"QM_SYSTEM_ROOTS", kExamples + "/Applications"}});
    EXPECT_EQ(at(widget, {"systemResident"}), Value(true));
    EXPECT_EQ(at(widget, {"info", "PrincipalClass"}), Value("VTObject"));

    Value forms = json({kStudio + "Filters.bundle"});
    ASSERT_TRUE(forms.isArray() && forms.asArray()->size() == 2) << forms.description();
    EXPECT_EQ(at(forms.asArray()->at(0), {"identifier"}), Value("ovaro.example.studio.blur"));
    EXPECT_EQ(at(forms.asArray()->at(1), {"identifier"}), Value("ovaro.example.studio.sharpen"));
    Value one = json({kStudio + "Filters.bundle", "-i", "ovaro.example.studio.sharpen"});
    EXPECT_EQ(at(one, {"identifier"}), Value("ovaro.example.studio.sharpen"));
    EXPECT_EQ(at(one, {"version"}), Value("1.1"));
}

}  // namespace
