// qmkit end to end: its output and exit statuses against a real qmd.

#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <gtest/gtest.h>

#include <cstring>
#include <thread>

#include "platform/fd/UniqueFd.h"
#include "platform/value/Json.h"
#include "support/DaemonProcess.h"

using qmtest::DaemonProcess;
using qmtest::ProgramResult;
using qmtest::runProgram;

namespace {

using namespace std::chrono_literals;

class Qmkit : public ::testing::Test {
protected:
    ProgramResult qmkit(std::vector<std::string> args, const std::string& input = "") {
        args.insert(args.begin(), {QMKIT_BINARY_PATH, "-S", daemon_.serviceName()});
        return runProgram(args, {{"QM_DUCT_DIR", daemon_.runtimeDirectory()}, {"QM_LOG_STDERR", "0"}},
                          std::chrono::seconds(30), input);
    }

    DaemonProcess daemon_;
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

}  // namespace
