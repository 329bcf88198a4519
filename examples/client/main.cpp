// qmclient-example: asks a running qmd which plug-ins serve an extension
// point and prints each one's identifier and path, one per line.
//
//   c++ -std=c++20 -o qmclient-example main.cpp $(pkg-config --cflags --libs qmclient)
//   ./qmclient-example ovaro.share-services

#include <chrono>
#include <cstdio>

#include "client/QMDaemonClient.h"

int main(int argc, char** argv) {
    if (argc != 2) {
        std::fprintf(stderr, "usage: %s EXTENSION-POINT\n", argv[0]);
        return 2;
    }
    // The daemon's default service, in $QM_DUCT_DIR (else $XDG_RUNTIME_DIR/ovaro).
    auto client = QMDaemonClient::initWithServiceName(nullptr);
    if (!client) {
        std::fprintf(stderr, "cannot reach qmd: %s\n", client.error().text().c_str());
        return 3;
    }
    qm::Dictionary rules{{"VTExtensionPointName", qm::Value(argv[1])}};
    auto reply = (*client)->waitForReply(
        [&](QMDaemonClient::ReplyHandler handler) { (*client)->matchPlugIns(rules, 0, std::move(handler)); },
        std::chrono::seconds(30));
    if (auto error = QMDaemonClient::errorInReply(reply)) {
        std::fprintf(stderr, "match failed: %s\n", error->text().c_str());
        return 1;
    }
    // "matches" is a packed property list: an array of plug-in forms.
    const qm::Value* packed = reply->get("matches");
    auto matches = packed ? (*client)->convertFromDuct(*packed) : std::nullopt;
    if (!matches || !matches->asArray()) {
        return 0;  // nothing serves the extension point
    }
    auto text = [](const qm::Value& form, const char* key) {
        const qm::Value* value = form.get(key);
        const std::string* string = value ? value->asString() : nullptr;
        return string ? string->c_str() : "?";
    };
    for (const qm::Value& form : *matches->asArray()) {
        std::printf("%s\t%s\n", text(form, "identifier"), text(form, "path"));
    }
    return 0;
}
