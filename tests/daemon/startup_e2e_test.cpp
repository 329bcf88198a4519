// Starting qmd: its command line, its claim on the service name, socket
// activation and the idle exit.

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <thread>

#include "support/DaemonProcess.h"
#include "support/FramePeer.h"

using qmtest::DaemonOptions;
using qmtest::DaemonProcess;
using qmtest::FramePeer;
using qmtest::bulk;
using qmtest::runProgram;

namespace {

const char kUsage[] = "Usage: qmd [-S servicename] [-v]\n";

TEST(Startup, BadCommandLinesPrintTheUsageAndExitTwo) {
    qmtest::TempDir dir;
    std::map<std::string, std::string> env = {{"QM_DUCT_DIR", dir.file("duct")}};
    for (auto args : std::vector<std::vector<std::string>>{{"extra"}, {"-x"}, {"-S"}, {"-v", "-d"}, {"-v", "--", "x"}}) {
        args.insert(args.begin(), QMD_BINARY_PATH);
        auto result = runProgram(args, env);
        EXPECT_EQ(result.exitStatus, 2) << args[1];
        ASSERT_GE(result.err.size(), sizeof kUsage - 1);
        // getopt's own diagnostic may come first; the usage line closes it exactly.
        EXPECT_EQ(result.err.substr(result.err.size() - (sizeof kUsage - 1)), kUsage) << args[1];
    }
    auto unknown = runProgram({QMD_BINARY_PATH, "-x"}, env);
    EXPECT_NE(unknown.err.find("invalid option"), std::string::npos) << unknown.err;
}

TEST(Startup, AServiceNameItCannotClaimEndsTheDaemonWithStatusOne) {
    qmtest::TempDir dir;
    std::map<std::string, std::string> env = {{"QM_DUCT_DIR", dir.file("duct")}, {"QM_LOG_STDERR", "1"}};
    for (const char* name : {"", "a/b"}) {
        auto result = runProgram({QMD_BINARY_PATH, "-S", name}, env);
        EXPECT_EQ(result.exitStatus, 1) << name;
        EXPECT_NE(result.err.find("unable to construct server"), std::string::npos) << result.err;
    }
    // A runtime directory that is a file cannot be used.
    qmtest::writeFile(dir.file("notadir"), "x");
    auto result = runProgram({QMD_BINARY_PATH}, {{"QM_DUCT_DIR", dir.file("notadir")}, {"QM_LOG_STDERR", "1"}});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_NE(result.err.find("is not a directory"), std::string::npos) << result.err;
}

TEST(Startup, TheRuntimeDirectoryAndSocketArePrivate) {
    DaemonProcess daemon;
    struct stat dirInfo{};
    struct stat sockInfo{};
    ASSERT_EQ(::stat(daemon.runtimeDirectory().c_str(), &dirInfo), 0);
    ASSERT_EQ(::stat(daemon.socketPath().c_str(), &sockInfo), 0);
    EXPECT_EQ(dirInfo.st_mode & 07777, 0700u);
    EXPECT_EQ(sockInfo.st_mode & 07777, 0600u);
    EXPECT_TRUE(S_ISSOCK(sockInfo.st_mode));
}

TEST(Startup, ASecondDaemonOnTheSameNameLeavesTheFirstAlone) {
    DaemonProcess first;
    auto result = runProgram({QMD_BINARY_PATH, "-S", first.serviceName()},
                             {{"QM_DUCT_DIR", first.runtimeDirectory()}, {"QM_LOG_STDERR", "1"}});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_NE(result.err.find("service already running"), std::string::npos) << result.err;
    FramePeer client(first.socketPath());
    EXPECT_TRUE(client.roundTrip(bulk()));
}

TEST(Startup, AStaleSocketFileIsReplaced) {
    qmtest::TempDir dir;
    std::string duct = dir.file("duct");
    ASSERT_EQ(::mkdir(duct.c_str(), 0700), 0);
    std::string path = duct + "/stale.qmd";
    FramePeer::listenAt(path);  // closed at once: nobody answers there
    DaemonOptions options = qmtest::withEnvironment({{"QM_DUCT_DIR", duct}});
    options.serviceName = "stale.qmd";
    DaemonProcess daemon(options);
    FramePeer client(path);
    EXPECT_TRUE(client.roundTrip(bulk()));
}

TEST(Startup, ASocketPassedByTheServiceManagerIsUsed) {
    qmtest::TempDir dir;
    std::string path = dir.file("activated.sock");
    qm::UniqueFd listener = FramePeer::listenAt(path);
    std::string duct = dir.file("duct");
    pid_t pid = ::fork();
    if (pid == 0) {
        ::dup2(::dup(listener.get()), 3);  // the copy drops close-on-exec, even were the listener fd 3
        std::string pidText = std::to_string(::getpid());
        ::setenv("LISTEN_FDS", "1", 1);
        ::setenv("LISTEN_PID", pidText.c_str(), 1);
        ::setenv("QM_DUCT_DIR", duct.c_str(), 1);
        ::execl(QMD_BINARY_PATH, QMD_BINARY_PATH, "-S", "activated.qmd", static_cast<char*>(nullptr));
        ::_exit(127);
    }
    listener.reset();
    FramePeer client(path);
    auto reply = client.roundTrip(bulk());
    EXPECT_TRUE(reply);
    // It did not claim a socket of its own.
    EXPECT_FALSE(FramePeer::canConnect(duct + "/activated.qmd"));
    ::kill(pid, SIGKILL);
    ::waitpid(pid, nullptr, 0);
}

TEST(Startup, AnIdleDaemonExitsButNotUnderAConnectedClient) {
    DaemonProcess daemon(qmtest::withEnvironment({{"QM_IDLE_EXIT", "1"}}));
    {
        FramePeer client(daemon.socketPath());
        ASSERT_TRUE(client.roundTrip(bulk()));
        std::this_thread::sleep_for(std::chrono::milliseconds(2500));
        EXPECT_TRUE(daemon.running());
        EXPECT_TRUE(client.roundTrip(bulk()));
    }
    auto status = daemon.waitForExit(std::chrono::seconds(5));
    ASSERT_TRUE(status);
    EXPECT_TRUE(WIFEXITED(*status));
    EXPECT_EQ(WEXITSTATUS(*status), 0);
}

}  // namespace
