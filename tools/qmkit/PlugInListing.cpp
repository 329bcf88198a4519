#include "PlugInListing.h"

#include <cstdio>

qm::Result<qm::Array, int> listAllPlugIns(DaemonSession& session, const std::optional<std::string>& point) {
    qm::Array all;
    for (;;) {
        auto reply = session.ask([&](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
            QMDaemonClient::Message message = client.request("list");
            if (point) {
                message.set("point", qm::Value(*point));
            }
            message.set("offset", qm::Value(static_cast<std::uint64_t>(all.size())));
            client.send(message, std::move(handler));
        });
        if (!reply) {
            return reply.error();
        }
        const qm::Value* page = reply->get("plugins");
        const qm::Value* total = reply->get("total");
        if (!page || !page->asArray() || !total || !total->asUnsigned()) {
            std::fputs("qmkit: the \"list\" reply holds no \"plugins\" and \"total\"\n", stderr);
            return int{kQmkitDaemonError};
        }
        all.insert(all.end(), page->asArray()->begin(), page->asArray()->end());
        // A page that comes back empty ends it too: the list shrank meanwhile.
        if (page->asArray()->empty() || all.size() >= *total->asUnsigned()) {
            return all;
        }
    }
}
