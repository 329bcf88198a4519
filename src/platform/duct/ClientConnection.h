#pragma once
// The client's side of one connection to a named Duct service.
//
// Messages may be sent from any thread; each gets a fresh id, unique on the
// connection, and its reply handler is called exactly once, on the queue
// given at creation: with the reply's value, or with a transport error (domain
// "duct") when no reply can come. Writes block until the socket takes the
// frame (bounded by the I/O timeout when one is set) and are serialised, so
// frames never interleave.
//
// A reader thread reads reply frames. The daemon hanging up, a read error, a
// frame that is not a reply, one announcing more than kMaxPayloadSize, a
// payload that does not decode, or a reply to no pending message makes the
// connection invalid: every pending handler then gets a transport error
// ("connection invalid: <reason>"), the event handler gets that error once,
// and later sends fail at once with it. There is no reconnection.
//
// Replies are matched to messages by id, whatever order they come in.
//
// Destroying the connection shuts the socket down, joins the reader and fails
// the handlers still pending with "connection invalid: connection closed by
// the client"; the event handler is not called for that. The queue must
// outlive the connection; handlers and events are submitted to it with
// async() and never refer to the connection.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "platform/error/Error.h"
#include "platform/fd/UniqueFd.h"
#include "platform/queue/SerialQueue.h"
#include "platform/value/Value.h"

namespace qm::duct {

class ClientConnection {
public:
    using ReplyHandler = std::function<void(Result<Value>)>;
    // Called on the queue with the error that made the connection invalid.
    using EventHandler = std::function<void(const Error&)>;

    struct Options {
        // Bounds connecting and each write; nothing waits forever. A write
        // that times out makes the connection invalid (its frame is cut).
        std::optional<std::chrono::milliseconds> ioTimeout;
    };

    // Connects to the service's socket in the Duct runtime directory. Errors
    // are in the domain "duct" with an errno value as code.
    static Result<std::unique_ptr<ClientConnection>> connect(const std::string& serviceName, SerialQueue& queue,
                                                             EventHandler eventHandler, Options options);
    static Result<std::unique_ptr<ClientConnection>> connect(const std::string& serviceName, SerialQueue& queue,
                                                             EventHandler eventHandler);
    // Takes an already connected stream socket (a socketpair end, an
    // inherited descriptor) and starts reading it.
    static std::unique_ptr<ClientConnection> adopt(UniqueFd socket, SerialQueue& queue, EventHandler eventHandler);

    ~ClientConnection();
    ClientConnection(const ClientConnection&) = delete;
    ClientConnection& operator=(const ClientConnection&) = delete;

    // Sends a dictionary message. A message that is not a dictionary, or
    // whose encoding exceeds kMaxPayloadSize, is refused with an error to its
    // handler and leaves the connection as it was.
    void send(const Value& message, ReplyHandler handler);

    // Makes the connection invalid from any thread, as if the transport had
    // failed with this reason; the event handler is called.
    void invalidate(const std::string& reason);

    bool isValid() const;
    // Messages sent and not yet answered or failed.
    std::size_t pendingCount() const;

private:
    ClientConnection(UniqueFd socket, SerialQueue& queue, EventHandler eventHandler);
    void readLoop();
    bool readExactly(std::uint8_t* into, std::size_t size);
    void deliverReply(std::uint64_t id, Result<Value> reply);
    void fail(Error error, bool notifyEventHandler);
    void failOne(ReplyHandler handler, Error error);

    UniqueFd socket_;
    SerialQueue& queue_;
    const EventHandler eventHandler_;
    std::atomic<std::uint64_t> nextId_{1};
    std::atomic<bool> closing_{false};

    // Guarded by stateMutex_: the pending handlers and the invalidity.
    mutable std::mutex stateMutex_;
    std::map<std::uint64_t, ReplyHandler> pending_;
    std::optional<Error> invalidError_;

    std::mutex writeMutex_;  // one frame at a time on the socket
    std::thread reader_;
};

}  // namespace qm::duct
