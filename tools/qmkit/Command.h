#pragma once
// qmkit's subcommands. Each lives in its own file and registers itself with a
// static QmkitCommandRegistration, so adding one touches no other file.
//
// Exit statuses shared by every subcommand.

#include <chrono>
#include <string>
#include <vector>

enum QmkitExit : int {
    kQmkitOk = 0,
    kQmkitDaemonError = 1,  // the daemon (or the model, offline) answered an error
    kQmkitUsage = 2,
    kQmkitUnreachable = 3,  // the daemon cannot be reached
};

struct QmkitGlobalOptions {
    std::string serviceName = "ovaro.quamber.qmd";  // -S
    bool json = false;                              // --json
    // --timeout: bounds connecting, sending and waiting for the reply; the
    // text as given, for messages.
    std::chrono::milliseconds timeout{30000};
    std::string timeoutText = "30";
};

struct QmkitCommand {
    const char* name;
    const char* synopsis;  // one line for `qmkit --help`
    // Runs with the arguments after the subcommand's name; returns an exit status.
    int (*run)(const std::vector<std::string>& args, const QmkitGlobalOptions& options);
    // Writes the subcommand's --help text to standard output.
    void (*help)();
};

const std::vector<QmkitCommand>& qmkitCommands();

// Writes "qmkit: <command>: <message>" and where to find the command's help
// on standard error; returns kQmkitUsage.
int commandUsageError(const std::string& command, const std::string& message);

struct QmkitCommandRegistration {
    explicit QmkitCommandRegistration(const QmkitCommand& command);
};
