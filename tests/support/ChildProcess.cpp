#include "support/ChildProcess.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>

#include <chrono>
#include <thread>

#include "platform/file/PathFacts.h"
#include "platform/process/ProcessInfo.h"

namespace qmtest {

ChildProcess::ChildProcess(const std::string& program, const std::string& argument) {
    std::string name = program, value = argument;
    char* argv[] = {name.data(), value.data(), nullptr};
    char* envp[] = {nullptr};
    if (::posix_spawn(&pid_, program.c_str(), nullptr, nullptr, argv, envp) != 0) {
        ADD_FAILURE() << "cannot start " << program;
        pid_ = -1;
        return;
    }
    std::string running = qm::resolvedPath(program).ok() ? *qm::resolvedPath(program) : program;
    for (int waited = 0; qm::executablePathOfProcess(pid_) != running; ++waited) {
        if (waited == 5000) {
            ADD_FAILURE() << program << " did not start";
            break;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
}

void ChildProcess::kill() {
    if (pid_ > 0 && !reaped_) {
        ::kill(pid_, SIGKILL);
        siginfo_t info{};
        ::waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOWAIT);
    }
}

void ChildProcess::reap() {
    kill();
    if (pid_ > 0 && !reaped_) {
        ::waitpid(pid_, nullptr, 0);
        reaped_ = true;
    }
}

}  // namespace qmtest
