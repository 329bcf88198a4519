#include "daemon/Transaction.h"

#include <algorithm>
#include <cassert>
#include <string_view>

#include "daemon/QMDDuctClient.h"
#include "daemon/QMDServer.h"
#include "daemon/Routes.h"
#include "model/QMError.h"
#include "protocol/WireKeys.h"

namespace {

const std::string* requestName(const qm::Value& request) {
    const qm::Value* value = request.get(wire::kRequest);
    return value ? value->asString() : nullptr;
}

std::uint64_t requestVersion(const qm::Value& request) {
    const qm::Value* value = request.get(wire::kVersion);
    return value ? value->asUnsigned().value_or(0) : 0;
}

// How many plug-ins a reply describes: the forms it carries under "matches"
// (packed) or in any other array.
int plugInCountOf(const qm::Value& reply) {
    std::size_t count = 0;
    for (const auto& [key, value] : *reply.asDictionary()) {
        const qm::Value* content = value.packedContent();
        const qm::Array* forms = (content ? *content : value).asArray();
        count = std::max(count, forms ? forms->size() : 0);
    }
    return static_cast<int>(count);
}

}  // namespace

Transaction::Transaction(qm::duct::IncomingMessage request, std::shared_ptr<QMDDuctClient> client)
    : request_(std::move(request)), client_(std::move(client)) {}

QMDServer& Transaction::server() const noexcept {
    return client_->server();
}

bool Transaction::mayRunInline() const {
    if (!wire::isSupportedVersion(requestVersion(request()))) {
        return true;
    }
    const std::string* name = requestName(request());
    const Route* route = name ? routeFor(*name) : nullptr;
    return route == nullptr || route->runsInline;
}

void Transaction::dispatch() {
    server().mainQueue().assertCurrent();
    const std::string* name = requestName(request());
    version_ = requestVersion(request());

    if (!wire::isSupportedVersion(version_)) {
        fail(kQMErrorVersion, qm::format("unsupported protocol version %d (current %d)",
                                         static_cast<std::int32_t>(static_cast<std::uint32_t>(version_)),
                                         static_cast<int>(wire::kCurrentVersion)));
        return;
    }
    if (!client_->acceptWork()) {
        return;  // the client is dead: no handler, no reply
    }
    server().debug("client %d request %s", client_->pid(), name ? name->c_str() : nullptr);
    // The envelope's answers are made once: a malformed request costs no
    // allocation for its message.
    static const qm::Value kMissingType("invalid request format (missing type)");
    static const qm::Value kUnrecognized("unrecognized request");
    if (name == nullptr) {
        failWithMessage(kQMErrorInvalidRequest, kMissingType);
        return;
    }
    const Route* route = routeFor(*name);
    if (route == nullptr) {
        failWithMessage(kQMErrorInvalidRequest, kUnrecognized);
        return;
    }
    RequestContext context{server().registry(), server().holds(), server().userPrefs(), server().logger(),
                           client_->identity(), client_, request(), version_};
    finish(route->handler(context));
}

void Transaction::finish(Reply reply) {
    reply_ = std::move(reply.values);
    if (reply.failure) {
        fail(reply.failure->code, std::move(reply.failure->message));
        return;
    }
    done();
}

void Transaction::done() {
    assert(!finished_ && "a transaction replies once");
    finished_ = true;
    qm::Value reply(std::move(reply_));
    if (server().verbose() >= 2) {
        server().logger().debugInFull("Replying %@", reply);
    }
    if (request_.reply(reply) != qm::duct::ReplyResult::tooLarge) {
        return;
    }
    // Nothing was sent: the client gets an error it can act on instead.
    qm::Dictionary tooLarge{
        {wire::kErrorCode, qm::Value(static_cast<std::uint64_t>(kQMErrorInvalidRequest))},
        {wire::kError, qm::Value(qm::format("reply too large (%d plug-ins)", plugInCountOf(reply)))}};
    server().log("reply to client %d too large: %@", client_->pid(), tooLarge.find(wire::kError)->asString());
    request_.reply(qm::Value(std::move(tooLarge)));
}

void Transaction::fail(int code, std::optional<std::string> message) {
    reply_.reserve(reply_.size() + 2);
    reply_.set(wire::kErrorCode, static_cast<std::uint64_t>(static_cast<std::int64_t>(code)));
    if (message) {
        reply_.set(wire::kError, qm::Value(std::move(*message)));
    }
    done();
}

void Transaction::failWithMessage(int code, const qm::Value& message) {
    reply_.reserve(reply_.size() + 2);
    reply_.set(wire::kErrorCode, static_cast<std::uint64_t>(static_cast<std::int64_t>(code)));
    reply_.set(wire::kError, message);
    done();
}
