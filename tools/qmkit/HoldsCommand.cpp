// qmkit holds: every hold the daemon keeps, with its holder.

#include <chrono>
#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"
#include "Table.h"

namespace {

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] holds\n"
        "\n"
        "Lists every hold the daemon keeps, oldest first: its token, the process\n"
        "id and executable of the client holding it, its age and how many\n"
        "plug-ins it holds. With --json, prints the daemon's reply: \"holds\", an\n"
        "array of {\"uuid\", \"pid\", \"executable\" (when known), \"created\",\n"
        "\"plugins\"}.\n",
        stdout);
}

// "42s", "3m07s", "2h05m", "3d04h".
std::string ageText(double seconds) {
    const long long whole = seconds > 0 ? static_cast<long long>(seconds) : 0;
    char text[48];
    if (whole < 60) {
        std::snprintf(text, sizeof text, "%llds", whole);
    } else if (whole < 3600) {
        std::snprintf(text, sizeof text, "%lldm%02llds", whole / 60, whole % 60);
    } else if (whole < 86400) {
        std::snprintf(text, sizeof text, "%lldh%02lldm", whole / 3600, whole % 3600 / 60);
    } else {
        std::snprintf(text, sizeof text, "%lldd%02lldh", whole / 86400, whole % 86400 / 3600);
    }
    return text;
}

std::string textOf(const qm::Value* value) {
    if (value == nullptr) {
        return "-";
    }
    const std::string* text = value->asString();
    return text ? *text : value->description();
}

void printHolds(const qm::Value& reply) {
    const double now = std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
    Table table{{{"uuid", "TOKEN"}, {"pid", "PID"}, {"age", "AGE"}, {"plugins", "PLUG-INS"}, {"executable", "EXECUTABLE"}},
                {}};
    const qm::Value* holds = reply.get("holds");
    for (const qm::Value& hold : holds && holds->asArray() ? *holds->asArray() : qm::Array{}) {
        const qm::Value* token = hold.get("uuid");
        const qm::Value* created = hold.get("created");
        const qm::Value* plugIns = hold.get("plugins");
        table.rows.push_back({
            token && token->asUuid() ? token->asUuid()->text() : textOf(token),
            textOf(hold.get("pid")),
            created && created->asDate() ? ageText(now - created->asDate()->secondsSince1970) : "-",
            plugIns && plugIns->asArray() ? std::to_string(plugIns->asArray()->size()) : "-",
            textOf(hold.get("executable")),
        });
    }
    std::fputs(table.text().c_str(), stdout);
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    if (!args.empty()) {
        return commandUsageError("holds", "unexpected argument \"" + args.front() + "\"");
    }
    return DaemonSession(options).run(
        [](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
            client.send(client.request("holds"), std::move(handler));
        },
        printHolds);
}

const QmkitCommandRegistration registration({"holds", "list every hold with its holder and age", run, help});

}  // namespace
