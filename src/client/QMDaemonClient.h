#pragma once
// The client side of qmd's request protocol: builds request messages with the
// envelope ("request", "version") and the keys of each request, sends them
// with a reply handler, and turns error replies back into "Quamber" errors.
//
// Threads: requests may be sent from any thread. Every reply handler and every
// connection event of one client runs on its replyQueue ("qmd_client"), one at
// a time. The daemon serves requests in arrival order, so replies come back in
// the order the requests reached it.
//
// A reply handler is called exactly once, with the raw reply (a Value, normally
// a dictionary) or with a transport error (domain "duct") when no reply can
// come: the connection died, or the client is being destroyed. Use
// errorInReply() to read either as success or a "Quamber" error.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/duct/ClientConnection.h"
#include "platform/error/Error.h"
#include "platform/queue/SerialQueue.h"
#include "platform/value/Value.h"

class QMDaemonClient {
public:
    using ReplyHandler = std::function<void(qm::Result<qm::Value>)>;
    using Message = qm::Dictionary;

    // Connects to the named service (null: "ovaro.quamber.qmd"). A service
    // that cannot be reached is an error (domain "duct"), so tools can tell it
    // from a daemon's answer. The I/O timeout bounds connecting and writing.
    static qm::Result<std::unique_ptr<QMDaemonClient>> initWithServiceName(
        const char* serviceName, std::optional<std::chrono::milliseconds> ioTimeout = std::nullopt);

    ~QMDaemonClient();
    QMDaemonClient(const QMDaemonClient&) = delete;
    QMDaemonClient& operator=(const QMDaemonClient&) = delete;

    qm::SerialQueue& replyQueue() noexcept { return replyQueue_; }

    // Called once, on replyQueue, with the transport error that made the
    // connection invalid (the daemon hung up or died, a read failed), for
    // tools that wait without a request pending. Replaces an earlier handler;
    // set after the connection went, it is called at once (on replyQueue).
    // Destroying the client does not call it.
    using InvalidationHandler = std::function<void(const qm::Error& reason)>;
    void setInvalidationHandler(InvalidationHandler handler);

    // The version written into every request; 3 unless changed. A negative
    // version goes out as its 64-bit two's complement.
    std::int64_t protocolVersion() const noexcept { return protocolVersion_.load(); }
    void setProtocolVersion(std::int64_t version) noexcept { protocolVersion_.store(version); }

    // Message building.
    Message request(const std::string& name) const;
    Message requestPaths(const std::string& name, const std::vector<std::string>& paths) const;
    static void setUuids(Message& message, const std::vector<qm::Uuid>& uuids);

    // Sends a message; the handler runs once on replyQueue.
    void send(const Message& message, ReplyHandler handler);

    // Requests: each builds its message and sends it with the handler.
    void addPlugIns(const std::vector<std::string>& paths, ReplyHandler handler);
    void removePlugIns(const std::vector<std::string>& paths, ReplyHandler handler);
    void bulkPlugins(std::uint64_t flags, ReplyHandler handler);
    void readyPlugIns(const std::vector<qm::Uuid>& uuids, std::uint64_t flags, ReplyHandler handler);
    void accessPlugIns(const std::vector<qm::Uuid>& uuids, std::uint64_t flags, ReplyHandler handler);
    void matchPlugIns(const qm::Dictionary& rules, std::uint64_t flags, ReplyHandler handler);
    void setPluginAnnotations(const std::vector<qm::Uuid>& uuids, const qm::Dictionary& annotations,
                              ReplyHandler handler);
    void holdPlugins(const std::vector<std::string>& paths, std::uint64_t flags, ReplyHandler handler);
    void releaseHold(const qm::Uuid& token, ReplyHandler handler);

    // Blocking conveniences for tools. `start` issues one request with the
    // handler it is given; the call waits for that reply at most `timeout`
    // (a timeout is a transport error, domain "duct", code ETIMEDOUT, and the
    // late reply is dropped). Must not be called on replyQueue: it would wait
    // for itself.
    qm::Result<qm::Value> waitForReply(const std::function<void(ReplyHandler)>& start,
                                       std::chrono::milliseconds timeout);
    qm::Result<qm::Value> sendAndWait(const Message& message, std::chrono::milliseconds timeout);

    // Reads a reply (or the transport error in its place) as success (nothing)
    // or an error of the "Quamber" domain:
    // - a transport error: code 4 with the transport error's description;
    // - "errorcode" not 0: that code (its low 32 bits, signed) with "error",
    //   or "unknown error returned by Quamber subsystem" when there is none;
    // - no "errorcode" (or 0) and no "error": success.
    // What the daemon should never send is an internal inconsistency. A
    // departure from the design, which raises an exception for "errorcode" 0
    // with an "error": here it is an error value, code 4, so that bad input
    // can never crash a client and no exception crosses the library's
    // boundary. The same holds for "errorcode" absent with an "error" ("qmd
    // reported error without a code: <error>"), a reply that is not a
    // dictionary, and an "errorcode" that is not an integer.
    static std::optional<qm::Error> errorInReply(const qm::Result<qm::Value>& reply);

    // Packs a property list into one message value when the version is
    // exactly 3; any other version yields nothing.
    static std::optional<qm::Value> convertToDuct(const qm::Value& propertyList, std::uint64_t version);
    // The property list a packed value holds, when protocolVersion is exactly
    // 3 and the value is packed; otherwise nothing.
    std::optional<qm::Value> convertFromDuct(const qm::Value& packed) const;

private:
    QMDaemonClient();
    Message requestWithUuids(const std::string& name, const std::vector<qm::Uuid>& uuids) const;

    // Shared with the connection's event handler, which may run on
    // replyQueue while the client is being destroyed.
    struct Invalidation;

    // Declared first, destroyed last: the connection posts its final
    // handlers to this queue when it goes.
    qm::SerialQueue replyQueue_;
    std::atomic<std::int64_t> protocolVersion_{3};
    std::shared_ptr<Invalidation> invalidation_;
    std::unique_ptr<qm::duct::ClientConnection> qmd_;
};
