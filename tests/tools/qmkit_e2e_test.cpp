// qmkit end to end: its output and exit statuses against a real qmd.

#include <gtest/gtest.h>

#include <thread>
#include <tuple>

#include "support/DaemonProcess.h"
#include "support/FramePeer.h"

using qmtest::DaemonProcess;
using qmtest::FramePeer;
using qmtest::ProgramResult;
using qmtest::runProgram;

namespace {

ProgramResult offline(std::vector<std::string> args) {
    args.insert(args.begin(), QMKIT_BINARY_PATH);
    return runProgram(args, {{"QM_LOG_STDERR", "0"}});
}

bool startsWith(const std::string& text, const std::string& prefix) {
    return prefix.empty() ? text.empty() : text.rfind(prefix, 0) == 0;
}

// Runs without a daemon: help, version and every usage error.
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
TEST(Qmkit, TheDaemonsRepliesAndRefusals) {
    DaemonProcess daemon;
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
        {{"send", "{\"request\": \"Add\"}"}, "", 1, "", unrecognized},
        {{"--json", "send",
          "{\"request\": \"x-unknown\", \"uuids\": [{\"$uuid\": \"0d3c1f5e-8a51-4c7e-9f6b-2d7f1e0a9b34\"}]}"},
         "",
         1, "{\n  \"error\": \"unrecognized request\",\n  \"errorcode\": 4\n}\n", unrecognized},
    };
    for (Case c : cases) {
        c.args.insert(c.args.begin(), {QMKIT_BINARY_PATH, "-S", daemon.serviceName()});
        ProgramResult result = runProgram(c.args, {{"QM_DUCT_DIR", daemon.runtimeDirectory()}, {"QM_LOG_STDERR", "0"}},
                                          std::chrono::seconds(30), c.input);
        EXPECT_EQ(result.exitStatus, c.exitStatus) << c.args.back();
        EXPECT_EQ(result.out, c.out) << c.args.back();
        EXPECT_EQ(result.err, c.err) << c.args.back();
        EXPECT_TRUE(c.logged.empty() || daemon.waitForLog(c.logged)) << c.logged;
    }
}

}  // namespace
