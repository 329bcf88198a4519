// qmkit hold PATH... [--flags N]: takes a hold and keeps it while qmkit runs.
//
// The daemon keeps a hold only as long as the connection that took it, so
// qmkit stays connected and waits, on the main thread's event loop, for one
// of: SIGINT or SIGTERM (exit 0, nothing more printed); the token released by
// anyone (exit 0), seen by asking "holds" after each change notification,
// which the daemon posts for every hold taken or released; the connection
// lost (exit 3).

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <set>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "ChangeWatch.h"
#include "Command.h"
#include "DaemonSession.h"
#include "NumberOptions.h"
#include "ReplyFormat.h"
#include "platform/env/Environment.h"
#include "platform/process/TerminationSignals.h"
#include "platform/queue/EventLoop.h"
#include "protocol/WireKeys.h"

namespace {

constexpr const char* kHoldsChanged = wire::kAnnotationChangeNotification;
constexpr std::uint64_t kHoldApplications = 1;

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] hold PATH... [--flags N]\n"
        "\n"
        "Takes a hold on plug-ins, which keeps them out of discovery and out of\n"
        "\"ready\" while it lasts, prints its token (with --json the reply,\n"
        "{\"uuids\": token}) and keeps it until interrupted (SIGINT or SIGTERM) or\n"
        "until the token is released by anyone ('qmkit release TOKEN'); then it\n"
        "exits 0. A hold lives only as long as the connection that took it: the\n"
        "daemon drops it when qmkit exits, and qmkit exits 3 when the connection\n"
        "is lost.\n"
        "\n"
        "  --flags N   what the paths name: 1 applications (every plug-in inside\n"
        "              them, refused while one of them runs; the default), 2\n"
        "              plug-in bundles. Sent as given (decimal or 0x-hex).\n"
        "\n"
        "Relative paths are taken from the working directory.\n",
        stdout);
}

struct HoldArguments {
    std::vector<std::string> paths;  // absolute
    std::uint64_t flags = kHoldApplications;
};

// Nothing when the arguments are bad; the usage error is already printed.
std::optional<HoldArguments> parseArguments(const std::vector<std::string>& args, int& status) {
    HoldArguments parsed;
    std::string workingDirectory;
    for (std::size_t i = 0; i < args.size(); ++i) {
        const std::string& arg = args[i];
        if (arg == "--flags") {
            auto flags = i + 1 < args.size() ? parseUnsignedOption(arg, args[++i])
                                             : qm::Result<std::uint64_t, std::string>("--flags needs a number");
            if (!flags) {
                status = commandUsageError("hold", flags.error());
                return std::nullopt;
            }
            parsed.flags = *flags;
        } else if (arg.empty() || arg.starts_with("--")) {
            status = commandUsageError("hold", arg.empty() ? "empty path" : "unknown option \"" + arg + "\"");
            return std::nullopt;
        } else if (arg.front() == '/') {
            parsed.paths.push_back(arg);
        } else {
            if (workingDirectory.empty()) {
                std::unique_ptr<char, decltype(&std::free)> cwd(::getcwd(nullptr, 0), &std::free);
                if (!cwd) {
                    status = commandUsageError("hold", "cannot resolve \"" + arg + "\": no working directory");
                    return std::nullopt;
                }
                workingDirectory = cwd.get();
            }
            parsed.paths.push_back(workingDirectory + (workingDirectory.ends_with('/') ? "" : "/") + arg);
        }
    }
    if (parsed.paths.empty()) {
        status = commandUsageError("hold", "expected one or more paths");
        return std::nullopt;
    }
    return parsed;
}

void printError(const std::string& message) {
    std::fprintf(stderr, "qmkit: hold: %s\n", message.c_str());
}

// Whether the daemon still lists the hold; an exit status when it cannot tell.
qm::Result<bool, int> isListed(DaemonSession& session, const qm::Uuid& token) {
    auto reply = session.ask([](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
        client.send(client.request("holds"), std::move(handler));
    });
    if (!reply) {
        return reply.error();
    }
    const qm::Value* holds = reply->get("holds");
    if (!holds || !holds->asArray()) {
        printError("the \"holds\" reply holds no list");
        return int{kQmkitDaemonError};
    }
    return std::any_of(holds->asArray()->begin(), holds->asArray()->end(), [&](const qm::Value& hold) {
        const qm::Value* uuid = hold.get("uuid");
        return uuid && uuid->asUuid() == token;
    });
}

// Runs the loop until the hold ends; the exit status. The loop must outlive
// the session's client, whose connection events post to it.
int waitForTheEnd(DaemonSession& session, const qm::Uuid& token, qm::EventLoop& loop) {
    return followChanges(session, loop, "hold", [&](const std::set<std::string>& changed) -> std::optional<int> {
        if (!changed.empty() && !changed.contains(kHoldsChanged)) {
            return std::nullopt;
        }
        auto listed = isListed(session, token);
        if (!listed) {
            return listed.error();
        }
        return *listed ? std::nullopt : std::optional<int>(kQmkitOk);
    });
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    int status = kQmkitOk;
    auto arguments = parseArguments(args, status);
    if (!arguments) {
        return status;
    }
    // Before the client starts its threads, which inherit the mask: the
    // signals then reach only the loop's signalfd. Until the loop runs they
    // wait, at most the --timeout of the requests before it.
    qm::blockTerminationSignals();
    auto loop = qm::EventLoop::create();
    if (!loop) {
        printError("cannot wait: " + loop.error().text());
        return kQmkitUnreachable;
    }
    DaemonSession session(options);
    auto granted = session.ask([&](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
        client.holdPlugins(arguments->paths, arguments->flags, std::move(handler));
    });
    if (!granted) {
        return granted.error();
    }
    const qm::Value* tokenValue = granted->get("uuids");
    std::optional<qm::Uuid> token = tokenValue ? tokenValue->asUuid() : std::nullopt;
    if (!token) {
        printError("the reply holds no token");
        return kQmkitDaemonError;
    }
    const std::string printed = options.json ? replyAsJson(*granted) : token->text() + "\n";
    std::fputs(printed.c_str(), stdout);
    std::fflush(stdout);
    return waitForTheEnd(session, *token, **loop);
}

const QmkitCommandRegistration registration({"hold", "take a hold on plug-ins and keep it while qmkit runs", run,
                                             help});

}  // namespace
