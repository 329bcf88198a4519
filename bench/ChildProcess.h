#pragma once
// A child process of the benchmark: qmd, or a forked echo server. It is
// killed and reaped when the object goes.

#include <sys/types.h>

#include <functional>
#include <map>
#include <string>
#include <vector>

class ChildProcess {
public:
    // Runs a program with the given environment (replacing the inherited
    // one) and standard error on a file.
    static ChildProcess exec(const std::vector<std::string>& argv, const std::map<std::string, std::string>& environment,
                             const std::string& stderrPath);
    // Runs a function in a forked copy of this process; it must not return.
    // Call it only while this process has no other threads.
    static ChildProcess fork(const std::function<void()>& body);

    ChildProcess(ChildProcess&& other) noexcept;
    ChildProcess& operator=(ChildProcess&&) = delete;
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;
    ~ChildProcess();

    pid_t pid() const { return pid_; }
    bool running();

private:
    explicit ChildProcess(pid_t pid) : pid_(pid) {}
    pid_t pid_ = -1;
};
