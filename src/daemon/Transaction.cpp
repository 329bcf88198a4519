#include "daemon/Transaction.h"

#include <cassert>
#include <string_view>

#include "client/WireKeys.h"
#include "daemon/QMDDuctClient.h"
#include "daemon/QMDServer.h"
#include "model/QMError.h"

namespace {

using Handler = void (Transaction::*)();

struct Route {
    std::string_view name;
    Handler handler;  // null until the request is served
};

// Compared byte for byte, in this order. A request whose handler does not
// exist yet is answered like an unknown one.
constexpr Route kRoutes[] = {
    {"add", nullptr},
    {"remove", nullptr},
    {"bulk", &Transaction::bulkPlugIns},
    {"match", nullptr},
    {"ready", nullptr},
    {"access", nullptr},
    {"annotate", nullptr},
    {"lock", nullptr},
};

Handler handlerFor(std::string_view name) {
    for (const Route& route : kRoutes) {
        if (route.name == name) {
            return route.handler;
        }
    }
    return nullptr;
}

}  // namespace

Transaction::Transaction(qm::duct::IncomingMessage request, std::shared_ptr<QMDDuctClient> client)
    : request_(std::move(request)), client_(std::move(client)) {}

QMDServer& Transaction::server() const noexcept {
    return client_->server();
}

void Transaction::dispatch() {
    server().mainQueue().assertCurrent();
    const qm::Value* nameValue = request().get(wire::kRequest);
    const std::string* name = nameValue ? nameValue->asString() : nullptr;
    const qm::Value* versionValue = request().get(wire::kVersion);
    version_ = versionValue ? versionValue->asUnsigned().value_or(0) : 0;

    if (version_ != wire::kOldestVersion && version_ != wire::kCurrentVersion) {
        fail(kQMErrorVersion, qm::format("unsupported protocol version %d (current %d)",
                                         static_cast<std::int32_t>(static_cast<std::uint32_t>(version_)),
                                         static_cast<int>(wire::kCurrentVersion)));
        return;
    }
    if (!client_->acceptWork()) {
        return;  // the client is dead: no handler, no reply
    }
    if (server().verbose() != 0) {  // the pid costs a lookup: only when the line is written
        server().debug("client %d request %s", client_->pid(), name ? name->c_str() : nullptr);
    }
    if (name == nullptr) {
        fail(kQMErrorInvalidRequest, std::string("invalid request format (missing type)"));
        return;
    }
    Handler handler = handlerFor(*name);
    if (handler == nullptr) {
        fail(kQMErrorInvalidRequest, std::string("unrecognized request"));
        return;
    }
    (this->*handler)();
}

void Transaction::done() {
    assert(!finished_ && "a transaction replies once");
    finished_ = true;
    qm::Value reply(std::move(reply_));
    if (server().verbose() >= 2) {
        server().debug("Replying %@", reply);
    }
    request_.reply(reply);
}

void Transaction::fail(int code, std::optional<std::string> message) {
    reply_.set(wire::kErrorCode, static_cast<std::uint64_t>(static_cast<std::int64_t>(code)));
    if (message) {
        reply_.set(wire::kError, qm::Value(std::move(*message)));
    }
    done();
}

void Transaction::fail(int code, const qm::Error& error) {
    if (error.domain == kQuamberErrorDomain) {
        fail(static_cast<int>(error.code), error.description);
        return;
    }
    fail(code, error.description);
}
