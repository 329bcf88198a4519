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
// Memory follows the bytes received: a frame's buffer grows as its bytes
// arrive, and the connection draws on the process's ReceiveBudget for what it
// holds undecoded and for the requests it has in flight. Fairness: at most 64
// requests of a connection are read but not answered. Past any of these the
// connection is not read until there is room again (hang-ups are still
// seen), so one client never floods the daemon ahead of the others.
//
// Anything that breaks the framing or the payload rules makes the connection
// invalid at once; the event handler then sees one `invalid` event, after
// which it is released together with the connection's context. A connection
// whose peer identity could not be fixed at accept delivers nothing but that
// `invalid` event.

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/duct/IncomingFrames.h"
#include "platform/duct/OpenTransaction.h"
#include "platform/duct/PeerIdentity.h"
#include "platform/duct/ReceiveBudget.h"
#include "platform/fd/UniqueFd.h"
#include "platform/queue/EventLoop.h"
#include "platform/value/Value.h"

namespace qm::duct {

inline constexpr int kMaxUnansweredRequests = 64;
inline constexpr std::size_t kMaxReplyBacklog = 4u * 1024 * 1024;

class PeerConnection;

enum class ReplyResult {
    sent,            // written or queued for the peer
    connectionGone,  // the connection is closed (or closed because of this reply); nothing will reach the peer
    tooLarge,        // the encoding passes kMaxPayloadSize: nothing was sent, the message is still unanswered
};

// One request read from a peer, with the means to answer it once. Answering
// it, or dropping it unanswered, frees its place in the connection's quota
// and its decoded bytes in the budget.
class IncomingMessage {
public:
    IncomingMessage(std::weak_ptr<PeerConnection> connection, std::uint64_t id, Value body,
                    std::shared_ptr<ReceiveBudget> budget, std::size_t decodedBytes);
    ~IncomingMessage();
    IncomingMessage(IncomingMessage&& other) noexcept;
    IncomingMessage& operator=(IncomingMessage&&) = delete;
    IncomingMessage(const IncomingMessage&) = delete;
    IncomingMessage& operator=(const IncomingMessage&) = delete;

    const Value& body() const noexcept { return body_; }
    std::uint64_t id() const noexcept { return id_; }

    // Sends the reply from the calling thread without blocking. `sent` and
    // `connectionGone` answer the message; after `tooLarge` it is still
    // unanswered and a smaller reply (an error) may follow. Answering twice is
    // a programming error.
    ReplyResult reply(const Value& reply);
    bool replied() const noexcept { return answered_; }

private:
    void finish();

    std::weak_ptr<PeerConnection> connection_;
    std::uint64_t id_;
    Value body_;
    std::shared_ptr<ReceiveBudget> budget_;
    std::size_t decodedBytes_;
    bool answered_ = false;
};

struct ConnectionEvent {
    enum class Kind { message, invalid };
    Kind kind;
    std::optional<IncomingMessage> message;  // for `message`
    std::string reason;                      // for `invalid`
};

class PeerConnection final : public EventSource,
                             public ReceiveBudget::Member,
                             public std::enable_shared_from_this<PeerConnection> {
public:
    using EventHandler = std::function<void(ConnectionEvent&&)>;

    // Takes an accepted socket and the identity captured right after accept
    // (capturePeerIdentity); without one, the connection never delivers a
    // message. The budget is the process's (the listener's).
    static std::shared_ptr<PeerConnection> adopt(EventLoop& loop, UniqueFd socket,
                                                 std::optional<PeerIdentity> identity,
                                                 std::shared_ptr<ReceiveBudget> budget,
                                                 std::function<void()> onClosed);
    ~PeerConnection() override;

    // Fixed at accept, for the connection's whole life.
    const std::optional<PeerIdentity>& identity() const noexcept { return identity_; }
    // The pid the socket named at accept (the identity's when there is one),
    // kept after the connection closes.
    pid_t pid() const noexcept { return pid_; }
    // The identity's executable path.
    std::optional<std::string> peerExecutablePath() const;

    // Set before resume(). The context is kept until the connection closes.
    void setEventHandler(EventHandler handler);
    void setContext(std::shared_ptr<void> context);
    // Starts reading and delivering events (on the loop thread).
    void resume();

    // Closes the connection from any thread; the loop then delivers `invalid`.
    void invalidate(const std::string& reason);
    bool isValid() const noexcept { return !closed_.load(); }

    // What the connection holds of frames not decoded yet, and the storage
    // that takes (diagnostics and tests; any thread).
    std::size_t bufferedBytes() const noexcept { return bufferedBytes_.load(); }
    std::size_t bufferCapacity() const noexcept { return bufferCapacity_.load(); }

    std::string description() const override;

    // Connections of this process whose replies wait, in part, in their
    // backlog: an ending daemon flushes until none does.
    static std::size_t connectionsWithUnsentReplies() noexcept;

    void handleEvents(std::uint32_t events) override;

private:
    friend class IncomingMessage;

    // Why reading stopped; each has its own way back.
    enum class Wait : std::uint8_t {
        none,
        unanswered,     // 64 requests in flight: the next answer resumes it
        partialBudget,  // the budget's queues resume these
        decodedBudget,
    };

    PeerConnection(EventLoop& loop, UniqueFd socket, std::optional<PeerIdentity> identity,
                   std::shared_ptr<ReceiveBudget> budget, std::function<void()> onClosed);
    // Sends what the socket takes now; what it does not, waits in the
    // backlog, which then takes the frame's storage.
    ReplyResult sendFrame(Bytes& frame);
    void releaseRequestSlot();
    void postResumeAfterAnswer();
    Wait receive(bool& hungUp);
    Wait deliverFrames();
    void consumeBuffered(std::size_t count, bool frameCompleted);
    void waitFor(Wait wait);
    void resumeReceiving() override;
    std::size_t unfinishedBytes() const override { return frames_.size(); }
    void dropStalled(const std::string& reason) override { closeNow(reason); }
    void flushBacklog();
    void updateInterestLocked();
    void closeNow(const std::string& reason);

    EventLoop& loop_;
    UniqueFd socket_;
    const std::optional<PeerIdentity> identity_;
    const pid_t pid_;
    const uid_t uid_;
    const std::shared_ptr<ReceiveBudget> budget_;
    std::function<void()> onClosed_;
    EventLoop::RegistrationId registration_ = 0;
    OpenTransaction openTransaction_;

    // Loop thread only.
    EventHandler handler_;
    std::shared_ptr<void> context_;
    IncomingFrames frames_;

    std::atomic<std::size_t> bufferedBytes_{0};
    std::atomic<std::size_t> bufferCapacity_{0};
    std::atomic<Wait> waitingFor_{Wait::none};  // written on the loop thread
    std::atomic<int> unanswered_{0};
    std::atomic<bool> closed_{false};

    // Guarded by writeMutex_: the socket for writing, the backlog, the interest set.
    mutable std::mutex writeMutex_;
    std::deque<Bytes> backlog_;
    static std::atomic<std::size_t> connectionsWithUnsentReplies_;
    std::size_t frontWritten_ = 0;      // bytes of backlog_.front() already sent
    std::size_t backlogBytes_ = 0;      // bytes of backlog_ after the front frame
    bool readingPaused_ = false;
    bool registered_ = false;
    std::string pendingInvalidReason_;
};

}  // namespace qm::duct
