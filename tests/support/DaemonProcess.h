#pragma once
// Starts a real qmd in a private runtime directory, with its log on a file,
// for end-to-end tests. The daemon is killed when the object goes.

#include <sys/types.h>

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "support/TempDir.h"

namespace qmtest {

class DaemonProcess {
public:
    // `arguments` follow the program name and -S; `environment` is added to
    // (or replaces) the test's own.
    struct Launch {
        // Run instead of the daemon (a tracer such as `bpftrace ... -c`), with
        // the daemon's command line as its last argument, in one string;
        // pid() is then the launcher's.
        std::vector<std::string> launcher;
        // Given to the daemon as systemd socket activation passes them
        // (descriptors 3, 4, ..., LISTEN_FDS, LISTEN_PID); the constructor
        // then does not wait for a socket of the daemon's own.
        std::vector<int> passedSockets;
    };
    explicit DaemonProcess(std::vector<std::string> arguments = {}, const std::map<std::string, std::string>& environment = {},
                           std::string serviceName = "qmtest.qmd", Launch launch = {});
    ~DaemonProcess();
    DaemonProcess(const DaemonProcess&) = delete;
    DaemonProcess& operator=(const DaemonProcess&) = delete;

    pid_t pid() const { return pid_; }
    const std::string& runtimeDirectory() const { return runtimeDirectory_; }
    std::string socketPath() const { return runtimeDirectory_ + "/" + serviceName_; }
    const std::string& serviceName() const { return serviceName_; }
    // A file in the daemon's private folder (its XDG_* homes live there).
    std::string scratchPath(const std::string& name) const { return scratch_.file(name); }

    // What the daemon wrote to standard error so far (its log, QM_LOG_STDERR=1).
    std::string log() const;
    // Waits until the log holds the text; true when it does.
    bool waitForLog(const std::string& text, std::chrono::milliseconds timeout = std::chrono::seconds(5)) const;
    // Waits for the process to exit; its wait status, or nothing on timeout.
    std::optional<int> waitForExit(std::chrono::milliseconds timeout);
    bool running();
    // Open descriptors of the daemon (entries of /proc/<pid>/fd).
    std::size_t openDescriptorCount() const;

private:
    TempDir scratch_;
    std::string runtimeDirectory_;
    std::string serviceName_;
    std::string logPath_;
    pid_t pid_ = -1;
    std::optional<int> status_;
};

// Copies the example applications to <roots>/system; the environment of a
// daemon that catalogs them, with the example SDKs.
std::map<std::string, std::string> exampleApplications(const TempDir& roots);

// A program's exit status and captured output.
struct ProgramResult {
    int exitStatus = -1;  // -1 when killed by a signal
    std::string out;
    std::string err;
};

// A program started with the given standard input and left running, its
// output going to files; killed and reaped when the object goes unwaited.
class RunningProgram {
public:
    RunningProgram(const std::vector<std::string>& argv, const std::map<std::string, std::string>& environment = {},
                   const std::string& standardInput = "");
    ~RunningProgram();
    RunningProgram(const RunningProgram&) = delete;
    RunningProgram& operator=(const RunningProgram&) = delete;

    // The child's pid (-1 when it could not start); a program it execs keeps it.
    pid_t pid() const { return pid_; }
    // Signals the child while it runs; never any other process.
    void signal(int number) const;
    std::string outputSoFar() const { return readFile(scratch_.file("out")); }
    // Waits for the exit (killing the program after the timeout, a test failure).
    ProgramResult wait(std::chrono::milliseconds timeout = std::chrono::seconds(30));

private:
    TempDir scratch_;
    std::string program_;
    pid_t pid_ = -1;
    std::optional<ProgramResult> result_;
};

// Runs a program to completion.
ProgramResult runProgram(const std::vector<std::string>& argv, const std::map<std::string, std::string>& environment = {},
                         std::chrono::milliseconds timeout = std::chrono::seconds(30),
                         const std::string& standardInput = "");

}  // namespace qmtest
