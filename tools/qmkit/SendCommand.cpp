// qmkit send JSON: one request written as JSON, sent as it is (with the
// current protocol version added when it has none), its reply printed.

#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"
#include "ReplyFormat.h"
#include "protocol/WireKeys.h"
#include "platform/value/Json.h"

namespace {

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] send JSON\n"
        "\n"
        "Sends one request written as a JSON object, adding \"version\": 3 when it has\n"
        "none, and prints the reply. UUIDs, data and dates are written\n"
        "{\"$uuid\": \"...\"}, {\"$data\": \"base64\"} and {\"$date\": \"RFC 3339\"}.\n"
        "\n"
        "example: qmkit send '{\"request\": \"bulk\", \"flags\": 0}'\n",
        stdout);
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    if (args.size() != 1) {
        std::fputs("qmkit: send: expected one JSON object\n", stderr);
        std::fputs("qmkit: see 'qmkit send --help'\n", stderr);
        return kQmkitUsage;
    }
    qm::Result<qm::Value> parsed = qm::json::parse(args[0]);
    if (!parsed) {
        std::fprintf(stderr, "qmkit: send: invalid JSON: %s\n", parsed.error().text().c_str());
        return kQmkitUsage;
    }
    const qm::Dictionary* object = parsed->asDictionary();
    if (!object) {
        std::fputs("qmkit: send: the request must be a JSON object\n", stderr);
        return kQmkitUsage;
    }
    QMDaemonClient::Message message = *object;
    if (!message.contains(wire::kVersion)) {
        message.set(wire::kVersion, qm::Value(wire::kCurrentVersion));
    }
    return DaemonSession(options).run(
        [&message](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
            client.send(message, std::move(handler));
        },
        [](const qm::Value& reply) { std::fputs(replyAsText(reply).c_str(), stdout); });
}

const QmkitCommandRegistration registration({"send", "send one request written as JSON and print the reply", run,
                                             help});

}  // namespace
