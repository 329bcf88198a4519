// qmkit send JSON | send -: one request written as JSON, sent as it is (with
// the current protocol version added when it has none), its reply printed.

#include <cerrno>
#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"
#include "ReplyFormat.h"
#include "protocol/WireKeys.h"
#include "platform/value/Json.h"

namespace {

// A request travels in one frame of at most 16 MiB; JSON text several times
// that cannot make one, and must not cost unbounded memory.
constexpr std::size_t kMaxRequestText = std::size_t{64} << 20;

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] send JSON\n"
        "       qmkit [-S service] [--json] [--timeout SECONDS] send -\n"
        "\n"
        "Sends one request written as a JSON object, given as the argument or, with\n"
        "\"-\", read from standard input (at most 64 MiB). Adds \"version\": 3 when the\n"
        "request has none, and prints the reply. UUIDs, data and dates are written\n"
        "{\"$uuid\": \"...\"}, {\"$data\": \"base64\"} and {\"$date\": \"RFC 3339\"};\n"
        "integers must fit in 64 bits.\n"
        "\n"
        "example: qmkit send '{\"request\": \"bulk\", \"flags\": 0}'\n",
        stdout);
}

int usageError(const std::string& message) {
    std::fprintf(stderr, "qmkit: send: %s\n", message.c_str());
    return kQmkitUsage;
}

// The whole of standard input, or why not.
qm::Result<std::string> readStandardInput() {
    std::string text;
    char buffer[1 << 16];
    while (std::size_t got = std::fread(buffer, 1, sizeof buffer, stdin)) {
        if (got > kMaxRequestText - text.size()) {
            return qm::Error{"qmkit", 0, "standard input holds more than 64 MiB"};
        }
        text.append(buffer, got);
    }
    if (std::ferror(stdin)) {
        return qm::posixError(errno, "cannot read standard input");
    }
    return text;
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    if (args.size() != 1) {
        std::fputs("qmkit: send: expected one JSON object, or \"-\" to read it from standard input\n", stderr);
        std::fputs("qmkit: see 'qmkit send --help'\n", stderr);
        return kQmkitUsage;
    }
    auto text = args[0] == "-" ? readStandardInput() : qm::Result<std::string>(args[0]);
    if (!text) {
        return usageError(text.error().text());
    }
    qm::Result<qm::Value> parsed = qm::json::parse(*text);
    if (!parsed) {
        return usageError("invalid JSON: " + parsed.error().text());
    }
    const qm::Dictionary* object = parsed->asDictionary();
    if (!object) {
        return usageError("the request must be a JSON object");
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
