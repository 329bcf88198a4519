// qmkit watch: the daemon's changes as they happen, one line each.
//
// After each change notification qmkit asks "list" and "holds" and compares
// the answers with what it saw before, so posts that arrive together (they
// coalesce) lose nothing: every difference is printed.

#include <sys/time.h>

#include <cstdio>
#include <ctime>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "ChangeWatch.h"
#include "Command.h"
#include "DaemonSession.h"
#include "PlugInListing.h"
#include "platform/process/TerminationSignals.h"
#include "platform/value/Json.h"

namespace {

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] watch\n"
        "\n"
        "Prints the daemon's changes as they happen, one line each, starting\n"
        "with the local time (ISO 8601, milliseconds):\n"
        "\n"
        "  installed UUID IDENTIFIER PATH\n"
        "  uninstalled UUID IDENTIFIER PATH\n"
        "  election UUID IDENTIFIER N        (N is \"-\" once it has none)\n"
        "  held TOKEN pid PID EXECUTABLE UUID...\n"
        "  released TOKEN UUID...\n"
        "\n"
        "With --json, one JSON object per line: {\"time\", \"event\", and \"uuid\",\n"
        "\"identifier\", \"path\", \"election\" (null once it has none) or \"token\",\n"
        "\"pid\", \"executable\", \"plugins\"}.\n"
        "\n"
        "Runs until interrupted (SIGINT or SIGTERM, exit 0) or until the\n"
        "connection to the daemon is lost (exit 3).\n",
        stdout);
}

struct PlugInSeen {
    std::string identifier;
    std::string path;
    std::optional<qm::Value> election;
};

struct HoldSeen {
    qm::Value pid;
    std::string executable;
    qm::Array plugIns;
};

struct Seen {
    std::map<std::string, PlugInSeen> plugIns;  // by UUID text
    std::map<std::string, HoldSeen> holds;      // by token text
};

std::string textOf(const qm::Value* value) {
    if (value == nullptr || value->isNull()) {
        return "-";
    }
    if (auto uuid = value->asUuid()) {
        return uuid->text();
    }
    const std::string* text = value->asString();
    return text ? (text->empty() ? "-" : *text) : value->description();
}

// "2026-11-23T19:04:05.123+01:00"
std::string localTimestamp() {
    timeval now{};
    ::gettimeofday(&now, nullptr);
    std::tm local{};
    ::localtime_r(&now.tv_sec, &local);
    char seconds[32];
    char zone[8];
    std::strftime(seconds, sizeof seconds, "%Y-%m-%dT%H:%M:%S", &local);
    std::strftime(zone, sizeof zone, "%z", &local);
    char text[64];
    std::snprintf(text, sizeof text, "%s.%03ld%.3s:%.2s", seconds, static_cast<long>(now.tv_usec / 1000), zone,
                  zone + 3);
    return text;
}

class Watch {
public:
    Watch(DaemonSession& session, bool json) : session_(session), json_(json) {}

    // The state now; an exit status when the daemon cannot tell.
    qm::Result<Seen, int> look() {
        Seen seen;
        auto entries = listAllPlugIns(session_, std::nullopt);
        if (!entries) {
            return entries.error();
        }
        for (const qm::Value& entry : *entries) {
            const qm::Value* uuid = entry.get("uuid");
            if (uuid == nullptr) {
                continue;  // a refused bundle: never installed
            }
            const qm::Value* election = entry.get("election");
            seen.plugIns[textOf(uuid)] = {textOf(entry.get("identifier")), textOf(entry.get("path")),
                                          election ? std::optional<qm::Value>(*election) : std::nullopt};
        }
        auto reply = session_.ask([](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
            client.send(client.request("holds"), std::move(handler));
        });
        if (!reply) {
            return reply.error();
        }
        const qm::Value* holds = reply->get("holds");
        for (const qm::Value& hold : holds && holds->asArray() ? *holds->asArray() : qm::Array{}) {
            const qm::Value* plugIns = hold.get("plugins");
            const qm::Value* pid = hold.get("pid");
            seen.holds[textOf(hold.get("uuid"))] = {pid ? *pid : qm::Value(), textOf(hold.get("executable")),
                                                    plugIns && plugIns->asArray() ? *plugIns->asArray() : qm::Array{}};
        }
        return seen;
    }

    // Prints what changed since the last look; the first look prints nothing.
    std::optional<int> update() {
        auto now = look();
        if (!now) {
            return now.error();
        }
        if (last_) {
            printDifferences(*last_, *now);
        }
        last_ = std::move(now).value();
        return std::nullopt;
    }

private:
    void printDifferences(const Seen& before, const Seen& after) {
        for (const auto& [uuid, plugIn] : before.plugIns) {
            if (!after.plugIns.contains(uuid)) {
                printPlugIn("uninstalled", uuid, plugIn);
            }
        }
        for (const auto& [uuid, plugIn] : after.plugIns) {
            auto earlier = before.plugIns.find(uuid);
            if (earlier == before.plugIns.end()) {
                printPlugIn("installed", uuid, plugIn);
            } else if (earlier->second.election != plugIn.election) {
                printElection(uuid, plugIn);
            }
        }
        for (const auto& [token, hold] : before.holds) {
            if (!after.holds.contains(token)) {
                printHold("released", token, hold);
            }
        }
        for (const auto& [token, hold] : after.holds) {
            if (!before.holds.contains(token)) {
                printHold("held", token, hold);
            }
        }
        std::fflush(stdout);
    }

    void print(const char* event, qm::Dictionary fields, const std::string& text) {
        const std::string time = localTimestamp();
        if (json_) {
            fields.set("time", qm::Value(time));
            fields.set("event", qm::Value(event));
            std::printf("%s\n", qm::json::write(qm::Value(std::move(fields)), false).c_str());
        } else {
            std::printf("%s %s %s\n", time.c_str(), event, text.c_str());
        }
    }

    void printPlugIn(const char* event, const std::string& uuid, const PlugInSeen& plugIn) {
        print(event,
              {{"uuid", qm::Value(uuid)}, {"identifier", qm::Value(plugIn.identifier)}, {"path", qm::Value(plugIn.path)}},
              uuid + " " + plugIn.identifier + " " + plugIn.path);
    }

    void printElection(const std::string& uuid, const PlugInSeen& plugIn) {
        const qm::Value election = plugIn.election.value_or(qm::Value());
        print("election",
              {{"uuid", qm::Value(uuid)}, {"identifier", qm::Value(plugIn.identifier)}, {"election", election}},
              uuid + " " + plugIn.identifier + " " + textOf(&election));
    }

    void printHold(const char* event, const std::string& token, const HoldSeen& hold) {
        std::string plugIns;
        for (const qm::Value& plugIn : hold.plugIns) {
            plugIns += " " + textOf(&plugIn);
        }
        if (std::string(event) == "held") {
            print(event,
                  {{"token", qm::Value(token)}, {"pid", hold.pid}, {"executable", qm::Value(hold.executable)},
                   {"plugins", qm::Value(hold.plugIns)}},
                  token + " pid " + textOf(&hold.pid) + " " + hold.executable + plugIns);
        } else {
            print(event, {{"token", qm::Value(token)}, {"plugins", qm::Value(hold.plugIns)}}, token + plugIns);
        }
    }

    DaemonSession& session_;
    const bool json_;
    std::optional<Seen> last_;
};

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    if (!args.empty()) {
        return commandUsageError("watch", "unexpected argument \"" + args.front() + "\"");
    }
    // Before the client starts its threads, which inherit the mask: the
    // signals then reach only the loop's signalfd.
    qm::blockTerminationSignals();
    auto loop = qm::EventLoop::create();
    if (!loop) {
        std::fprintf(stderr, "qmkit: watch: cannot wait: %s\n", loop.error().text().c_str());
        return kQmkitUnreachable;
    }
    DaemonSession session(options);
    Watch watch(session, options.json);
    // Connects, and makes sure the daemon (and so its notify folder) is up
    // before watching starts; the first look below is the one compared with.
    if (auto reachable = watch.look(); !reachable) {
        return reachable.error();
    }
    return followChanges(session, **loop, "watch", [&](const std::set<std::string>&) { return watch.update(); });
}

const QmkitCommandRegistration registration({"watch", "print installs, uninstalls, elections and holds as they happen",
                                             run, help});

}  // namespace
