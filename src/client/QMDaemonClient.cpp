#include "client/QMDaemonClient.h"

#include <cerrno>
#include <condition_variable>
#include <mutex>

#include "protocol/Packing.h"
#include "protocol/WireKeys.h"
#include "model/QMError.h"
#include "platform/duct/ServiceSocket.h"
#include "platform/log/SystemLog.h"
#include "platform/text/Format.h"

namespace {

qm::Array stringArray(const std::vector<std::string>& strings) {
    qm::Array array;
    array.reserve(strings.size());
    for (const auto& s : strings) {
        array.emplace_back(s);
    }
    return array;
}

qm::Array uuidArray(const std::vector<qm::Uuid>& uuids) {
    qm::Array array;
    array.reserve(uuids.size());
    for (const auto& uuid : uuids) {
        array.emplace_back(uuid);
    }
    return array;
}

// The reply's "errorcode" as the daemon wrote it: unsigned (a negative code
// arrives sign-extended), or, from a lenient peer, a negative signed integer.
std::optional<std::uint64_t> readErrorCode(const qm::Value& code) {
    if (auto u = code.asUnsigned()) {
        return u;
    }
    if (auto s = code.asSigned()) {
        return static_cast<std::uint64_t>(*s);
    }
    return std::nullopt;
}

// A reply waited for by a blocking call; shared with the handler, which may
// run after the waiter has given up.
struct PendingReply {
    std::mutex mutex;
    std::condition_variable arrived;
    std::optional<qm::Result<qm::Value>> reply;
};

}  // namespace

struct QMDaemonClient::Invalidation {
    std::mutex mutex;
    InvalidationHandler handler;
    std::optional<qm::Error> reason;
};

qm::Result<std::unique_ptr<QMDaemonClient>> QMDaemonClient::initWithServiceName(
    const char* serviceName, std::optional<std::chrono::milliseconds> ioTimeout) {
    std::string name = serviceName ? serviceName : wire::kDefaultServiceName;
    std::unique_ptr<QMDaemonClient> client(new QMDaemonClient());
    auto onEvent = [invalidation = client->invalidation_](const qm::Error& event) {
        qm::systemLogf(qm::kLogNotice, "Communications error: %@", event.text());
        InvalidationHandler handler;
        {
            std::lock_guard lock(invalidation->mutex);
            invalidation->reason = event;
            handler = invalidation->handler;
        }
        if (handler) {
            handler(event);
        }
    };
    auto connection = qm::duct::ClientConnection::connect(name, client->replyQueue_, std::move(onEvent),
                                                          qm::duct::ClientConnection::Options{ioTimeout});
    if (!connection) {
        return connection.error();
    }
    client->qmd_ = std::move(connection).value();
    return client;
}

QMDaemonClient::QMDaemonClient() : replyQueue_("qmd_client"), invalidation_(std::make_shared<Invalidation>()) {}

QMDaemonClient::~QMDaemonClient() {
    // The queue's worker cannot join itself.
    assert(!replyQueue_.isCurrent());
}

void QMDaemonClient::setInvalidationHandler(InvalidationHandler handler) {
    std::lock_guard lock(invalidation_->mutex);
    invalidation_->handler = handler;
    if (invalidation_->reason && handler) {
        replyQueue_.async([handler, reason = *invalidation_->reason] { handler(reason); });
    }
}

QMDaemonClient::Message QMDaemonClient::request(const std::string& name) const {
    Message message;
    message.set(wire::kRequest, qm::Value(name));
    message.set(wire::kVersion, qm::Value(static_cast<std::uint64_t>(protocolVersion())));
    return message;
}

QMDaemonClient::Message QMDaemonClient::requestPaths(const std::string& name,
                                                     const std::vector<std::string>& paths) const {
    Message message = request(name);
    message.set(wire::kPaths, qm::Value(stringArray(paths)));
    return message;
}

void QMDaemonClient::setUuids(Message& message, const std::vector<qm::Uuid>& uuids) {
    message.set(wire::kUuids, qm::Value(uuidArray(uuids)));
}

QMDaemonClient::Message QMDaemonClient::requestWithUuids(const std::string& name,
                                                         const std::vector<qm::Uuid>& uuids) const {
    Message message = request(name);
    setUuids(message, uuids);
    return message;
}

void QMDaemonClient::send(const Message& message, ReplyHandler handler) {
    qmd_->send(qm::Value(message), std::move(handler));
}

void QMDaemonClient::addPlugIns(const std::vector<std::string>& paths, ReplyHandler handler) {
    send(requestPaths("add", paths), std::move(handler));
}

void QMDaemonClient::removePlugIns(const std::vector<std::string>& paths, ReplyHandler handler) {
    send(requestPaths("remove", paths), std::move(handler));
}

void QMDaemonClient::bulkPlugins(std::uint64_t flags, ReplyHandler handler) {
    Message message = request("bulk");
    message.set(wire::kFlags, qm::Value(flags));
    send(message, std::move(handler));
}

void QMDaemonClient::readyPlugIns(const std::vector<qm::Uuid>& uuids, std::uint64_t flags, ReplyHandler handler) {
    Message message = requestWithUuids("ready", uuids);
    message.set(wire::kFlags, qm::Value(flags));
    send(message, std::move(handler));
}

void QMDaemonClient::accessPlugIns(const std::vector<qm::Uuid>& uuids, std::uint64_t flags, ReplyHandler handler) {
    Message message = requestWithUuids("access", uuids);
    message.set(wire::kFlags, qm::Value(flags));
    send(message, std::move(handler));
}

void QMDaemonClient::matchPlugIns(const qm::Dictionary& rules, std::uint64_t flags, ReplyHandler handler) {
    Message message = request("match");
    message.set(wire::kRules, qm::Value(rules));
    message.set(wire::kFlags, qm::Value(flags));
    send(message, std::move(handler));
}

void QMDaemonClient::setPluginAnnotations(const std::vector<qm::Uuid>& uuids, const qm::Dictionary& annotations,
                                          ReplyHandler handler) {
    Message message = requestWithUuids("annotate", uuids);
    message.set(wire::kAnnotations, qm::Value(annotations));
    send(message, std::move(handler));
}

void QMDaemonClient::holdPlugins(const std::vector<std::string>& paths, std::uint64_t flags, ReplyHandler handler) {
    Message message = requestPaths("lock", paths);
    message.set(wire::kFlags, qm::Value(flags));
    send(message, std::move(handler));
}

void QMDaemonClient::releaseHold(const qm::Uuid& token, ReplyHandler handler) {
    send(requestWithUuids("lock", {token}), std::move(handler));
}

qm::Result<qm::Value> QMDaemonClient::waitForReply(const std::function<void(ReplyHandler)>& start,
                                                   std::chrono::milliseconds timeout) {
    assert(!replyQueue_.isCurrent());
    auto pending = std::make_shared<PendingReply>();
    start([pending](qm::Result<qm::Value> reply) {
        std::lock_guard lock(pending->mutex);
        pending->reply = std::move(reply);
        pending->arrived.notify_all();
    });
    std::unique_lock lock(pending->mutex);
    if (!pending->arrived.wait_for(lock, timeout, [&] { return pending->reply.has_value(); })) {
        return qm::Error{qm::duct::kDuctErrorDomain, ETIMEDOUT,
                         qm::format("no reply from qmd within %lld ms", static_cast<long long>(timeout.count()))};
    }
    return std::move(*pending->reply);
}

qm::Result<qm::Value> QMDaemonClient::sendAndWait(const Message& message, std::chrono::milliseconds timeout) {
    return waitForReply([&](ReplyHandler handler) { send(message, std::move(handler)); }, timeout);
}

std::optional<qm::Error> QMDaemonClient::errorInReply(const qm::Result<qm::Value>& reply) {
    if (!reply) {
        return QMError(kQMErrorInvalidRequest, reply.error().text());
    }
    const qm::Dictionary* dictionary = reply->asDictionary();
    if (!dictionary) {
        return QMErrorWithFormat(kQMErrorInvalidRequest, "qmd sent a reply that is not a dictionary: %@", *reply);
    }
    std::uint64_t code = 0;
    if (const qm::Value* codeValue = dictionary->find(wire::kErrorCode)) {
        auto read = readErrorCode(*codeValue);
        if (!read) {
            return QMErrorWithFormat(kQMErrorInvalidRequest, "qmd sent an error code that is not an integer: %@",
                                     *codeValue);
        }
        code = *read;
    }
    const qm::Value* messageValue = dictionary->find(wire::kError);
    const std::string* message = messageValue ? messageValue->asString() : nullptr;
    if (code == 0) {
        if (!messageValue) {
            return std::nullopt;
        }
        return QMErrorWithFormat(kQMErrorInvalidRequest, "qmd reported error without a code: %@", *messageValue);
    }
    int signedCode = static_cast<std::int32_t>(static_cast<std::uint32_t>(code));
    return QMError(signedCode, message ? *message : std::string("unknown error returned by Quamber subsystem"));
}

std::optional<qm::Value> QMDaemonClient::convertToDuct(const qm::Value& propertyList, std::uint64_t version) {
    return wire::convertToDuct(propertyList, version);
}

std::optional<qm::Value> QMDaemonClient::convertFromDuct(const qm::Value& packed) const {
    return wire::convertFromDuct(packed, static_cast<std::uint64_t>(protocolVersion()));
}
