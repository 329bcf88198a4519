#include "support/DaemonProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <filesystem>
#include <thread>

#include "support/FramePeer.h"

namespace qmtest {

namespace {

using Clock = std::chrono::steady_clock;

std::vector<std::string> mergedEnvironment(const std::map<std::string, std::string>& extra) {
    std::map<std::string, std::string> all;
    for (char** e = environ; *e != nullptr; ++e) {
        std::string entry(*e);
        auto eq = entry.find('=');
        if (eq != std::string::npos) {
            all[entry.substr(0, eq)] = entry.substr(eq + 1);
        }
    }
    for (const auto& [k, v] : extra) {
        all[k] = v;
    }
    std::vector<std::string> out;
    for (const auto& [k, v] : all) {
        out.push_back(k + "=" + v);
    }
    return out;
}

std::vector<char*> pointers(std::vector<std::string>& strings) {
    std::vector<char*> out;
    for (auto& s : strings) {
        out.push_back(s.data());
    }
    out.push_back(nullptr);
    return out;
}

std::optional<int> waitPid(pid_t pid, std::chrono::milliseconds timeout) {
    auto deadline = Clock::now() + timeout;
    for (;;) {
        int status = 0;
        pid_t r = ::waitpid(pid, &status, WNOHANG);
        if (r == pid) {
            return status;
        }
        if (r < 0 || Clock::now() > deadline) {
            return std::nullopt;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
}

}  // namespace

DaemonProcess::DaemonProcess(DaemonOptions options) : serviceName_(options.serviceName) {
    runtimeDirectory_ = scratch_.file("duct");
    logPath_ = scratch_.file("qmd.log");
    std::map<std::string, std::string> env = {
        {"QM_DUCT_DIR", runtimeDirectory_},
        {"QM_LOG_STDERR", "1"},
        {"XDG_DATA_HOME", scratch_.file("data")},
        {"XDG_CONFIG_HOME", scratch_.file("config")},
        {"XDG_STATE_HOME", scratch_.file("state")},
    };
    for (const auto& [k, v] : options.environment) {
        env[k] = v;
    }
    runtimeDirectory_ = env["QM_DUCT_DIR"];
    std::vector<std::string> argv = {QMD_BINARY_PATH, "-S", serviceName_};
    argv.insert(argv.end(), options.arguments.begin(), options.arguments.end());
    auto envStrings = mergedEnvironment(env);
    auto argvPointers = pointers(argv);
    auto envPointers = pointers(envStrings);

    int logFd = ::open(logPath_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    EXPECT_GE(logFd, 0);
    pid_ = ::fork();
    if (pid_ == 0) {
        ::dup2(logFd, STDERR_FILENO);
        ::execve(argvPointers[0], argvPointers.data(), envPointers.data());
        ::_exit(127);
    }
    ::close(logFd);
    auto deadline = Clock::now() + std::chrono::seconds(10);
    while (Clock::now() < deadline) {
        if (FramePeer::canConnect(socketPath())) {
            return;
        }
        if (!running()) {
            ADD_FAILURE() << "qmd exited during start-up: " << log();
            return;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    ADD_FAILURE() << "qmd did not listen within 10 s: " << log();
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
    auto deadline = Clock::now() + timeout;
    do {
        if (log().find(text) != std::string::npos) {
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    } while (Clock::now() < deadline);
    return false;
}

std::optional<int> DaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
    if (!status_) {
        status_ = waitPid(pid_, timeout);
    }
    return status_;
}

bool DaemonProcess::running() {
    if (status_) {
        return false;
    }
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
        status_ = status;
        return false;
    }
    return true;
}

std::size_t DaemonProcess::openDescriptorCount() const {
    std::size_t count = 0;
    std::error_code error;
    for (auto it = std::filesystem::directory_iterator("/proc/" + std::to_string(pid_) + "/fd", error);
         it != std::filesystem::directory_iterator(); ++it) {
        ++count;
    }
    return count;
}

ProgramResult runProgram(const std::vector<std::string>& argvIn, const std::map<std::string, std::string>& environment,
                         std::chrono::milliseconds timeout, const std::string& standardInput) {
    TempDir scratch;
    std::string inPath = scratch.file("in");
    std::string outPath = scratch.file("out");
    std::string errPath = scratch.file("err");
    writeFile(inPath, standardInput);
    auto argv = argvIn;
    auto envStrings = mergedEnvironment(environment);
    auto argvPointers = pointers(argv);
    auto envPointers = pointers(envStrings);
    pid_t pid = ::fork();
    if (pid == 0) {
        int out = ::open(outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int err = ::open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int in = ::open(inPath.c_str(), O_RDONLY);
        ::dup2(out, STDOUT_FILENO);
        ::dup2(err, STDERR_FILENO);
        ::dup2(in, STDIN_FILENO);
        ::execve(argvPointers[0], argvPointers.data(), envPointers.data());
        ::_exit(127);
    }
    ProgramResult result;
    auto status = waitPid(pid, timeout);
    if (!status) {
        ::kill(pid, SIGKILL);
        waitPid(pid, std::chrono::seconds(5));
        ADD_FAILURE() << argv[0] << " did not finish in time";
    } else if (WIFEXITED(*status)) {
        result.exitStatus = WEXITSTATUS(*status);
    }
    result.out = readFile(outPath);
    result.err = readFile(errPath);
    return result;
}

}  // namespace qmtest
