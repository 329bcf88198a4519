// Starting qmd: its command line, its claim on the service name, socket
// activation and the idle exit.

#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <csignal>
#include <thread>
#include <tuple>

#include "support/DaemonProcess.h"
#include "support/FramePeer.h"

using qmtest::DaemonProcess;
using qmtest::FramePeer;
using qmtest::bulk;
using qmtest::runProgram;

namespace {

// Bad usage prints the usage line last (getopt's own diagnostic may come
// first) and exits 2; --help and --version only as the only argument.
TEST(Startup, TheCommandLine) {
    const std::string usage = "Usage: qmd [-S servicename] [-v]\n";
    const std::tuple<std::vector<std::string>, int, std::string, std::string> cases[] = {
        {{"extra"}, 2, "", usage}, {{"-x"}, 2, "", "invalid option -- 'x'\n" + usage}, {{"-S"}, 2, "", usage},
        {{"-v", "-d"}, 2, "", usage}, {{"-v", "--", "x"}, 2, "", usage}, {{"--version", "-v"}, 2, "", usage},
        {{"--version"}, 0, std::string("qmd ") + QM_VERSION + "\n", ""},
        {{"--help"}, 0, "  -S name   the service name to listen on\n", ""},
    };
    for (auto [args, exitStatus, out, err] : cases) {
        args.insert(args.begin(), QMD_BINARY_PATH);
        auto result = runProgram(args, {{"QM_DUCT_DIR", "/nonexistent"}});
        EXPECT_EQ(result.exitStatus, exitStatus) << args[1];
        EXPECT_NE(result.out.find(out), std::string::npos) << result.out;
        EXPECT_TRUE(result.err.ends_with(err)) << result.err;
    }
}

// Every refusal at start names its cause on standard error (no QM_LOG_STDERR
// here) and exits 1; a runtime directory is refused, never changed.
TEST(Startup, RefusalsAtStartNameTheirCauseAndChangeNothing) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("notadir"), "x");
    for (mode_t mode : {0755, 01777, 0710}) {
        std::string path = dir.file("mode" + std::to_string(mode));
        ASSERT_EQ(::mkdir(path.c_str(), 0700), 0);
        ASSERT_EQ(::chmod(path.c_str(), mode), 0);
    }
    // {arguments, environment, what standard error says}
    std::string duct = dir.file("duct");
    std::vector<std::tuple<std::vector<std::string>, std::map<std::string, std::string>, std::string>> cases = {
        {{"-S", ""}, {{"QM_DUCT_DIR", duct}}, "invalid service name"},
        {{"-S", "a/b"}, {{"QM_DUCT_DIR", duct}}, "invalid service name"},
        {{}, {{"QM_DUCT_DIR", dir.file("notadir")}}, "is not a directory"},
        {{}, {{"QM_DUCT_DIR", dir.file("mode493")}}, dir.file("mode493") + " has mode 0755"},
        {{}, {{"QM_DUCT_DIR", dir.file("mode1023")}}, dir.file("mode1023") + " has mode 1777"},
        {{}, {{"QM_DUCT_DIR", dir.file("mode456")}}, "has mode 0710"},
    };
    for (const char* idle : {"abc", "0", "-5", " 5", "99999999999"}) {
        cases.push_back({{}, {{"QM_DUCT_DIR", duct}, {"QM_IDLE_EXIT", idle}}, "QM_IDLE_EXIT"});
    }
    for (const auto& [arguments, environment, says] : cases) {
        std::vector<std::string> argv{QMD_BINARY_PATH};
        argv.insert(argv.end(), arguments.begin(), arguments.end());
        auto result = runProgram(argv, environment);
        EXPECT_EQ(result.exitStatus, 1) << says;
        EXPECT_NE(result.err.find(says), std::string::npos) << result.err;
        EXPECT_NE(result.err.find("unable to construct server"), std::string::npos) << result.err;
    }
    for (mode_t mode : {0755, 01777, 0710}) {
        struct stat info{};
        ASSERT_EQ(::stat(dir.file("mode" + std::to_string(mode)).c_str(), &info), 0);
        EXPECT_EQ(info.st_mode & 07777, mode) << "the runtime directory was changed";
    }
}

TEST(Startup, TheServiceIsPrivateAndASecondDaemonOnItsNameLeavesTheFirstAlone) {
    DaemonProcess first;
    struct stat dirInfo{};
    struct stat sockInfo{};
    ASSERT_EQ(::stat(first.runtimeDirectory().c_str(), &dirInfo), 0);
    ASSERT_EQ(::stat(first.socketPath().c_str(), &sockInfo), 0);
    EXPECT_EQ(dirInfo.st_mode & 07777, 0700u);
    EXPECT_EQ(sockInfo.st_mode & 07777, 0600u);
    EXPECT_TRUE(S_ISSOCK(sockInfo.st_mode));
    auto result = runProgram({QMD_BINARY_PATH, "-S", first.serviceName()},
                             {{"QM_DUCT_DIR", first.runtimeDirectory()}, {"QM_LOG_STDERR", "1"}});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_NE(result.err.find("service already running on " + first.socketPath()), std::string::npos) << result.err;
    EXPECT_TRUE(FramePeer(first.socketPath()).roundTrip(bulk()));
}

TEST(Startup, AStaleSocketFileIsReplaced) {
    qmtest::TempDir dir;
    std::string duct = dir.file("duct");
    ASSERT_EQ(::mkdir(duct.c_str(), 0700), 0);
    std::string path = duct + "/stale.qmd";
    FramePeer::listenAt(path);  // closed at once: nobody answers there
    DaemonProcess daemon({}, {{"QM_DUCT_DIR", duct}}, "stale.qmd");
    FramePeer client(path);
    EXPECT_TRUE(client.roundTrip(bulk()));
}

// As systemd passes it: the daemon serves the first socket, claims none of
// its own, closes the extra ones, and leaves the socket file on SIGTERM for
// the next activation.
TEST(Startup, ASocketPassedByTheServiceManagerIsServedAndOutlivesTheDaemon) {
    qmtest::TempDir dir;
    std::string path = dir.file("activated.sock");
    DaemonProcess daemon({}, {}, "activated.qmd",
                         {.launcher = {}, .passedSockets = {FramePeer::listenAt(path).get(), FramePeer::listenAt(dir.file("extra.sock")).get()}});
    FramePeer client(path);
    EXPECT_TRUE(client.roundTrip(bulk()));
    EXPECT_FALSE(FramePeer::canConnect(daemon.socketPath()));
    EXPECT_FALSE(FramePeer::canConnect(dir.file("extra.sock")));
    EXPECT_NE(daemon.log().find("ignoring descriptor 4"), std::string::npos) << daemon.log();

    ::kill(daemon.pid(), SIGTERM);
    auto status = daemon.waitForExit(std::chrono::seconds(10));
    ASSERT_TRUE(status);
    EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 0) << daemon.log();
    struct stat info{};
    EXPECT_EQ(::stat(path.c_str(), &info), 0) << "the passed socket's file was removed";
    EXPECT_TRUE(S_ISSOCK(info.st_mode));
}

// A passed descriptor that cannot serve, or a runtime directory that is not
// private, ends the start with a line that names the cause.
TEST(Startup, APassedSocketThatCannotServeIsRefused) {
    qmtest::TempDir dir;
    std::string openDuct = dir.file("open");
    ASSERT_EQ(::mkdir(openDuct.c_str(), 0700), 0);
    ASSERT_EQ(::chmod(openDuct.c_str(), 0755), 0);
    sockaddr_in loopback{};
    loopback.sin_family = AF_INET;
    loopback.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    qm::UniqueFd tcp(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_EQ(::bind(tcp.get(), reinterpret_cast<const sockaddr*>(&loopback), sizeof loopback), 0);
    ASSERT_EQ(::listen(tcp.get(), 1), 0);
    const std::string notServing = "is not a listening Unix-domain stream socket";
    // {descriptor, runtime directory (empty: the daemon's own), what the log says}
    const std::tuple<qm::UniqueFd, std::string, std::string> cases[] = {
        {qm::UniqueFd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)), "", notServing},
        {qm::UniqueFd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)), "", notServing},
        {std::move(tcp), "", notServing},
        {FramePeer::listenAt(dir.file("good.sock")), openDuct, "has mode 0755"},
    };
    for (const auto& [fd, duct, says] : cases) {
        DaemonProcess daemon({}, duct.empty() ? std::map<std::string, std::string>{} : std::map<std::string, std::string>{{"QM_DUCT_DIR", duct}},
                             "refused.qmd", {.launcher = {}, .passedSockets = {fd.get()}});
        auto status = daemon.waitForExit(std::chrono::seconds(10));
        ASSERT_TRUE(status) << says;
        EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 1) << says;
        EXPECT_NE(daemon.log().find(says), std::string::npos) << daemon.log();
        EXPECT_NE(daemon.log().find("unable to construct server"), std::string::npos) << daemon.log();
    }
}

// The daemon ends in order: exit 0, one line, its own socket removed.
void expectOrderlyExit(DaemonProcess& daemon, const std::string& line) {
    auto status = daemon.waitForExit(std::chrono::seconds(10));
    ASSERT_TRUE(status);
    EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 0) << *status;
    EXPECT_NE(daemon.log().find(line), std::string::npos) << daemon.log();
    struct stat info{};
    EXPECT_NE(::stat(daemon.socketPath().c_str(), &info), 0) << "socket left behind";
}

TEST(Startup, TerminationSignalsEndTheDaemonInOrder) {
    for (auto [signal, name] : {std::pair{SIGTERM, "SIGTERM"}, std::pair{SIGINT, "SIGINT"}}) {
        DaemonProcess daemon({"-v"});
        EXPECT_TRUE(daemon.waitForLog("listening on " + daemon.socketPath()));
        FramePeer client(daemon.socketPath());
        ASSERT_TRUE(client.roundTrip(bulk()));
        ::kill(daemon.pid(), signal);
        expectOrderlyExit(daemon, std::string("exiting on ") + name);
    }
}

TEST(Startup, AnIdleDaemonExitsButNotUnderAConnectedClient) {
    DaemonProcess daemon({}, {{"QM_IDLE_EXIT", "1"}});
    {
        FramePeer client(daemon.socketPath());
        ASSERT_TRUE(client.roundTrip(bulk()));
        std::this_thread::sleep_for(std::chrono::milliseconds(2500));
        EXPECT_TRUE(daemon.running());
        EXPECT_TRUE(client.roundTrip(bulk()));
    }
    expectOrderlyExit(daemon, "idle for 1 seconds: exiting");
}

}  // namespace
