#pragma once
// The daemon's side of one client connection on the Duct transport.
//
// Reading and the connection's events happen on the event-loop thread.
// Replies may be sent from any thread: the sender writes its frame itself,
// without blocking, and what the socket does not take waits in a
// per-connection backlog that the loop flushes. A backlog beyond 4 MiB (not
// counting the reply being written) makes the connection invalid, so a peer
// that never reads cannot make the daemon hold unbounded memory.
//
// Fairness: at most 64 requests of a connection are read but not answered;
// past that the connection is not read until replies go out, so one client
// never floods the daemon's queue ahead of the others.
//
// Anything that breaks the framing or the payload rules makes the connection
// invalid at once; the event handler then sees one `invalid` event, after
// which it is released together with the connection's context.

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/duct/OpenTransaction.h"
#include "platform/fd/UniqueFd.h"
#include "platform/queue/EventLoop.h"
#include "platform/value/Value.h"

namespace qm::duct {

inline constexpr int kMaxUnansweredRequests = 64;
inline constexpr std::size_t kMaxReplyBacklog = 4u * 1024 * 1024;

class PeerConnection;

// One request read from a peer, with the means to answer it once. Dropping it
// unanswered frees the request's place in the connection's quota.
class IncomingMessage {
public:
    IncomingMessage(std::weak_ptr<PeerConnection> connection, std::uint64_t id, Value body);
    ~IncomingMessage();
    IncomingMessage(IncomingMessage&& other) noexcept;
    IncomingMessage& operator=(IncomingMessage&&) = delete;
    IncomingMessage(const IncomingMessage&) = delete;
    IncomingMessage& operator=(const IncomingMessage&) = delete;

    const Value& body() const noexcept { return body_; }
    std::uint64_t id() const noexcept { return id_; }

    // Sends the reply from the calling thread without blocking. Only the first
    // call sends; false when the connection no longer exists.
    bool reply(const Value& reply);
    bool replied() const noexcept { return answered_; }

private:
    std::weak_ptr<PeerConnection> connection_;
    std::uint64_t id_;
    Value body_;
    bool answered_ = false;
};

struct ConnectionEvent {
    enum class Kind { message, invalid };
    Kind kind;
    std::optional<IncomingMessage> message;  // for `message`
    std::string reason;                      // for `invalid`
};

struct PeerCredentials {
    pid_t pid = 0;
    uid_t uid = 0;
    gid_t gid = 0;
};

class PeerConnection final : public EventSource, public std::enable_shared_from_this<PeerConnection> {
public:
    using EventHandler = std::function<void(ConnectionEvent&&)>;

    // Takes an accepted socket; reads the peer's credentials and pidfd now, so
    // a recycled pid can never inherit this peer's identity.
    static std::shared_ptr<PeerConnection> adopt(EventLoop& loop, UniqueFd socket,
                                                 std::function<void()> onClosed);
    ~PeerConnection() override;

    const PeerCredentials& credentials() const noexcept { return credentials_; }
    pid_t pid() const noexcept;
    // The peer's executable, verified against the pidfd taken at accept time.
    std::optional<std::string> peerExecutablePath() const;

    // Set before resume(). The context is kept until the connection closes.
    void setEventHandler(EventHandler handler);
    void setContext(std::shared_ptr<void> context);
    // Starts reading and delivering events (on the loop thread).
    void resume();

    // Closes the connection from any thread; the loop then delivers `invalid`.
    void invalidate(const std::string& reason);
    bool isValid() const noexcept { return !closed_.load(); }

    std::string description() const;

    void handleEvents(std::uint32_t events) override;

private:
    friend class IncomingMessage;

    PeerConnection(EventLoop& loop, UniqueFd socket, std::function<void()> onClosed);
    bool sendReply(std::uint64_t id, const Value& reply);
    void releaseRequestSlot();
    void readAvailable(bool& hungUp);
    void deliverFrames();
    void flushBacklog();
    void updateInterestLocked();
    void closeNow(const std::string& reason);

    EventLoop& loop_;
    UniqueFd socket_;
    UniqueFd pidfd_;
    PeerCredentials credentials_;
    std::function<void()> onClosed_;
    EventLoop::RegistrationId registration_ = 0;
    OpenTransaction openTransaction_;

    // Loop thread only.
    EventHandler handler_;
    std::shared_ptr<void> context_;
    Bytes readBuffer_;
    std::size_t readStart_ = 0;
    std::size_t readEnd_ = 0;
    std::string invalidReason_;

    std::atomic<int> unanswered_{0};
    std::atomic<bool> closed_{false};

    // Guarded by writeMutex_: the socket for writing, the backlog, the interest set.
    mutable std::mutex writeMutex_;
    std::deque<Bytes> backlog_;
    std::size_t frontWritten_ = 0;      // bytes of backlog_.front() already sent
    std::size_t backlogBytes_ = 0;      // bytes of backlog_ after the front frame
    bool readingPaused_ = false;
    bool registered_ = false;
    std::string pendingInvalidReason_;
};

}  // namespace qm::duct
