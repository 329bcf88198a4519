#include "ChildProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <utility>

namespace {

std::vector<char*> pointers(std::vector<std::string>& strings) {
    std::vector<char*> out;
    for (auto& s : strings) {
        out.push_back(s.data());
    }
    out.push_back(nullptr);
    return out;
}

}  // namespace

ChildProcess ChildProcess::exec(const std::vector<std::string>& argv,
                                const std::map<std::string, std::string>& environment,
                                const std::string& stderrPath) {
    std::vector<std::string> args = argv;
    std::vector<std::string> env;
    for (const auto& [key, value] : environment) {
        env.push_back(key + "=" + value);
    }
    auto argPointers = pointers(args);
    auto envPointers = pointers(env);
    int errFd = ::open(stderrPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    pid_t pid = ::fork();
    if (pid == 0) {
        if (errFd >= 0) {
            ::dup2(errFd, STDERR_FILENO);
        }
        ::execve(argPointers[0], argPointers.data(), envPointers.data());
        ::_exit(127);
    }
    if (errFd >= 0) {
        ::close(errFd);
    }
    return ChildProcess(pid);
}

ChildProcess ChildProcess::fork(const std::function<void()>& body) {
    pid_t pid = ::fork();
    if (pid == 0) {
        body();
        ::_exit(0);
    }
    return ChildProcess(pid);
}

ChildProcess::ChildProcess(ChildProcess&& other) noexcept : pid_(std::exchange(other.pid_, -1)) {}

ChildProcess::~ChildProcess() {
    if (pid_ > 0) {
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, nullptr, 0);
    }
}

bool ChildProcess::running() {
    if (pid_ <= 0) {
        return false;
    }
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
        pid_ = -1;
        return false;
    }
    return true;
}
