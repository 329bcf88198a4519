// qmkit end to end: its output and exit statuses against a real qmd, and
// offline, "inspect" on the example bundles. What the model makes of each
// bundle is the model's tests' business.

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <functional>
#include <sstream>
#include <thread>
#include <tuple>

#include "model/ModelTestSupport.h"
#include "platform/value/Json.h"
#include "support/DaemonProcess.h"
#include "support/Eventually.h"
#include "support/FramePeer.h"

using modeltest::at;
using modeltest::ScopedEnvironment;
using qm::Value;
using qmtest::DaemonProcess;
using qmtest::FramePeer;
using qmtest::ProgramResult;
using qmtest::runProgram;

namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

class Qmkit : public ::testing::Test {
protected:
    // qmkit's command line against the daemon; run from `directory` when one
    // is given (the shell execs qmkit, which keeps its pid).
    std::vector<std::string> command(std::vector<std::string> args, const std::string& directory = "") const {
        args.insert(args.begin(), {QMKIT_BINARY_PATH, "-S", daemon_.serviceName()});
        if (!directory.empty()) {
            args.insert(args.begin(), {"/bin/sh", "-c", "cd \"$0\" && exec \"$@\"", directory});
        }
        return args;
    }
    std::map<std::string, std::string> environment() const {
        return {{"QM_DUCT_DIR", daemon_.runtimeDirectory()}, {"QM_LOG_STDERR", "0"}};
    }
    ProgramResult qmkit(std::vector<std::string> args, const std::string& input = "") {
        return runProgram(command(std::move(args)), environment(), std::chrono::seconds(30), input);
    }
    qm::Value json(std::vector<std::string> args) {
        args.insert(args.begin(), "--json");
        ProgramResult result = qmkit(std::move(args));
        EXPECT_EQ(result.exitStatus, 0) << result.err;
        auto value = qm::json::parse(result.out);
        return value.ok() ? *value : qm::Value();
    }
    // Asks "holds" until `done` accepts the list (at most 5 s); the last list.
    qm::Array holdsWhen(const std::function<bool(const qm::Array&)>& done) {
        qm::Array holds;
        qmtest::eventually([&] {
            const qm::Value listed = at(json({"holds"}), {"holds"});
            holds = listed.asArray() ? *listed.asArray() : qm::Array{};
            return done(holds);
        });
        return holds;
    }
    std::string uuidOf(const std::string& identifier) {
        const qm::Value matches = at(json({"send", R"({"request": "match", "rules": {"VTExtensionIdentifier": ")" + identifier + "\"}}"}), {"matches"});
        const qm::Value* uuid = matches.asArray() && !matches.asArray()->empty() ? matches.asArray()->front().get("uuid") : nullptr;
        return uuid && uuid->asString() ? *uuid->asString() : "";
    }

    qmtest::TempDir roots_;
    DaemonProcess daemon_{{}, qmtest::exampleApplications(roots_)};
};

ProgramResult offline(std::vector<std::string> args) {
    args.insert(args.begin(), QMKIT_BINARY_PATH);
    return runProgram(args, {{"QM_LOG_STDERR", "0"}});
}

bool startsWith(const std::string& text, const std::string& prefix) {
    return prefix.empty() ? text.empty() : text.rfind(prefix, 0) == 0;
}

// Runs without a daemon: help, version and every usage error. What the JSON
// reader says of bad text is its own test.
TEST(QmkitUsage, AnswersWithoutADaemon) {
    // {arguments, exit status, how standard output starts and how standard error starts (empty: nothing)}
    const std::string kTooLarge = "is too large (at most 18446744073709551615)\n";
    const std::tuple<std::vector<std::string>, int, std::string, std::string> cases[] = {
        {{"--help"}, 0, "usage: qmkit [-S service] [--json] [--timeout SECONDS] <command>", ""},
        {{"bulk", "--help"}, 0, "usage: qmkit [-S service] [--json] [--timeout SECONDS] bulk [--flags N]", ""},
        {{"send", "--help"}, 0, "usage: qmkit [-S service] [--json] [--timeout SECONDS] send JSON", ""},
        {{"--version"}, 0, "qmkit " QM_VERSION "\n", ""},
        {{}, 2, "", "qmkit: no command given"},
        {{"frobnicate"}, 2, "", "qmkit: unknown command \"frobnicate\""},
        {{"--verbose", "bulk"}, 2, "", "qmkit: unknown option \"--verbose\""},
        {{"-S"}, 2, "", "qmkit: -S needs a service name"},
        {{"-S", "a/b", "bulk"}, 2, "", "qmkit: invalid service name \"a/b\""},
        {{"-S", "", "bulk"}, 2, "", "qmkit: invalid service name \"\""},
        {{"--timeout", "bulk"}, 2, "", "qmkit: --timeout must be a positive number of seconds, not \"bulk\""},
        {{"--timeout", "0", "bulk"}, 2, "", "qmkit: --timeout must be a positive number of seconds, not \"0\""},
        {{"--timeout", "-1", "bulk"}, 2, "", "qmkit: --timeout must be a positive number"},
        {{"--timeout", "1000001", "bulk"}, 2, "", "qmkit: --timeout 1000001 is too large (at most 1000000)"},
        {{"--timeout", "1" + std::string(400, '0'), "bulk"}, 2, "", "qmkit: --timeout 1000"},
        {{"send"}, 2, "", "qmkit: send: expected one JSON object"},
        {{"send", "{\"request\": "}, 2, "", "qmkit: send: invalid JSON: "},
        {{"send", "[\"bulk\"]"}, 2, "", "qmkit: send: the request must be a JSON object"},
        {{"send", "-"}, 2, "", "qmkit: send: invalid JSON: "},  // nothing on standard input
        {{"bulk", "--flags", "lots"}, 2, "", "qmkit: bulk: --flags must be a number (decimal or 0x-hex), not \"lots\""},
        {{"bulk", "--flags", "0x"}, 2, "", "qmkit: bulk: --flags must be a number"},
        {{"bulk", "--flags", "18446744073709551616"}, 2, "", "qmkit: bulk: --flags 18446744073709551616 " + kTooLarge},
        {{"bulk", "--flags", "0x10000000000000000"}, 2, "", "qmkit: bulk: --flags 0x10000000000000000 " + kTooLarge},
        {{"bulk", "--flags"}, 2, "", "qmkit: bulk: unexpected argument \"--flags\""},
        {{"bulk", "extra"}, 2, "", "qmkit: bulk: unexpected argument \"extra\""},
        {{"hold", "--help"}, 0, "usage: qmkit [-S service] [--json] [--timeout SECONDS] hold PATH... [--flags N]", ""},
        {{"hold", "--flags", "1"}, 2, "", "qmkit: hold: expected one or more paths\nqmkit: see 'qmkit hold --help'\n"},
        {{"hold", "/a", "--flags", "two"}, 2, "", "qmkit: hold: --flags must be a number (decimal or 0x-hex), not"},
        {{"hold", "--force", "/a"}, 2, "", "qmkit: hold: unknown option \"--force\""},
        {{"release", "0d3c1f5e"}, 2, "", "qmkit: release: \"0d3c1f5e\" is not a hold token\n"},
        {{"access"}, 2, "", "qmkit: access: expected one or more UUIDs\n"},
        {{"holds", "all"}, 2, "", "qmkit: holds: unexpected argument \"all\"\n"},
        {{"token", "check", "qm1"}, 2, "", "qmkit: token: expected \"verify TOKEN\"\n"},
    };
    for (const auto& [args, exitStatus, out, err] : cases) {
        ProgramResult result = offline(args);
        const std::string what = args.empty() ? "(no arguments)" : args.front() + " ...";
        EXPECT_EQ(result.exitStatus, exitStatus) << what << ": " << result.err;
        EXPECT_TRUE(startsWith(result.out, out)) << what << ": " << result.out;
        EXPECT_TRUE(startsWith(result.err, err)) << what << ": " << result.err;
    }
}

// Without an answer qmkit exits 3: nobody listens, a service takes the
// connection and never answers (it gives up after its timeout rather than
// waiting for ever), or a daemon hangs up before replying.
TEST(QmkitUsage, WithoutAnAnswerItExitsThree) {
    qmtest::TempDir scratch;
    qm::UniqueFd mute = FramePeer::listenAt(scratch.file("mute.qmd"));
    qm::UniqueFd vanishing = FramePeer::listenAt(scratch.file("vanishing.qmd"));
    std::thread hangsUp([&] { FramePeer::accept(vanishing).receive(); });
    const std::pair<const char*, std::string> cases[] = {
        {"nobody.qmd", "qmkit: cannot reach qmd (service \"nobody.qmd\"): cannot connect to " + scratch.file("nobody.qmd") +
                           ": No such file or directory\n"},
        {"mute.qmd", "qmkit: no reply within 0.5 s\n"},
        {"vanishing.qmd", "qmkit: connection invalid: daemon closed the connection\n"},
    };
    for (const auto& [service, err] : cases) {
        ProgramResult result = runProgram({QMKIT_BINARY_PATH, "-S", service, "--timeout", "0.5", "bulk"},
                                          {{"QM_DUCT_DIR", scratch.path()}, {"QM_LOG_STDERR", "0"}});
        EXPECT_EQ(result.exitStatus, 3) << service;
        EXPECT_EQ(result.err, err);
        EXPECT_EQ(result.out, "");
    }
    hangsUp.join();
}

// Replies print as JSON when asked (an error reply too); an error reply
// exits 1 with its message and code. "send" adds the current version only
// where it is missing.
TEST_F(Qmkit, TheDaemonsRepliesAndRefusals) {
    struct Case {
        std::vector<std::string> args;
        std::string input;
        int exitStatus;
        std::string out, err;
        std::string logged = "";
    };
    const std::string unrecognized = "qmkit: unrecognized request (code 4)\n";
    const Case cases[] = {
        {{"bulk", "--flags", "42"}, "", 0, "", "", "bulk options 0x2a not supported"},
        {{"--json", "bulk", "--flags", "0x10"}, "", 0, "{}\n", "", "bulk options 0x10 not supported"},
        {{"send", "-"}, "{\"request\": \"bulk\",\n \"flags\": 7}\n", 0, "{}\n", "", "bulk options 0x7 not supported"},
        {{"send", "{\"request\": \"bulk\", \"version\": 1}"}, "", 1, "",
         "qmkit: unsupported protocol version 1 (current 3) (code 7)\n"},
        {{"--json", "send",
          "{\"request\": \"x-unknown\", \"uuids\": [{\"$uuid\": \"0d3c1f5e-8a51-4c7e-9f6b-2d7f1e0a9b34\"}]}"},
         "",
         1, "{\n  \"error\": \"unrecognized request\",\n  \"errorcode\": 4\n}\n", unrecognized},
    };
    for (const Case& c : cases) {
        ProgramResult result = qmkit(c.args, c.input);
        EXPECT_EQ(result.exitStatus, c.exitStatus) << c.args.back();
        EXPECT_EQ(result.out, c.out) << c.args.back();
        EXPECT_EQ(result.err, c.err) << c.args.back();
        EXPECT_TRUE(c.logged.empty() || daemon_.waitForLog(c.logged)) << c.logged;
    }
}

// --- inspect -----------------------------------------------------------------

const std::string kExamples = std::string(QM_SOURCE_DIR) + "/examples";
const std::string kNotes = kExamples + "/Applications/Notes.app/PlugIns/";
const std::string kStudio = kExamples + "/Applications/Studio.app/Contents/PlugIns/";

class QmkitInspect : public ::testing::Test {
protected:
    ProgramResult inspect(std::vector<std::string> arguments, std::map<std::string, std::string> environment = {}) {
        arguments.insert(arguments.begin(), {QMKIT_BINARY_PATH, "inspect"});
        environment.merge(std::map<std::string, std::string>{
            {"QM_SDK_PATH", kExamples + "/SDKs"}, {"XDG_DATA_HOME", dir.file("data")}, {"QM_LOG_STDERR", "0"}});
        return runProgram(arguments, environment);
    }
    Value json(std::vector<std::string> arguments) {
        arguments.push_back("--json");
        auto result = inspect(arguments);
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
    const std::string shareSdk = kExamples + "/SDKs/ovaro.share-services.plist";
    const Case cases[] = {
        {{share, "-v"}, 0,
         {"plug-in ovaro.example.notes.share\n", "  path: " + share + "\n", "  extension point: ovaro.share-services\n",
          "  containing application: " + kExamples + "/Applications/Notes.app\n", "  system volume: no\n",
          "  sdk: ovaro.share-services (" + shareSdk + ")\n", "  protocol: ShareServiceProtocol\n", "  version: 3.1\n",
          "  hub protocol version: 2\n",
          "  data container: " + dir.file("data") + "/ovaro/Containers/ovaro.example.notes.share\n", "  valid: yes\n",
          "CleanTimeout: 30\n"},
         ""},
        // Each value of the merged Info dictionary with where it came from.
        {{share, "--provenance"}, 0,
         {"    MRBundleVersion = 3.1  [bundle]\n", "    VTExtension/CleanTimeout = 30  [" + shareSdk + "]\n",
          "    VTExtension/Shared = [\"Resources\",\"Help\",\"Templates\"]  [bundle + " + shareSdk + "]\n",
          "    VTExtension/VTExtensionAttributes/ovaro.format = standard  [canonical]\n"},
         ""},
        {{kNotes + "Spelling.bundle"}, 0, {"  data container: none (a data plug-in needs none)\n", "  protocol: #Data\n"}, ""},
        // The SDKs come from QM_SDK_PATH or --sdk-dir.
        {{share}, 1, {"  sdk: ovaro.share-services not found; looked in " + noSdks + "/ovaro.share-services.plist\n"},
         "missing \"VTExtensionProtocol\" key in Info.plist or SDK (code 12)\n", {{"QM_SDK_PATH", noSdks}}},
        {{share, "--sdk-dir", kExamples + "/SDKs"}, 0, {"  valid: yes\n"}, "", {{"QM_SDK_PATH", noSdks}}},
        {{kStudio + "Hybrid.bundle"}, 1, {"  valid: no: hybrid plug-ins are not supported on this platform (code 12)\n"},
         "qmkit: plug-in ovaro.example.studio.hybrid in " + kStudio +
             "Hybrid.bundle: hybrid plug-ins are not supported on this platform (code 12)\n"},
        // A path that is no plug-in bundle; each way it can fail is the model's test.
        {{dir.file("Nowhere.bundle")}, 1, {}, "qmkit: no plug-in bundle at " + dir.file("Nowhere.bundle") + ": no such path (code 9)\n"},
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

// What the form holds is the model's test; here that the JSON carries the
// verdict, the form and the provenance, for each plug-in of a bundle.
TEST_F(QmkitInspect, JsonCarriesTheVerdictTheFormAndTheProvenance) {
    Value share = json({kNotes + "ShareToNotes.bundle", "-v", "--provenance"});
    EXPECT_EQ(at(share, {"valid"}), Value(true));
    EXPECT_EQ(at(share, {"sdk", "file"}), Value(kExamples + "/SDKs/ovaro.share-services.plist"));
    EXPECT_EQ(at(share, {"form", "identifier"}), Value("ovaro.example.notes.share"));
    const qm::Array* origins = at(share, {"provenance"}).asArray();
    ASSERT_TRUE(origins);
    const Value cleanTimeout(qm::Dictionary{{"key", Value(qm::Array{Value("VTExtension"), Value("CleanTimeout")})},
                                            {"value", Value(30)},
                                            {"source", Value("sdk")},
                                            {"file", Value(kExamples + "/SDKs/ovaro.share-services.plist")}});
    EXPECT_NE(std::find(origins->begin(), origins->end(), cleanTimeout), origins->end());

    Value forms = json({kStudio + "Filters.bundle"});
    ASSERT_TRUE(forms.isArray() && forms.asArray()->size() == 2) << forms.description();
    EXPECT_EQ(at(forms.asArray()->at(0), {"identifier"}), Value("ovaro.example.studio.blur"));
    EXPECT_EQ(at(forms.asArray()->at(1), {"identifier"}), Value("ovaro.example.studio.sharpen"));
    EXPECT_EQ(at(json({kStudio + "Filters.bundle", "-i", "ovaro.example.studio.sharpen"}), {"version"}), Value("1.1"));

    for (const std::string& invalid : {kStudio + "Inspector.xbun", kStudio + "Nowhere.bundle"}) {
        auto result = inspect({invalid, "--json"});
        EXPECT_EQ(result.exitStatus, 1);
        auto parsed = qm::json::parse(result.out);
        ASSERT_TRUE(parsed.ok()) << result.out;
        EXPECT_EQ(at(*parsed, {"valid"}), Value(false));
        EXPECT_EQ(at(*parsed, {"error", "code"}), Value(invalid.ends_with(".xbun") ? 12 : 9));
    }
}

// Each way a hold ends; the daemon goes last. Relative paths are the
// working directory's: the daemon resolves them in its own.
TEST_F(Qmkit, AHoldLastsUntilReleasedOrInterruptedOrCutOff) {
    // {how it ends, exit status, standard error}
    const std::tuple<std::string, int, std::string> cases[] = {
        {"release", 0, ""}, {"SIGTERM", 0, ""}, {"SIGINT", 0, ""},
        {"daemon killed", 3, "qmkit: connection invalid: daemon closed the connection\n"},
    };
    const std::string executable = fs::canonical(QMKIT_BINARY_PATH).string();
    for (const auto& [ending, exitStatus, err] : cases) {
        SCOPED_TRACE(ending);
        qmtest::RunningProgram holder(command({"hold", "Notes.app"}, roots_.file("system")), environment());
        qm::Array holds = holdsWhen([](const qm::Array& listed) { return listed.size() == 1; });
        ASSERT_EQ(holds.size(), 1u) << "the hold is not listed";
        const std::string token = *holds[0].get("uuid")->asString();
        const pid_t pid = static_cast<pid_t>(*holds[0].get("pid")->asSigned());
        // Signals go only to the holder this test started, never to a pid read from a listing.
        ASSERT_EQ(pid, holder.pid());
        EXPECT_EQ(holds[0].get("plugins")->asArray()->size(), 4u);
        ProgramResult listed = qmkit({"holds"});
        EXPECT_TRUE(startsWith(listed.out, "TOKEN")) << listed.out;
        for (const std::string& cell : {token, " " + std::to_string(pid) + " ", std::string(" 4 "), "  " + executable + "\n"}) {
            EXPECT_NE(listed.out.find(cell), std::string::npos) << cell << " in " << listed.out;
        }

        if (ending == "release") {
            ProgramResult released = qmkit({"release", token});
            EXPECT_EQ(released.exitStatus, 0) << released.err;
            EXPECT_EQ(released.out, "");
        } else if (ending == "daemon killed") {
            ASSERT_GT(daemon_.pid(), 0);
            ::kill(daemon_.pid(), SIGKILL);
        } else {
            holder.signal(ending == "SIGINT" ? SIGINT : SIGTERM);
        }
        const ProgramResult held = holder.wait();
        EXPECT_EQ(held.exitStatus, exitStatus) << held.err;
        EXPECT_EQ(held.out, token + "\n");
        EXPECT_EQ(held.err, err);
        // A killed daemon may not be reaped yet: "running" would not tell.
        if (ending != "daemon killed") {
            EXPECT_TRUE(holdsWhen([](const qm::Array& now) { return now.empty(); }).empty());
        }
    }
}

TEST_F(Qmkit, AccessGrantsTokensThatVerifyAndReadyShowsTheRegistration) {
    const std::string share = uuidOf("ovaro.example.notes.share");
    const std::string spelling = uuidOf("ovaro.example.notes.spelling");
    ASSERT_FALSE(share.empty() || spelling.empty());
    const qm::Value access = json({"access", spelling, share});
    const qm::Value* granted = access.get("tokens");
    ASSERT_TRUE(granted && granted->asArray() && granted->asArray()->size() == 2u);
    EXPECT_EQ(*(*granted->asArray())[1].get("uuid"), qm::Value(share));
    const std::string token = *(*granted->asArray())[1].get("token")->asString();
    ProgramResult table = qmkit({"access", share});
    EXPECT_EQ(table.out, "UUID" + std::string(34, ' ') + "TOKEN\n" + share + "  " + token + "\n");

    std::string changed = token;
    changed[token.size() / 2] = changed[token.size() / 2] == '0' ? '1' : '0';
    const std::string sharePath = fs::canonical(roots_.file("system/Notes.app/PlugIns/ShareToNotes.bundle")).string();
    // Which tokens verify is the tokens' own test; here what qmkit makes of the verdict.
    for (const std::string& verified : {token, changed}) {
        ProgramResult result = qmkit({"token", "verify", verified});
        EXPECT_EQ(result.exitStatus, verified == token ? 0 : 1) << result.err;
        EXPECT_EQ(result.out, verified == token ? "read\t" + sharePath + "\n" : "");
    }

    const qm::Value ready = json({"ready", share, spelling});
    const qm::Value* registrations = ready.get("registrations");
    ASSERT_TRUE(registrations && registrations->asArray() && registrations->asArray()->size() == 1u)
        << "a data plug-in needs no registration";
    const qm::Value& registration = registrations->asArray()->front();
    EXPECT_EQ(*registration.get("bundle"), qm::Value("ovaro.example.notes.share"));
    const std::string file = *registration.get("file")->asString();
    EXPECT_TRUE(startsWith(file, daemon_.runtimeDirectory() + "/services/")) << file;
    EXPECT_NE(qmtest::readFile(file).find("ovaro.example.notes.share"), std::string::npos) << file;
}

// "list" shows every plug-in with its verdict and the bundles the catalog
// refused; "watch" prints each change made while it runs, changes made
// together included, in both of its formats.
TEST_F(Qmkit, ListShowsVerdictsAndWatchPrintsEveryChange) {
    const std::string studio = fs::canonical(roots_.file("system")).string() + "/Studio.app/Contents/PlugIns/";
    ProgramResult listed = qmkit({"list"});
    EXPECT_EQ(listed.exitStatus, 0) << listed.err;
    EXPECT_NE(listed.out.find("-\t-\t-\t-\t" + studio + "Broken.bundle\tinvalid: unreadable Info.plist\n"),
              std::string::npos) << listed.out;
    EXPECT_NE(listed.out.find("\tovaro.example.studio.hybrid\t"), std::string::npos);
    EXPECT_NE(listed.out.find("Hybrid.bundle\tinvalid: hybrid plug-ins are not supported"), std::string::npos);
    ProgramResult widgets = qmkit({"list", "--point", "ovaro.widget"});
    EXPECT_EQ(std::count(widgets.out.begin(), widgets.out.end(), '\n'), 2) << widgets.out;
    EXPECT_NE(widgets.out.find("\tovaro.example.notes.widget\t1.0\tovaro.widget\t"), std::string::npos);
    EXPECT_NE(widgets.out.find("Inspector.xbun\tinvalid: Application Extensions may not use the \"PrincipalClass\" key"),
              std::string::npos);
    const std::string badPage = "qmkit: \"offset\" and \"limit\" must be unsigned integers, \"limit\" at most 1000 (code 4)\n";
    EXPECT_EQ(qmkit({"send", R"({"request": "list", "limit": 1001})"}).err, badPage);
    EXPECT_EQ(qmkit({"send", R"({"request": "list", "offset": -1})"}).err, badPage);
    EXPECT_EQ(qmkit({"send", R"({"request": "list", "point": 7})"}).err, "qmkit: \"point\" must be a string (code 4)\n");

    // Studio leaves before the watchers start and comes back while they run.
    const std::string parked = roots_.file("Studio.app");
    fs::rename(roots_.file("system/Studio.app"), parked);
    ASSERT_TRUE(qmtest::eventually([&] { return qmkit({"list"}).out.find("Studio.app") == std::string::npos; }));

    // Stopped by SIGTERM, which it answers with exit status 0.
    qmtest::RunningProgram text(command({"watch"}), environment());
    qmtest::RunningProgram json(command({"--json", "watch"}), environment());
    // Elections until both report one: then both have made their first look.
    const std::string share = uuidOf("ovaro.example.notes.share");
    const std::string spelling = uuidOf("ovaro.example.notes.spelling");
    auto elect = [&](const std::vector<std::string>& uuids, int election) {
        std::string list;
        for (const std::string& uuid : uuids) {
            list += (list.empty() ? "" : ", ") + std::string("{\"$uuid\": \"") + uuid + "\"}";
        }
        ProgramResult annotated = qmkit({"send", R"({"request": "annotate", "uuids": [)" + list +
                                                     R"(], "annotations": {"election": )" + std::to_string(election) + "}}"});
        EXPECT_EQ(annotated.exitStatus, 0) << annotated.err;
    };
    int warmUp = 10;
    ASSERT_TRUE(qmtest::eventually([&] {
        elect({share}, ++warmUp);
        std::this_thread::sleep_for(50ms);
        return text.outputSoFar().find(" election ") != std::string::npos &&
               json.outputSoFar().find("\"election\"") != std::string::npos;
    }));
    const std::size_t textStart = text.outputSoFar().size();
    const std::size_t jsonStart = json.outputSoFar().size();

    fs::rename(parked, roots_.file("system/Studio.app"));  // seven plug-ins at once
    ASSERT_TRUE(qmtest::eventually([&] { return qmkit({"list"}).out.find("Studio.app") != std::string::npos; }));
    elect({share, spelling}, 1);                           // two elections at once
    qmtest::RunningProgram holder(command({"hold", roots_.file("system/Notes.app")}), environment());
    const qm::Array holds = holdsWhen([](const qm::Array& now) { return now.size() == 1; });
    ASSERT_EQ(holds.size(), 1u);
    const std::string token = *holds[0].get("uuid")->asString();
    EXPECT_EQ(qmkit({"release", token}).exitStatus, 0);
    EXPECT_EQ(holder.wait().exitStatus, 0);
    fs::remove_all(roots_.file("system/Studio.app"));

    auto events = [&](const std::string& output, std::size_t start) {
        std::vector<qm::Value> parsed;
        std::istringstream lines(output.substr(start));
        for (std::string line; std::getline(lines, line);) {
            auto value = qm::json::parse(line);
            EXPECT_TRUE(value.ok()) << line;
            parsed.push_back(value.ok() ? *value : Value());
        }
        return parsed;
    };
    const std::size_t expected = 7 + 2 + 2 + 7;
    ASSERT_TRUE(qmtest::eventually([&] { return events(json.outputSoFar(), jsonStart).size() >= expected; }))
        << json.outputSoFar();
    const std::map<std::string, int> expectedCounts{{"installed", 7}, {"election", 2}, {"held", 1}, {"released", 1},
                                                    {"uninstalled", 7}};
    std::map<std::string, int> counts;
    for (const Value& event : events(json.outputSoFar(), jsonStart)) {
        const std::string name = *event.get("event")->asString();
        ++counts[name];
        EXPECT_TRUE(event.get("time") && event.get("time")->asString()) << event.description();
        if (name == "election") {
            EXPECT_EQ(*event.get("election"), Value(1));
        } else if (name == "held" || name == "released") {
            EXPECT_EQ(*event.get("token"), Value(token));
            EXPECT_EQ(event.get("plugins")->asArray()->size(), 4u);
        } else {
            EXPECT_EQ(event.get("path")->asString()->rfind(studio, 0), 0u) << event.description();
        }
    }
    EXPECT_EQ(counts, expectedCounts);
    ASSERT_TRUE(qmtest::eventually([&] {
        const std::string out = text.outputSoFar();
        return std::count(out.begin() + static_cast<std::ptrdiff_t>(textStart), out.end(), '\n') >= static_cast<std::ptrdiff_t>(expected);
    })) << text.outputSoFar();

    text.signal(SIGTERM);
    json.signal(SIGTERM);
    const ProgramResult textResult = text.wait(), jsonResult = json.wait();
    for (const ProgramResult* watcher : {&textResult, &jsonResult}) {
        EXPECT_EQ(watcher->exitStatus, 0) << watcher->err;
    }
    // Each watcher splits the changes between its looks as they fall: only the counts agree.
    std::istringstream lines(textResult.out.substr(textStart));
    std::map<std::string, int> textCounts;
    for (std::string time, event, rest; lines >> time >> event && std::getline(lines, rest); ++textCounts[event]) {
        EXPECT_EQ(time.size(), std::string("2026-11-23T19:04:05.123+00:00").size()) << time;
    }
    EXPECT_EQ(textCounts, expectedCounts) << textResult.out;
}

}  // namespace
