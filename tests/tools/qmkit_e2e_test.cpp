// qmkit end to end: its output and exit statuses against a real qmd.

#include <signal.h>

#include <gtest/gtest.h>

#include <thread>

#include "platform/value/Json.h"
#include "support/DaemonProcess.h"

using qmtest::DaemonProcess;
using qmtest::ProgramResult;
using qmtest::runProgram;

namespace {

using namespace std::chrono_literals;

class Qmkit : public ::testing::Test {
protected:
    ProgramResult qmkit(std::vector<std::string> args) {
        args.insert(args.begin(), {QMKIT_BINARY_PATH, "-S", daemon_.serviceName()});
        return runProgram(args, {{"QM_DUCT_DIR", daemon_.runtimeDirectory()}, {"QM_LOG_STDERR", "0"}});
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

TEST(QmkitUsage, HelpForTheToolAndEachCommandExitsZero) {
    ProgramResult tool = offline({"--help"});
    EXPECT_EQ(tool.exitStatus, 0);
    EXPECT_NE(tool.out.find("usage: qmkit"), std::string::npos);
    EXPECT_NE(tool.out.find("bulk"), std::string::npos);
    EXPECT_NE(tool.out.find("send"), std::string::npos);

    ProgramResult bulk = offline({"bulk", "--help"});
    EXPECT_EQ(bulk.exitStatus, 0);
    EXPECT_NE(bulk.out.find("bulk [--flags N]"), std::string::npos);

    ProgramResult send = offline({"send", "--help"});
    EXPECT_EQ(send.exitStatus, 0);
    EXPECT_NE(send.out.find("send JSON"), std::string::npos);
}

TEST(QmkitUsage, BadUsageExitsTwoWithAMessage) {
    struct Case {
        std::vector<std::string> args;
        const char* message;
    };
    const Case cases[] = {
        {{}, "qmkit: no command given"},
        {{"frobnicate"}, "qmkit: unknown command \"frobnicate\""},
        {{"--verbose", "bulk"}, "qmkit: unknown option \"--verbose\""},
        {{"-S"}, "qmkit: -S needs a service name"},
        {{"send"}, "qmkit: send: expected one JSON object"},
        {{"send", "{\"request\": "}, "qmkit: send: invalid JSON: "},
        {{"send", "[\"bulk\"]"}, "qmkit: send: the request must be a JSON object"},
        {{"bulk", "--flags", "lots"}, "qmkit: bulk: flags must be a number, not \"lots\""},
        {{"bulk", "--flags", "0x"}, "qmkit: bulk: flags must be a number"},
        {{"bulk", "--flags"}, "qmkit: bulk: unexpected argument \"--flags\""},
        {{"bulk", "extra"}, "qmkit: bulk: unexpected argument \"extra\""},
    };
    for (const Case& c : cases) {
        ProgramResult result = offline(c.args);
        EXPECT_EQ(result.exitStatus, 2) << c.message;
        EXPECT_EQ(result.err.rfind(c.message, 0), 0u) << result.err;
        EXPECT_TRUE(result.out.empty()) << result.out;
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
    ProgramResult added = qmkit({"send", "{\"request\": \"bulk\", \"flags\": 7}"});
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
