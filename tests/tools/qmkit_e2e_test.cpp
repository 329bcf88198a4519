// qmkit end to end: its output and exit statuses against a real qmd.

#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <functional>
#include <thread>

#include "platform/fd/UniqueFd.h"
#include "platform/value/Json.h"
#include "support/DaemonProcess.h"

using qmtest::DaemonProcess;
using qmtest::ProgramResult;
using qmtest::runProgram;

namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

// A daemon over a copy of the example applications.
qmtest::DaemonOptions withExamples(const qmtest::TempDir& roots) {
    fs::copy(fs::path(QM_SOURCE_DIR) / "examples/Applications", roots.file("system"), fs::copy_options::recursive);
    return qmtest::withEnvironment(
        {{"QM_SYSTEM_ROOTS", roots.file("system")}, {"QM_SDK_PATH", std::string(QM_SOURCE_DIR) + "/examples/SDKs"}});
}

class Qmkit : public ::testing::Test {
protected:
    // Runs qmkit against the daemon; from `directory` when one is given.
    ProgramResult qmkit(std::vector<std::string> args, const std::string& input = "", const std::string& directory = "") {
        args.insert(args.begin(), {QMKIT_BINARY_PATH, "-S", daemon_.serviceName()});
        if (!directory.empty()) {
            args.insert(args.begin(), {"/bin/sh", "-c", "cd \"$0\" && exec \"$@\"", directory});
        }
        return runProgram(args, {{"QM_DUCT_DIR", daemon_.runtimeDirectory()}, {"QM_LOG_STDERR", "0"}},
                          std::chrono::seconds(30), input);
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
        for (int i = 0; i < 250; ++i, std::this_thread::sleep_for(20ms)) {
            const qm::Value reply = json({"holds"});
            const qm::Value* listed = reply.get("holds");
            holds = listed && listed->asArray() ? *listed->asArray() : qm::Array{};
            if (done(holds)) {
                break;
            }
        }
        return holds;
    }
    std::string uuidOf(const std::string& identifier) {
        qm::Value found = json({"send", R"({"request": "match", "rules": {"VTExtensionIdentifier": ")" + identifier + "\"}}"});
        const qm::Value* matches = found.get("matches");
        const qm::Value* uuid = matches && matches->asArray() && !matches->asArray()->empty()
                                    ? matches->asArray()->front().get("uuid") : nullptr;
        return uuid && uuid->asString() ? *uuid->asString() : "";
    }

    qmtest::TempDir roots_;
    DaemonProcess daemon_{withExamples(roots_)};
};

ProgramResult offline(std::vector<std::string> args) {
    args.insert(args.begin(), QMKIT_BINARY_PATH);
    return runProgram(args, {{"QM_LOG_STDERR", "0"}});
}

qm::Value parseJson(const std::string& text) {
    auto value = qm::json::parse(text);
    EXPECT_TRUE(value.ok()) << text;
    return value.ok() ? *value : qm::Value();
}

bool startsWith(const std::string& text, const std::string& prefix) {
    return prefix.empty() ? text.empty() : text.rfind(prefix, 0) == 0;
}

// Runs without a daemon: help, version and every usage error.
TEST(QmkitUsage, AnswersWithoutADaemon) {
    struct Case {
        std::vector<std::string> args;
        int exitStatus;
        std::string out;  // how standard output starts; empty: nothing
        std::string err;  // how standard error starts; empty: nothing
    };
    const std::string kTooLarge = "is too large (at most 18446744073709551615)\n";
    const Case cases[] = {
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
        {{"send", "{\"flags\": 18446744073709551616}"}, 2, "",
         "qmkit: send: invalid JSON: integer does not fit in 64 bits at line 1, column 11\n"},
        {{"send", "-"}, 2, "", "qmkit: send: invalid JSON: syntax error while parsing value - unexpected end of input"},
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
    for (const Case& c : cases) {
        ProgramResult result = offline(c.args);
        const std::string what = c.args.empty() ? "(no arguments)" : c.args.front() + " ...";
        EXPECT_EQ(result.exitStatus, c.exitStatus) << what << ": " << result.err;
        EXPECT_TRUE(startsWith(result.out, c.out)) << what << ": " << result.out;
        EXPECT_TRUE(startsWith(result.err, c.err)) << what << ": " << result.err;
    }
}

TEST(QmkitUsage, AnUnreachableDaemonExitsThree) {
    qmtest::TempDir scratch;
    ProgramResult result =
        runProgram({QMKIT_BINARY_PATH, "-S", "nobody.qmd", "bulk"}, {{"QM_DUCT_DIR", scratch.path()}, {"QM_LOG_STDERR", "0"}});
    EXPECT_EQ(result.exitStatus, 3);
    EXPECT_EQ(result.err, "qmkit: cannot reach qmd (service \"nobody.qmd\"): cannot connect to " +
                              scratch.file("nobody.qmd") + ": No such file or directory\n");
}

// A service that takes connections and never answers: qmkit gives up after
// its timeout rather than waiting for ever.
TEST(QmkitUsage, ADaemonThatNeverAnswersTimesOut) {
    qmtest::TempDir scratch;
    const std::string path = scratch.file("mute.qmd");
    qm::UniqueFd listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(listener);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    ASSERT_LT(path.size(), sizeof address.sun_path);
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    ASSERT_EQ(::bind(listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listener.get(), 4), 0);

    ProgramResult result = runProgram({QMKIT_BINARY_PATH, "-S", "mute.qmd", "--timeout", "0.2", "bulk"},
                                      {{"QM_DUCT_DIR", scratch.path()}, {"QM_LOG_STDERR", "0"}});
    EXPECT_EQ(result.exitStatus, 3);
    EXPECT_EQ(result.err, "qmkit: no reply within 0.2 s\n");
    EXPECT_EQ(result.out, "");
}

TEST_F(Qmkit, BulkSucceedsQuietlyAndPassesItsFlags) {
    ProgramResult plain = qmkit({"bulk", "--flags", "42"});
    EXPECT_EQ(plain.exitStatus, 0) << plain.err;
    EXPECT_EQ(plain.out, "");
    EXPECT_EQ(plain.err, "");
    EXPECT_TRUE(daemon_.waitForLog("bulk options 0x2a not supported"));

    ProgramResult json = qmkit({"--json", "bulk", "--flags", "0x10"});
    EXPECT_EQ(json.exitStatus, 0) << json.err;
    EXPECT_EQ(parseJson(json.out), qm::Value(qm::Dictionary{}));
    EXPECT_TRUE(daemon_.waitForLog("bulk options 0x10 not supported"));
}

TEST_F(Qmkit, SendAddsTheCurrentVersionOnlyWhenItIsMissing) {
    ProgramResult added = qmkit({"send", "-"}, "{\"request\": \"bulk\",\n \"flags\": 7}\n");
    EXPECT_EQ(added.exitStatus, 0) << added.err;
    EXPECT_EQ(added.out, "{}\n");
    EXPECT_TRUE(daemon_.waitForLog("bulk options 0x7 not supported"));

    ProgramResult kept = qmkit({"send", "{\"request\": \"bulk\", \"version\": 1}"});
    EXPECT_EQ(kept.exitStatus, 1);
    EXPECT_EQ(kept.err, "qmkit: unsupported protocol version 1 (current 3) (code 7)\n");
    EXPECT_EQ(kept.out, "");
}

TEST_F(Qmkit, AnErrorReplyExitsOneWithTheMessageAndCode) {
    ProgramResult plain = qmkit({"send", "{\"request\": \"Add\"}"});
    EXPECT_EQ(plain.exitStatus, 1);
    EXPECT_EQ(plain.err, "qmkit: unrecognized request (code 4)\n");

    ProgramResult json = qmkit({"--json", "send", "{\"request\": \"x-unknown\", \"uuids\": "
                                                  "[{\"$uuid\": \"0d3c1f5e-8a51-4c7e-9f6b-2d7f1e0a9b34\"}]}"});
    EXPECT_EQ(json.exitStatus, 1);
    EXPECT_EQ(json.err, "qmkit: unrecognized request (code 4)\n");
    qm::Value reply = parseJson(json.out);
    EXPECT_EQ(reply, qm::Value(qm::Dictionary{{"errorcode", 4}, {"error", "unrecognized request"}}));
}

TEST_F(Qmkit, ADaemonThatDiesBeforeReplyingExitsThree) {
    ASSERT_EQ(::kill(daemon_.pid(), SIGSTOP), 0);
    std::thread killer([pid = daemon_.pid()] {
        std::this_thread::sleep_for(500ms);
        ::kill(pid, SIGKILL);
    });
    ProgramResult result = qmkit({"bulk"});
    killer.join();
    EXPECT_EQ(result.exitStatus, 3);
    EXPECT_EQ(result.err, "qmkit: connection invalid: daemon closed the connection\n");
}

// Each way a hold ends; the daemon goes last. Relative paths are the
// working directory's: the daemon resolves them in its own.
TEST_F(Qmkit, AHoldLastsUntilReleasedOrInterruptedOrCutOff) {
    struct Case {
        const char* ending;
        int exitStatus;
        std::string err;
    };
    const Case cases[] = {
        {"release", 0, ""},
        {"SIGTERM", 0, ""},
        {"SIGINT", 0, ""},
        {"daemon killed", 3, "qmkit: connection invalid: daemon closed the connection\n"},
    };
    const std::string executable = fs::canonical(QMKIT_BINARY_PATH).string();
    for (const Case& c : cases) {
        ProgramResult held;
        std::thread holder([&] { held = qmkit({"hold", "Notes.app"}, "", roots_.file("system")); });
        qm::Array holds = holdsWhen([](const qm::Array& listed) { return listed.size() == 1; });
        if (holds.size() != 1) {
            holder.join();  // at most runProgram's timeout
            FAIL() << c.ending << ": the hold is not listed; qmkit said: " << held.err;
        }
        const std::string token = *holds[0].get("uuid")->asString();
        const pid_t pid = static_cast<pid_t>(*holds[0].get("pid")->asSigned());
        EXPECT_EQ(holds[0].get("plugins")->asArray()->size(), 4u) << c.ending;
        ProgramResult listed = qmkit({"holds"});
        EXPECT_TRUE(startsWith(listed.out, "TOKEN")) << listed.out;
        for (const std::string& cell : {token, " " + std::to_string(pid) + " ", std::string(" 4 "), "  " + executable + "\n"}) {
            EXPECT_NE(listed.out.find(cell), std::string::npos) << cell << " in " << listed.out;
        }

        if (c.ending == std::string("release")) {
            ProgramResult released = qmkit({"release", token});
            EXPECT_EQ(released.exitStatus, 0) << released.err;
            EXPECT_EQ(released.out, "");
        } else {
            const bool daemon = c.ending == std::string("daemon killed");
            ::kill(daemon ? daemon_.pid() : pid, daemon ? SIGKILL : c.ending == std::string("SIGINT") ? SIGINT : SIGTERM);
        }
        holder.join();
        EXPECT_EQ(held.exitStatus, c.exitStatus) << c.ending << ": " << held.err;
        EXPECT_EQ(held.out, token + "\n") << c.ending;
        EXPECT_EQ(held.err, c.err) << c.ending;
        if (daemon_.running()) {
            EXPECT_TRUE(holdsWhen([](const qm::Array& now) { return now.empty(); }).empty()) << c.ending;
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
    qmtest::TempDir keyless;
    const std::pair<std::string, ProgramResult> verifications[] = {
        {"genuine", qmkit({"token", "verify", token})},
        {"changed", qmkit({"token", "verify", changed})},
        {"no key", runProgram({QMKIT_BINARY_PATH, "token", "verify", token}, {{"QM_DUCT_DIR", keyless.path()}})},
    };
    for (const auto& [what, verified] : verifications) {
        EXPECT_EQ(verified.exitStatus, what == "genuine" ? 0 : 1) << what << ": " << verified.err;
        EXPECT_EQ(verified.out, what == "genuine" ? "read\t" + sharePath + "\n" : "") << what;
    }
    EXPECT_FALSE(fs::exists(keyless.file("token.key"))) << "verifying never creates a key";

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

}  // namespace
