#pragma once
// A program left running as a child of the test, for tests that look at
// other processes through /proc; killed and reaped when the object goes.

#include <sys/types.h>

#include <string>

namespace qmtest {

class ChildProcess {
public:
    // Starts `program argument` and waits until /proc/<pid>/exe names the
    // program; pid() is -1 when that fails.
    ChildProcess(const std::string& program, const std::string& argument);
    ~ChildProcess() { reap(); }
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

    pid_t pid() const { return pid_; }
    void kill();  // SIGKILL, then waits for the exit; a zombie until reap()
    void reap();

private:
    pid_t pid_ = -1;
    bool reaped_ = false;
};

}  // namespace qmtest
