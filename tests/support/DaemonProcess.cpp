#include "support/DaemonProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <array>
#include <filesystem>

#include "support/Eventually.h"
#include "support/FramePeer.h"

namespace qmtest {

namespace {

// Starts the program with `extra` added to (or replacing) the test's own
// environment, its standard streams on the given descriptors (-1: the test's).
// `passed` descriptors become 3, 4, ... with LISTEN_FDS and LISTEN_PID set, as
// systemd passes sockets; LISTEN_PID, the program's own pid, is set by a
// shell that then execs the program.
pid_t spawn(std::vector<std::string> argv, std::map<std::string, std::string> extra, std::array<int, 3> streams,
            const std::vector<int>& passed = {}) {
    if (!passed.empty()) {
        extra["LISTEN_FDS"] = std::to_string(passed.size());
        argv.insert(argv.begin(), {"/bin/sh", "-c", "LISTEN_PID=$$; export LISTEN_PID; exec \"$@\"", "sh"});
    }
    std::vector<std::string> environment;
    for (const auto& [k, v] : extra) {
        environment.push_back(k + "=" + v);
    }
    for (char** e = environ; *e != nullptr; ++e) {
        if (std::string entry(*e); !extra.contains(entry.substr(0, entry.find('=')))) {
            environment.push_back(entry);
        }
    }
    std::vector<char*> argp, envp;
    for (auto& a : argv) {
        argp.push_back(a.data());
    }
    for (auto& e : environment) {
        envp.push_back(e.data());
    }
    argp.push_back(nullptr);
    envp.push_back(nullptr);
    constexpr int kFirstHighDescriptor = 100;
    std::vector<int> high(passed.size());  // allocated before fork
    const pid_t parent = ::getpid();
    pid_t pid = ::fork();
    if (pid == 0) {
        // Only async-signal-safe calls from here on.
        // A test that crashes takes its daemon with it; a daemon left alive
        // would hold ctest's output pipe open until the test's timeout.
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (::getppid() != parent) {
            ::_exit(127);
        }
        for (int fd = 0; fd < 3; ++fd) {
            if (streams[static_cast<std::size_t>(fd)] >= 0) {
                ::dup2(streams[static_cast<std::size_t>(fd)], fd);
            }
        }
        // Out of the way first, so that moving one to 3 + i never overwrites
        // another still to move.
        for (std::size_t i = 0; i < passed.size(); ++i) {
            high[i] = ::fcntl(passed[i], F_DUPFD, kFirstHighDescriptor);
        }
        for (std::size_t i = 0; i < passed.size(); ++i) {
            ::dup2(high[i], 3 + static_cast<int>(i));  // dup2 clears close-on-exec
            ::close(high[i]);
        }
        ::execve(argp[0], argp.data(), envp.data());
        ::_exit(127);
    }
    return pid;
}

// The wait status once the process has ended, or nothing after the timeout.
std::optional<int> waitPid(pid_t pid, std::chrono::milliseconds timeout) {
    int status = 0;
    pid_t ended = 0;
    eventually([&] { return (ended = ::waitpid(pid, &status, WNOHANG)) != 0; }, timeout);
    return ended == pid ? std::optional(status) : std::nullopt;
}

int openForWriting(const std::string& path) {
    return ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
}

}  // namespace

DaemonProcess::DaemonProcess(std::vector<std::string> arguments, const std::map<std::string, std::string>& environment,
                             std::string serviceName, Launch launch)
    : serviceName_(std::move(serviceName)) {
    std::map<std::string, std::string> env = environment;
    env.merge(std::map<std::string, std::string>{{"QM_DUCT_DIR", scratch_.file("duct")}, {"QM_LOG_STDERR", "1"},
                                                 {"XDG_DATA_HOME", scratch_.file("data")},
                                                 {"XDG_CONFIG_HOME", scratch_.file("config")},
                                                 {"XDG_STATE_HOME", scratch_.file("state")}});
    runtimeDirectory_ = env["QM_DUCT_DIR"];
    logPath_ = scratch_.file("qmd.log");
    arguments.insert(arguments.begin(), {QMD_BINARY_PATH, "-S", serviceName_});
    if (!launch.launcher.empty()) {
        std::string commandLine;
        for (const std::string& argument : arguments) {
            commandLine += (commandLine.empty() ? "" : " ") + argument;
        }
        launch.launcher.push_back(commandLine);
        arguments = std::move(launch.launcher);
    }
    int logFd = openForWriting(logPath_);
    pid_ = spawn(arguments, env, {-1, -1, logFd}, launch.passedSockets);
    ::close(logFd);
    if (!launch.passedSockets.empty()) {
        return;  // peers may connect at once: the passed socket already listens
    }
    eventually([&] { return FramePeer::canConnect(socketPath()) || !running(); }, std::chrono::seconds(20));
    if (!FramePeer::canConnect(socketPath())) {
        ADD_FAILURE() << "qmd did not listen within 20 s, or exited: " << log();
    }
}

DaemonProcess::~DaemonProcess() {
    if (pid_ > 0 && !status_) {
        ::kill(pid_, SIGKILL);
        waitPid(pid_, std::chrono::seconds(10));
    }
}

std::string DaemonProcess::log() const {
    return readFile(logPath_);
}

bool DaemonProcess::waitForLog(const std::string& text, std::chrono::milliseconds timeout) const {
    return eventually([&] { return log().find(text) != std::string::npos; }, timeout);
}

std::optional<int> DaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
    if (!status_) {
        status_ = waitPid(pid_, timeout);
    }
    return status_;
}

bool DaemonProcess::running() {
    return !waitForExit(std::chrono::milliseconds(0));
}

std::size_t DaemonProcess::openDescriptorCount() const {
    std::error_code error;  // a daemon that is gone has none
    auto entries = std::filesystem::directory_iterator("/proc/" + std::to_string(pid_) + "/fd", error);
    return static_cast<std::size_t>(std::distance(entries, std::filesystem::directory_iterator()));
}

std::map<std::string, std::string> exampleApplications(const TempDir& roots) {
    std::filesystem::copy(std::string(QM_SOURCE_DIR) + "/examples/Applications", roots.file("system"),
                          std::filesystem::copy_options::recursive);
    return {{"QM_SYSTEM_ROOTS", roots.file("system")}, {"QM_SDK_PATH", std::string(QM_SOURCE_DIR) + "/examples/SDKs"}};
}

RunningProgram::RunningProgram(const std::vector<std::string>& argv, const std::map<std::string, std::string>& environment,
                               const std::string& standardInput)
    : program_(argv.at(0)) {
    writeFile(scratch_.file("in"), standardInput);
    int in = ::open(scratch_.file("in").c_str(), O_RDONLY | O_CLOEXEC);
    int out = openForWriting(scratch_.file("out"));
    int err = openForWriting(scratch_.file("err"));
    pid_ = spawn(argv, environment, {in, out, err});
    for (int fd : {in, out, err}) {
        ::close(fd);
    }
}

RunningProgram::~RunningProgram() {
    if (pid_ > 0 && !result_) {
        ::kill(pid_, SIGKILL);
        waitPid(pid_, std::chrono::seconds(5));
    }
}

void RunningProgram::signal(int number) const {
    EXPECT_GT(pid_, 0) << program_ << " is not running";
    if (pid_ > 0 && !result_) {
        ::kill(pid_, number);
    }
}

ProgramResult RunningProgram::wait(std::chrono::milliseconds timeout) {
    if (result_ || pid_ <= 0) {
        return result_.value_or(ProgramResult{});
    }
    auto status = waitPid(pid_, timeout);
    if (!status) {
        ::kill(pid_, SIGKILL);
        waitPid(pid_, std::chrono::seconds(5));
        ADD_FAILURE() << program_ << " did not finish in time";
    }
    result_.emplace();
    if (status && WIFEXITED(*status)) {
        result_->exitStatus = WEXITSTATUS(*status);
    }
    result_->out = readFile(scratch_.file("out"));
    result_->err = readFile(scratch_.file("err"));
    return *result_;
}

ProgramResult runProgram(const std::vector<std::string>& argv, const std::map<std::string, std::string>& environment,
                         std::chrono::milliseconds timeout, const std::string& standardInput) {
    return RunningProgram(argv, environment, standardInput).wait(timeout);
}

}  // namespace qmtest
